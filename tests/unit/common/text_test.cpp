#include "common/text.h"

#include <ostream>

#include "support/fixture.h"

namespace pelorus::support {
namespace {

struct ReplaceRow {
    const char* name;
    const char* subject;
    const char* search;
    const char* replace;
    const char* wanted;
};

void PrintTo(const ReplaceRow& row, std::ostream* out) {
    *out << row.name;
}

class ReplaceAll : public ::testing::TestWithParam<ReplaceRow> {};

TEST_P(ReplaceAll, GoesFromLeftToRightOnce) {
    std::string subject = GetParam().subject;
    replaceAll(subject, GetParam().search, GetParam().replace);
    EXPECT_EQ(subject, GetParam().wanted);
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    ReplaceAll,
    ::testing::Values(ReplaceRow{"AllOccurrences", "a-b-a", "a", "xy", "xy-b-xy"},
                      ReplaceRow{"ReplacementsAreNotSearched", "aa", "a", "aa", "aaaa"},
                      ReplaceRow{"OverlapsCountOnce", "aaa", "aa", "b", "ba"},
                      ReplaceRow{"AnEmptySearchDoesNothing", "abc", "", "x", "abc"}),
    RowName{});

struct ScanRow {
    const char* name;
    const char* text;
    bool isInt;
    int asInt;
    bool isLong;
    long asLong;
    bool isUnsigned;
    unsigned asUnsigned;
};

void PrintTo(const ScanRow& row, std::ostream* out) {
    *out << row.name;
}

class Scan : public ::testing::TestWithParam<ScanRow> {};

// Values that are refused keep what they had: 77.
TEST_P(Scan, ReadsLikeScanf) {
    const ScanRow& row = GetParam();
    int asInt = 77;
    long asLong = 77;
    unsigned asUnsigned = 77;
    EXPECT_EQ(scanInt(row.text, asInt), row.isInt);
    EXPECT_EQ(scanLong(row.text, asLong), row.isLong);
    EXPECT_EQ(scanUnsigned(row.text, asUnsigned), row.isUnsigned);
    EXPECT_EQ(asInt, row.asInt);
    EXPECT_EQ(asLong, row.asLong);
    EXPECT_EQ(asUnsigned, row.asUnsigned);
    EXPECT_EQ(leadingInt(row.text), row.isInt ? row.asInt : 0);
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    Scan,
    ::testing::Values(
        ScanRow{"BlanksBefore", " \t\n8", true, 8, true, 8, true, 8},
        ScanRow{"LettersBehind", "80x", true, 80, true, 80, true, 80},
        ScanRow{"APlusSign", "+5", true, 5, true, 5, true, 5},
        ScanRow{"ALeadingZeroIsDecimal", "010", true, 10, true, 10, true, 10},
        ScanRow{"HexadecimalEndsAtTheX", "0x10", true, 0, true, 0, true, 0},
        ScanRow{"AMinusSignWraps", "-1", true, -1, true, -1, true, 4294967295U},
        ScanRow{"Nothing", "", false, 77, false, 77, false, 77},
        ScanRow{"OnlyASign", "-", false, 77, false, 77, false, 77},
        ScanRow{"LettersFirst", "x80", false, 77, false, 77, false, 77},
        ScanRow{"TooLargeForInt", "2147483648", false, 77, true, 2147483648L, true, 2147483648U},
        ScanRow{"TooLargeForUnsigned", "4294967296", false, 77, true, 4294967296L, false, 77},
        ScanRow{"TooLargeForLong", "9223372036854775808", false, 77, false, 77, false, 77}),
    RowName{});

}  // namespace
}  // namespace pelorus::support
