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

bool scanInt64(const char* text, std::int64_t& value) {
    char* end = nullptr;
    errno = 0;
    const long long number = std::strtoll(text, &end, 10);
    if (end == text || errno == ERANGE) return false;
    value = number;
    return true;
}

bool scanInt(const char* text, int& value) {
    std::int64_t number = 0;
    if (!scanInt64(text, number)) return false;
    if (number < std::numeric_limits<int>::min() || number > std::numeric_limits<int>::max()) {
        return false;
    }
    value = static_cast<int>(number);
    return true;
}

bool scanUnsigned(const char* text, unsigned& value) {
    char* end = nullptr;
    errno = 0;
    const long long number = std::strtoll(text, &end, 10);
    if (end == text || errno == ERANGE) return false;
    constexpr auto kMost = static_cast<long long>(std::numeric_limits<unsigned>::max());
    if (number < -kMost || number > kMost) return false;
    value = static_cast<unsigned>(number);
    return true;
}

int leadingInt(const std::string& text) {
    int value = 0;
    return scanInt(text.c_str(), value) ? value : 0;
}

}  // namespace pelorus
