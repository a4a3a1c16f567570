#include "config/setting_line.h"

#include <gtest/gtest.h>

namespace pelorus {
namespace {

TEST(SettingLine, IsSplitIntoKeyAndValue) {
    const char* const rows[][3]{{" \t KEY= \tvalue \t\n", "KEY", "value"},
                                {"KEY = v", "KEY ", "v"},
                                {"KEY=\"a \"b\" \"", "KEY", "a \"b"},
                                {"KEY=\"v\"\r\n", "KEY", "v\"\r"},
                                {"KEY= \"\" \n", "KEY", ""},
                                {"=A=b=c", "=A", "b=c"},
                                {"  =v", "", "v"},
                                {"KEY\n", "", ""}};
    for (const auto& [line, key, value] : rows) {
        EXPECT_EQ(parseSettingLine(line).key, key) << line;
        EXPECT_EQ(parseSettingLine(line).value, value) << line;
    }
}

}  // namespace
}  // namespace pelorus
