// What the connection code calls its mappings.
#ifndef PELORUS_CONNECTION_MAPPING_NAMES_H
#define PELORUS_CONNECTION_MAPPING_NAMES_H

namespace pelorus {

inline constexpr const char* kTcp = "TCP";
inline constexpr const char* kHttpDescription = "Kavra";
inline constexpr const char* kHttpsDescription = "KavraSSL";

/// DEVICETYPE of a device that is itself the maker's router.
inline constexpr int kMakersRouter = 5;

}  // namespace pelorus

#endif
