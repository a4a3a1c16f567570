// What the connection code calls its mappings.
#ifndef PELORUS_CONNECTION_MAPPING_NAMES_H
#define PELORUS_CONNECTION_MAPPING_NAMES_H

namespace pelorus {

inline constexpr const char* kTcp = "TCP";
inline constexpr const char* kHttpDescription = "Kavra";
inline constexpr const char* kHttpsDescription = "KavraSSL";

}  // namespace pelorus

#endif
