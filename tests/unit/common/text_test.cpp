#include "common/text.h"

#include <array>
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

struct ScanRow {
    const char* name;
    const char* text;
    std::optional<int> asInt{};
    std::optional<std::int64_t> asInt64{};
    std::optional<unsigned> asUnsigned{};
};

class Scan : public ::testing::TestWithParam<ScanRow> {};

// What is refused leaves the variable alone.
TEST_P(Scan, ReadsLikeScanf) {
    const ScanRow& row = GetParam();
    int asInt = 77;
    std::int64_t asInt64 = 77;
    unsigned asUnsigned = 77;
    EXPECT_EQ(scanInt(row.text, asInt), row.asInt.has_value());
    EXPECT_EQ(scanInt64(row.text, asInt64), row.asInt64.has_value());
    EXPECT_EQ(scanUnsigned(row.text, asUnsigned), row.asUnsigned.has_value());
    EXPECT_EQ(asInt, row.asInt.value_or(77));
    EXPECT_EQ(asInt64, row.asInt64.value_or(77));
    EXPECT_EQ(asUnsigned, row.asUnsigned.value_or(77));
    EXPECT_EQ(leadingInt(row.text), row.asInt.value_or(0));
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    Scan,
    ::testing::Values(ScanRow{"BlanksBeforeAndLettersBehind", " \t\n80x", 80, 80, 80},
                      ScanRow{"ALeadingZeroIsDecimal", "+010", 10, 10, 10},
                      ScanRow{"HexadecimalEndsAtTheX", "0x10", 0, 0, 0},
                      ScanRow{"AMinusSignWraps", "-1", -1, -1, 4294967295U},
                      ScanRow{"Nothing", ""},
                      ScanRow{"LettersFirst", "x80"},
                      ScanRow{"TooLargeForInt", "2147483648", std::nullopt, 2147483648,
                              2147483648U},
                      ScanRow{"TooLargeForUnsigned", "4294967296", std::nullopt, 4294967296},
                      ScanRow{"TooLargeForInt64", "9223372036854775808"}),
    RowName{});

}  // namespace
}  // namespace pelorus::support
