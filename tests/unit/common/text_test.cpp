#include "common/text.h"

#include <array>
#include <cerrno>
#include <optional>

#include "support/fixture.h"

namespace pelorus::support {
namespace {

TEST(ReplaceAll, GoesFromLeftToRightOnce) {
    const std::array<std::array<const char*, 4>, 4> rows{{{"a-b-a", "a", "xy", "xy-b-xy"},
                                                          {"aa", "a", "aa", "aaaa"},
                                                          {"aaa", "aa", "b", "ba"},
                                                          {"abc", "", "x", "abc"}}};
    for (const auto& [text, search, replace, wanted] : rows) {
        std::string subject = text;
        replaceAll(subject, search, replace);
        EXPECT_EQ(subject, wanted);
    }
}

// What a reader leaves in a variable that held 77; nothing when it refuses and touches nothing.
TEST(Scan, ReadsLikeScanf) {
    struct Row {
        const char* text;
        std::optional<int> asInt{};
        std::optional<std::int64_t> asInt64{};
        std::optional<unsigned> asUnsigned{};
    };
    for (const Row& row :
         std::initializer_list<Row>{{" \t\n80x", 80, 80, 80},
                                    {"+010", 10, 10, 10},
                                    {"0x10", 0, 0, 0},
                                    {"-1", -1, -1, 4294967295U},
                                    {""},
                                    {"x80"},
                                    {"-2147483648", -2147483647 - 1, -2147483648, 2147483648U},
                                    {"2147483648", std::nullopt, 2147483648, 2147483648U},
                                    {"4294967296", std::nullopt, 4294967296},
                                    {"9223372036854775808"}}) {
        errno = ERANGE;  // of an earlier call
        EXPECT_EQ(scanInt(row.text), row.asInt) << row.text;
        EXPECT_EQ(scanInt64(row.text), row.asInt64) << row.text;
        EXPECT_EQ(scanUnsigned(row.text), row.asUnsigned) << row.text;
        EXPECT_EQ(leadingInt(row.text), row.asInt.value_or(0)) << row.text;
    }
}

}  // namespace
}  // namespace pelorus::support
