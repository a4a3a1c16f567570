// Looking names up.
#ifndef PELORUS_DOCTOR_RESOLVER_H
#define PELORUS_DOCTOR_RESOLVER_H

#include <string>
#include <vector>

namespace pelorus::doctor {

inline constexpr const char* kSilentNameServer = "the name server does not answer";

struct Lookup {
    std::vector<std::string> addresses;  ///< as the resolver sorts them
    std::string obstacle;                ///< why there is none, in a few words
    bool noServer = false;               ///< no name server helps; other names will not do better
};

/// Shortens the resolver's patience for this process: a silent name server would take all the time
/// there is.
void hurryResolver();

[[nodiscard]] Lookup lookUp(const std::string& host);

/// True for an address of this device itself, loopback addresses included.
[[nodiscard]] bool isThisDevice(const std::string& address);

}  // namespace pelorus::doctor

#endif
