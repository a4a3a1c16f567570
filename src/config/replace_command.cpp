#include "config/replace_command.h"

#include <string_view>

namespace pelorus {

namespace {

// For use between single quotes.
std::string escapedForShell(const std::string& text) {
    std::string escaped;
    for (const char c : text) {
        if (c == '\'') {
            escaped += "'\\''";
        } else {
            escaped += c;
        }
    }
    return escaped;
}

// Puts a backslash before each backslash and each character of @p special.
std::string escapedForSed(const std::string& text, std::string_view special) {
    std::string escaped;
    for (const char c : text) {
        if (c == '\\' || special.find(c) != std::string_view::npos) escaped += '\\';
        escaped += c;
    }
    return escaped;
}

std::string pathForShell(const std::string& path) {
    constexpr const char* kPlain =
        "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789_/.-+,:@";
    if (path.find_first_not_of(kPlain) == std::string::npos) return path;
    return "'" + escapedForShell(path) + "'";
}

}  // namespace

std::string replaceCommand(const std::string& key,
                           const std::string& oldValue,
                           const std::string& value,
                           const std::string& path) {
    const std::string from = escapedForSed(key + "=" + oldValue, "/.*[]^$");
    const std::string to = escapedForSed(key + "=" + value, "/&");
    return "sed -i 's/" + escapedForShell(from) + "/" + escapedForShell(to) + "/g' " +
           pathForShell(path);
}

}  // namespace pelorus
