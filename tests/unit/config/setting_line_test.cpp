#include "config/setting_line.h"

#include "support/fixture.h"

namespace pelorus::support {
namespace {

struct Row {
    const char* name;
    std::string_view line;
    std::string_view key;
    std::string_view value;
};

class SettingLine : public ::testing::TestWithParam<Row> {};

TEST_P(SettingLine, IsSplit) {
    const Setting setting = parseSettingLine(GetParam().line);
    EXPECT_EQ(setting.key, GetParam().key);
    EXPECT_EQ(setting.value, GetParam().value);
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    SettingLine,
    ::testing::Values(Row{"BlanksAroundTheLineGo", " \t KEY= \tvalue \t\n", "KEY", "value"},
                      Row{"ABlankBeforeTheEqualsSignStays", "KEY = v", "KEY ", "v"},
                      Row{"QuotesAroundTheValueGo", "KEY=\"a \"b\" \"", "KEY", "a \"b"},
                      Row{"ACarriageReturnStays", "KEY=\"v\"\r\n", "KEY", "v\"\r"},
                      Row{"AValueOfBlanksAndQuotesIsEmpty", "KEY= \"\" \n", "KEY", ""},
                      Row{"FurtherEqualsSignsBelongToTheValue", "KEY=a=b", "KEY", "a=b"},
                      Row{"ALeadingEqualsSignBelongsToTheKey", "=A=b", "=A", "b"},
                      Row{"BlanksAloneAreNoKey", "  =v", "", "v"},
                      Row{"WithoutEqualsSignItIsNoSetting", "KEY\n", "", ""},
                      Row{"ThereAreNoComments", "#K\x80=\x01", "#K\x80", "\x01"}),
    RowName{});

}  // namespace
}  // namespace pelorus::support
