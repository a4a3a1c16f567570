// What the log shows in place of a secret.
#ifndef PELORUS_COMMON_MASKS_H
#define PELORUS_COMMON_MASKS_H

namespace pelorus {

inline constexpr const char* STRIPPED_DEVID_VAL = "*ID_REMOVED*";
inline constexpr const char* STRIPPED_DEVAUTH_VAL = "*AUTH_REMOVED*";
inline constexpr const char* STRIPPED_SUBDOMAIN_VAL = "*SUBDOMAIN_REMOVED*";

}  // namespace pelorus

#endif
