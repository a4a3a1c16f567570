// Which addresses are this device's own.
#ifndef PELORUS_COMMON_OWN_ADDRESS_H
#define PELORUS_COMMON_OWN_ADDRESS_H

#include <netinet/in.h>

namespace pelorus {

/// True for an IPv4 @p address that reaches this device itself: 0/8, 127/8, and the address of any
/// interface, whatever its state.
[[nodiscard]] bool isOwnAddress(in_addr address);

}  // namespace pelorus

#endif
