// Changing one setting in a file with sed.
#ifndef PELORUS_CONFIG_REPLACE_COMMAND_H
#define PELORUS_CONFIG_REPLACE_COMMAND_H

#include <string>

namespace pelorus {

/// The shell command that replaces KEY=oldValue by KEY=value everywhere in the file @p path.
/// Neither the shell nor sed interprets any character of the key, the values or the path. A line
/// feed in a value is not supported.
[[nodiscard]] std::string replaceCommand(const std::string& key,
                                         const std::string& oldValue,
                                         const std::string& value,
                                         const std::string& path);

}  // namespace pelorus

#endif
