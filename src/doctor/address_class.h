// What kind of IPv4 address a gateway has.
#ifndef PELORUS_DOCTOR_ADDRESS_CLASS_H
#define PELORUS_DOCTOR_ADDRESS_CLASS_H

#include <string>

namespace pelorus::doctor {

enum class AddressClass {
    NONE,      ///< no address at all: empty, unreadable, or in 0.0.0.0/8
    HOME,      ///< of a private network
    RESERVED,  ///< of no use in the internet for another reason: loopback, link-local, multicast
    SHARED,    ///< between a provider and its customers: 100.64.0.0/10, and 192.0.0.0/29 of DS-Lite
    PUBLIC,
};

/// The class of an address in dotted form.
[[nodiscard]] AddressClass classOf(const std::string& address);

/// True for an address that a host in a home can have: private or link-local.
[[nodiscard]] bool isAtHome(const std::string& address);

}  // namespace pelorus::doctor

#endif
