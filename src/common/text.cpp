#include "common/text.h"

#include <cerrno>
#include <cstdlib>
#include <limits>

namespace pelorus {

bool contains(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

void replaceAll(std::string& subject, const std::string& search, const std::string& replace) {
    if (search.empty()) return;
    for (std::size_t at = subject.find(search); at != std::string::npos;
         at = subject.find(search, at + replace.size())) {
        subject.replace(at, search.size(), replace);
    }
}

std::optional<std::int64_t> scanInt64(const char* text) {
    if (text == nullptr) return std::nullopt;
    char* end = nullptr;
    errno = 0;
    const std::int64_t number = std::strtoll(text, &end, 10);
    if (end == text || errno == ERANGE) return std::nullopt;
    return number;
}

std::optional<int> scanInt(const char* text) {
    const auto number = scanInt64(text);
    if (!number || *number < std::numeric_limits<int>::min() ||
        *number > std::numeric_limits<int>::max()) {
        return std::nullopt;
    }
    return static_cast<int>(*number);
}

std::optional<unsigned> scanUnsigned(const char* text) {
    constexpr std::int64_t kMax = std::numeric_limits<unsigned>::max();
    const auto number = scanInt64(text);
    if (!number || *number < -kMax || *number > kMax) return std::nullopt;
    return static_cast<unsigned>(*number);
}

int leadingInt(const std::string& text) {
    return scanInt(text.c_str()).value_or(0);
}

}  // namespace pelorus
