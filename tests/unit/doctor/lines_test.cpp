#include "doctor/lines.h"

#include <gtest/gtest.h>

namespace pelorus::doctor {
namespace {

using Lines = std::vector<std::string>;

TEST(Wrap, BreaksAtBlanksAndWithinWordsThatAreTooLong) {
    const std::pair<const char*, Lines> rows[]{
        {"", {""}},
        {" \n\t ", {""}},
        {"12345678", {"12345678"}},
        {" one  two\nthree", {"one two", "three"}},
        {"a 1234567890123456789 b", {"a", "12345678", "90123456", "789 b"}},
        {"\xC3\xA4\xC3\xA4\xC3\xA4\xC3\xA4 \xC3\xB6\xC3\xB6\xC3\xB6 x",
         {"\xC3\xA4\xC3\xA4\xC3\xA4\xC3\xA4 \xC3\xB6\xC3\xB6\xC3\xB6", "x"}}};
    for (const auto& [text, wanted] : rows) EXPECT_EQ(wrap(text, 8), wanted) << text;
    EXPECT_EQ(hang("Why  ", "one two three", 13), (Lines{"Why  one two", "     three"}));
}

TEST(Printable, KeepsUtf8AndReplacesTheRest) {
    const std::pair<std::string, std::string> rows[]{{"a\xC3\xA4 \xF0\x9F\x98\x80", ""},
                                                     {"\xE4 b", "? b"},
                                                     {"\x1B[1m", "?[1m"},
                                                     {"\xC0\xAF", "??"},
                                                     {"\xED\xA0\x80", "???"},
                                                     {"cut \xE2\x82", "cut ??"},
                                                     {std::string{"\0x", 2}, "?x"},
                                                     {"\xEF\xBF\xBE", "???"}};
    for (const auto& [text, marked] : rows) {
        std::string wanted;
        for (const char letter : marked) {
            wanted += letter == '?' ? std::string{"\xEF\xBF\xBD"} : std::string{letter};
        }
        EXPECT_EQ(printable(text), marked.empty() ? text : wanted) << text;
    }
}

}  // namespace
}  // namespace pelorus::doctor
