#include "config/setting_line.h"

#include <gtest/gtest.h>

namespace pelorus {
namespace {

TEST(SettingLine, IsSplitIntoKeyAndValue) {
    struct Row {
        const char* line;
        const char* key;
        const char* value;
    };
    for (const auto& [line, key, value] :
         std::initializer_list<Row>{{" \t KEY= \tvalue \t\n", "KEY", "value"},
                                    {"KEY = v", "KEY ", "v"},
                                    {"KEY=\"a \"b\" \"", "KEY", "a \"b"},
                                    {"KEY=\"v\"\r\n", "KEY", "v\"\r"},
                                    {"KEY= \"\" \n", "KEY", ""},
                                    {"KEY=a=b", "KEY", "a=b"},
                                    {"=A=b", "=A", "b"},
                                    {"  =v", "", "v"},
                                    {"KEY\n", "", ""},
                                    {"#K\x80=\x01", "#K\x80", "\x01"}}) {
        EXPECT_EQ(parseSettingLine(line).key, key) << line;
        EXPECT_EQ(parseSettingLine(line).value, value) << line;
    }
}

}  // namespace
}  // namespace pelorus
