#include "common/text.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <optional>

namespace pelorus {
namespace {

TEST(ReplaceAll, GoesFromLeftToRightOnce) {
    const char* const rows[][4]{
        {"a-b-a", "a", "xy", "xy-b-xy"}, {"aa", "a", "aa", "aaaa"}, {"abc", "", "x", "abc"}};
    for (const auto& [text, search, replace, wanted] : rows) {
        std::string subject = text;
        replaceAll(subject, search, replace);
        EXPECT_EQ(subject, wanted);
    }
}

template <typename Number>
std::string shown(std::optional<Number> number) {
    return number ? std::to_string(*number) + " " : "- ";
}

TEST(Scan, ReadsLikeScanf) {
    const std::pair<const char*, std::string> rows[]{
        {" \t\n80x", "80 80 80 80"},
        {"+010", "10 10 10 10"},
        {"-1", "-1 -1 4294967295 -1"},
        {"x80", "- - - 0"},
        {"-2147483648", "-2147483648 -2147483648 2147483648 -2147483648"},
        {"2147483648", "- 2147483648 2147483648 0"},
        {"4294967296", "- 4294967296 - 0"},
        {"9223372036854775808", "- - - 0"}};
    for (const auto& [text, wanted] : rows) {
        errno = ERANGE;  // of an earlier call
        EXPECT_EQ(shown(scanInt(text)) + shown(scanInt64(text)) + shown(scanUnsigned(text)) +
                      std::to_string(leadingInt(text)),
                  wanted);
    }
}

}  // namespace
}  // namespace pelorus
