#include "doctor/history_picture.h"

#include <gtest/gtest.h>

#include <regex>

#include "doctor/time_axis.h"
#include "made_up_diagnosis.h"

namespace pelorus::doctor {
namespace {

// The texts of a picture, if each of its elements is one line and all are closed.
std::vector<std::string> textsOf(const std::string& svg) {
    const std::regex whole{
        R"re(<svg [^<>&]*>\n(  <(rect|line)( [a-z0-9-]+="[^"<>&]*")* />\n|  <text( [a-z0-9-]+="[^"<>&]*")*>([^<>&\n]|&(amp|lt|gt);)*</text>\n)*</svg>\n)re"};
    std::vector<std::string> texts;
    // The library's matching recurses for each character: line by line.
    std::size_t from = svg.find('\n') + 1;
    const std::string head = svg.substr(0, from), tail = "</svg>\n";
    for (std::size_t end = 0; (end = svg.find('\n', from)) != std::string::npos; from = end + 1) {
        const std::string line = svg.substr(from, end + 1 - from);
        if (line == tail) continue;
        EXPECT_TRUE(std::regex_match(head + line + tail, whole)) << line;
        const std::size_t start = line.find('>') + 1;
        const std::size_t close = line.find("</text>");
        if (close != std::string::npos) texts.push_back(line.substr(start, close - start));
    }
    EXPECT_EQ(svg.substr(svg.size() - tail.size()), tail);
    return texts;
}

std::size_t count(const std::vector<std::string>& texts, const std::string& text) {
    return static_cast<std::size_t>(std::count(texts.begin(), texts.end(), text));
}

TEST(HistoryPicture, ShowsSharesCausesAndWhenTheySetIn) {
    const auto texts = textsOf(historyPicture(relayed()));
    for (const char* text :
         {"direct 99 %, 12 days", "relayed 1 %, 3 h 20 min", "ports forwarded",
          "second router found by the port test", "10 Nov 12:07, direct for 12 days",
          "22 Nov 12:07, relayed for 3 h 20 min", "14 Nov"}) {
        EXPECT_EQ(count(texts, text), 1U) << text;
    }
    EXPECT_EQ(count(texts, "1") + count(texts, "2"), 4U) << "on the band and in the list";
}

TEST(HistoryPicture, ListsManyCausesInBounds) {
    Diagnosis diagnosis = relayed();
    diagnosis.history.clear();
    diagnosis.untold = {"the periods before"};
    for (int number = 0; number < 600; ++number) {
        const std::string text = number < 100 ? "cause " + std::to_string(number) : "no answer";
        diagnosis.history.push_back({Reach::RELAYED, diagnosis.now - minutes{600 - number}, "",
                                     text + " after " + std::to_string(number) + " ms"});
    }
    const auto texts = textsOf(historyPicture(diagnosis));
    EXPECT_EQ(count(texts, "cause 39 after some ms"), 1U);
    EXPECT_EQ(count(texts, "and 61 more: see --json"), 1U);
    EXPECT_EQ(texts.back(), "Unknown: the periods before");
}

constexpr Reach kAll[]{Reach::DIRECT,       Reach::RELAYED,     Reach::NOT_REACHED,
                       Reach::SWITCHED_OFF, Reach::NOT_RUNNING, Reach::UNKNOWN};

TEST(HistoryPicture, IsWellFormedWhateverHappened) {
    Diagnosis diagnosis;
    diagnosis.now = noonish();
    EXPECT_EQ(textsOf(historyPicture(diagnosis)).back(), "No change of its status is known.");
    diagnosis.since = diagnosis.now;
    EXPECT_EQ(count(textsOf(historyPicture(diagnosis)), "unknown 100 %, 0 s"), 1U);
    for (int number = 0; number < 200; ++number) {
        const seconds age{number % 3 == 0 ? 4'000'000 - number * 2 : 100'000 - number * 500};
        diagnosis.history.push_back(
            {kAll[number % 6], diagnosis.now - age, "",
             number % 5 == 0 ? "" : "a<b>&\"\x1B\xFF " + std::string(70, 'x')});
    }
    const auto texts = textsOf(historyPicture(diagnosis));
    EXPECT_GT(count(texts, "a&lt;b&gt;&amp;\" \xEF\xBF\xBD"), 1U);
}

TEST(TimeTicks, AreAtRoundLocalTimes) {
    struct Row {
        seconds span;
        std::string first, last;
        std::size_t count;
    };
    const Row rows[]{
        {seconds{0}, "15:27", "15:27", 1},       {seconds{40}, "15:26:20", "15:27", 9},
        {minutes{90}, "14:00", "15:20", 9},      {hours{30}, "12:00", "15:00", 10},
        {hours{24 * 12}, "12 Nov", "22 Nov", 6}, {hours{24 * 60}, "30 Sep", "18 Nov", 8},
        {hours{24 * 365 * 40}, "", "", 10}};
    const Time end = noonish();
    for (const Row& row : rows) {
        const auto ticks = timeTicks(end - row.span, end, 12);
        ASSERT_EQ(ticks.size(), row.count) << row.span.count();
        if (row.first.empty()) continue;
        EXPECT_EQ(ticks.front().label, row.first);
        EXPECT_EQ(ticks.back().label, row.last);
    }
}

}  // namespace
}  // namespace pelorus::doctor
