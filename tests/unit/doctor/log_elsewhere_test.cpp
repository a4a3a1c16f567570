#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "logged_lines.h"

namespace pelorus::doctor {
namespace {

// Without progress, a log from elsewhere leaves much open.
TEST(LogElsewhere, TellsNoMoreThanItsLinesCarry) {
    constexpr int kDay = 86400;
    const std::string direct = "9 direct: the ports passed their test and were published|";
    const char* const byHand =
        "TavikClient::testPort[1] - port check failed, retrying in 5 seconds, url:  "
        "[https://x/?external_ip=&port=8081].";
    const char* const mapped =
        "TavikClient::testPort[1] - port check failed, retrying in 5 seconds, url:  "
        "[https://x/?external_ip=203.0.113.7&port=9091].";
    const struct {
        const char* name;
        Lines lines;
        int end;  // of the log
        std::string history;
        std::vector<Sign> signs;
        std::string untold;  // begins with this
    } rows[]{
        {"silence in spite of progress",
         {{0, kStart}, {9, kPublished}, {10, kPause}},
         kDay,
         direct + "10 ?: the daemon logged nothing more|",
         {},
         ""},
        {"a pause", {{0, kStart}, {9, kPublished}, {10, kPause}}, 3600, direct, {}, ""},
        {"silence without progress", {{0, kStart}, {9, kPublished}}, kDay, direct, {}, ""},
        {"a start, and nothing more",
         {{0, kStart}},
         kDay,
         "0 not reached: the daemon started|",
         {},
         ""},
        {"a test of ports forwarded by hand, without a gateway",
         {{0, kTunnelStarts}, {90, kNoUpnp}, {93, kFailedAnswer}, {93, byHand}, {93, kTestFailed}},
         400,
         "0 relayed: the tunnel came up|",
         {Sign::MANUAL_MODE, Sign::LOGGED_TEST_FAILED},
         ""},
        {"a test of ports forwarded by hand, or of one published before the log begins",
         {{0, kNoUpnp}, {3, kFailedAnswer}, {3, byHand}, {3, kTestFailed}},
         9,
         "",
         {},
         "why the port test fails: "},
        {"and a second one, which a published port would not have had",
         {{0, kNoUpnp},
          {3, byHand},
          {3, kTestFailed},
          {130, kNoUpnp},
          {133, byHand},
          {133, kTestFailed}},
         140,
         "",
         {Sign::MANUAL_MODE, Sign::LOGGED_TEST_FAILED},
         ""},
        {"a test of ports that were mapped",
         {{0, kNoUpnp}, {3, kFailedAnswer}, {3, mapped}, {3, kTestFailed}},
         9,
         "",
         {Sign::LOGGED_TEST_FAILED},
         ""},
        {"a test, and none for hours in which a gateway may have gone",
         {{0, kNoUpnp}, {3, kFailedAnswer}, {3, kTestFailed}, {kDay, kNoUpnp}},
         kDay,
         "",
         {},
         "whether the gateway still speaks NAT-PMP: "},
        {"a second router, and no test for hours",
         {{0, kNoUpnp}, {3, kSecondNatAnswer}, {3, kSecondNat}, {kDay, kNoUpnp}},
         kDay,
         "",
         {Sign::LOGGED_SECOND_NAT},
         ""},
        {"a port that opens, and one that the gateway refuses, in each search",
         {{0, kNoUpnp},
          {2, kPassed},
          {3, kRefused},
          {130, kNoUpnp},
          {132, kPassed},
          {133, kRefused}},
         400,
         "",
         {Sign::LOGGED_GATEWAY_REFUSES},
         ""},
        {"NAT-PMP, then ports by hand that are none",
         {{0, kStart},
          {5, kNoUpnp},
          {8, kPassed},
          {9, kPublished},
          {kDay, kNoUpnp},
          {kDay, kNoPort},
          {kDay, kTunnelStarts}},
         kDay + 400,
         "9 direct 203.0.113.7: the ports passed their test and were published|86400 relayed: the "
         "manual HTTP port is not a port number|",
         {Sign::MANUAL_MODE, Sign::LOGGED_MANUAL_PORT_INVALID},
         ""},
        {"ports forwarded by hand, then automatic ones without a gateway",
         {{0, kStart},
          {5, kNoUpnp},
          {8, kPassed},
          {9, kPublished},
          {kDay, kNoUpnp},
          {kDay, kTunnelStarts}},
         kDay + 400,
         "9 direct 203.0.113.7: the ports passed their test and were published|86400 relayed: no "
         "gateway answers UPnP|",
         {Sign::LOGGED_NO_GATEWAY},
         ""},
        {"without a gateway, a published port is tested in every cycle",
         {{0, kPassed}, {130, kPassed}, {260, kPassed}, {390, kPassed}, {520, kPassed}},
         521,
         "0 direct 203.0.113.7: |",
         {},
         ""},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        const Evidence evidence = told(row.lines, row.end, true);
        EXPECT_EQ(historyOf(evidence), row.history);
        std::vector<Sign> signs;
        for (const auto& [sign, fact] : evidence.signs) signs.push_back(sign);
        EXPECT_EQ(signs, row.signs);
        const std::string unsaid = evidence.untold.empty() ? "" : evidence.untold.back();
        EXPECT_EQ(unsaid.substr(0, row.untold.empty() ? unsaid.npos : row.untold.size()),
                  row.untold);
    }
}

}  // namespace
}  // namespace pelorus::doctor
