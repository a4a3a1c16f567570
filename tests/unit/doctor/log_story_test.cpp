#include "doctor/log_story.h"

#include <gtest/gtest.h>

#include <vector>

#include "logged_lines.h"

namespace pelorus::doctor {
namespace {

TEST(LogStory, HistoryAndSigns) {
    const std::string direct =
        "direct 203.0.113.7: the ports passed their test and were published|";
    const struct {
        const char* name;
        Lines lines;
        std::string history;
        std::vector<Sign> signs;
    } rows[]{
        {"second NAT, then none",
         {{0, kStart},
          {5, kSecondNatAnswer},
          {5, kSecondNat},
          {6, kTunnelStarts},
          {16, kTunnelUp},
          {16, kPause},
          {140, kPassed},
          {141, kPublished},
          {142, kStatusDirect}},
         "16 relayed: a second router: " + std::string{kSecondNatFact} + "|142 " + direct,
         {}},
        {"errors and notices only",
         {{0, kStart},
          {5, kSecondNatAnswer},
          {5, kSecondNat},
          {6, kTunnelStarts},
          {140, kPassed},
          {141, kPublished},
          {400, kPassed}},
         "6 relayed: a second router: " + std::string{kSecondNatFact} + "|141 " + direct,
         {}},
        {"no result yet",
         {{0, kStart}, {5, kNoUpnp}, {6, kTunnelStarts}},
         "0 not reached: the daemon started|",
         {Sign::LOGGED_ATTEMPT, Sign::LOGGED_NO_GATEWAY}},
        {"a relay that does not come up",
         {{0, kStart},
          {5, kNoUpnp},
          {6, kNoNatpmp},
          {6, kTunnelStarts},
          {290,
           "VPNManager::openVPNConnection() - Failed to establish VPN connection, retries exceeded"},
          {290, kStatusFailed},
          {290, kRelayFailed},
          {290, kPause}},
         "0 not reached: the tunnel did not come up in four starts of its client|",
         {Sign::LOGGED_NO_GATEWAY, Sign::LOGGED_RELAY_DOES_NOT_COME_UP}},
        {"a test that fails while relayed leaves the tunnel alone",
         {{0, kStart},
          {6, kTunnelStarts},
          {16, kTunnelUp},
          {16, kPause},
          {150, kStatusFailed},
          {150, kTestFailed},
          {151, kPause}},
         "16 relayed: the tunnel came up|",
         {Sign::LOGGED_TEST_FAILED}},
        {"a service that is gone",
         {{0, kStart},
          {9, kPassed},
          {9, kPublished},
          {10, kPause},
          {250, "TavikClient::httpGet  Error: [Couldn't resolve host name]"},
          {250,
           "TavikClient::testPort[1] - httpGet for https://x, no response from central server."},
          {250, kTestFailed}},
         "9 " + direct + "250 not reached: the service's name does not resolve|",
         {Sign::LOGGED_SERVICE_UNRESOLVED}},
        {"a tunnel that died",
         {{0, kStart}, {6, kTunnelStarts}, {16, kTunnelUp}, {16, kPause}, {140, kStaleTunnel}},
         "16 relayed: the tunnel came up|140 not reached: the tunnel's client was found dead|",
         {Sign::LOGGED_TUNNEL_DIED}},
        {"a sudden end, and the tunnel it left",
         {{0, kStart},
          {6, kTunnelStarts},
          {16, kTunnelUp},
          {16, kPause},
          {100, kStart},
          {106, kTunnelStarts},
          {116, kTunnelUp}},
         "16 relayed: the tunnel came up|16 not running: the daemon ended suddenly|"
         "116 relayed: the tunnel came up|",
         {}},
        {"a sudden end soon after the client's start, without progress",
         {{0, kStart},
          {6, kTunnelStarts},
          {100, kStart},
          {106, kTunnelStarts},
          {900, kStart},
          {906, kTunnelStarts},
          {1500, kSigterm}},
         "0 not reached: the daemon started|100 not running: the daemon ended suddenly|106 relayed: the tunnel came up|"
         "900 not running: the daemon ended suddenly|906 relayed: the tunnel came up|",
         {}},
        {"power cuts soon after publishing, and in every start after that",
         {{0, kStart},
          {9, kPublished},
          {40, kStart},
          {45, kPassed},
          {50, kStart},
          {55, kPassed},
          {60, kStart},
          {69, kPublished},
          {70, kPause}},
         "9 direct: the ports passed their test and were published|"
         "40 not running: the daemon ended suddenly|69 " +
             direct,
         {}},
        {"publishing fails, and the relay after it",
         {{0, kStart},
          {5, kPassed},
          {6, "TavikClient::httpGet  Error: [Server returned nothing (no headers, no data)]"},
          {6,
           "TavikClient::updateServerMapping - httpGet failed to get response from central server "
           "for url: [x]."},
          {6, "ConnectionManager::createDirectConnection() - failed to update mapping info for x"},
          {7, "TavikClient::deleteServerMapping - httpGet got <status>Success</status>, 24 bytes."},
          {8, kTunnelStarts},
          {18, "VPNManager::openVPNConnection() - failed to open openVPN stdout file!"},
          {18, kRelayFailed},
          {18, kPause}},
         "0 not reached: the ports that passed their test could not be published|",
         {Sign::LOGGED_PUBLISHING_FAILED, Sign::LOGGED_TUNNEL_NO_OUTPUT}},
        {"no connection to the service is no silence",
         {{0,
           "ConnectionManager::createDirectConnection - Current Status in file system: "
           "[portforwarded]."},
          {9, "TavikClient::httpGet  Error: [Couldn't connect to server]"},
          {9, "TavikClient::testPort[1] - httpGet for https://x, no response from central server."},
          {9, kTestFailed}},
         "0 direct: |9 not reached: no connection to the service: Couldn't connect to server|",
         {Sign::LOGGED_SERVICE_UNREACHABLE}},
        {"the back end's answer is cut off by time",
         {{0, kStart},
          {31,
           "TavikClient::updateLocalCommStatus - failure response received from localhost for url: "
           "[x]"},
          {31, "Response: [<result>]."}},
         "0 not reached: the daemon started|",
         {Sign::LOGGED_ATTEMPT, Sign::LOGGED_BACK_END_REFUSES}},
        {"the back end refuses",
         {{0, kStart},
          {1,
           "TavikClient::updateLocalCommStatus - failure response received from localhost for url: "
           "[x]"},
          {1, "Response: [<result>failure</result>]."}},
         "0 not reached: the daemon started|",
         {Sign::LOGGED_ATTEMPT, Sign::LOGGED_BACK_END_REFUSES}},
        {"an orderly end",
         {{0, kStart}, {9, kPublished}, {20, kSigterm}, {20, kOff}},
         "9 direct: the ports passed their test and were published|"
         "20 not running: the daemon was told to end by a signal|",
         {Sign::LOGGED_END}},
        {"switched off",
         {{0, kStart}, {0, kOff}},
         "0 off: remote access is off in the settings, or this was a run with -u|",
         {Sign::LOGGED_END, Sign::LOGGED_REMOTE_ACCESS_OFF}},
        {"begins in the middle",
         {{0, kPassed},
          {3, "ConnectionManager::createConnection() - connection type 1 un-changed. x"}},
         "0 direct 203.0.113.7: |",
         {}},
        {"NAT-PMP only, without progress",
         {{0, kStart},
          {2, kNoUpnp},
          {3, "Router::natpmp_discover - Router's external IP address has changed!"},
          {4, kPublished},
          {130, kNoUpnp}},
         "4 direct: the ports passed their test and were published|",
         {}},
        {"NAT-PMP only, of which nothing is logged, and a filter",
         {{0, kStart}, {2, kNoUpnp}, {9, kFailedAnswer}, {9, kTestFailed}, {130, kNoUpnp}},
         "0 not reached: the daemon started|",
         {Sign::LOGGED_ATTEMPT, Sign::LOGGED_TEST_FAILED}},
        {"a gateway that is gone, and its ports with it",
         {{0, kStart},
          {4, kPassed},
          {4, kPublished},
          {130, kNoUpnp},
          {139, kFailedAnswer},
          {139, kTestFailed}},
         "4 " + direct + "139 not reached: no gateway answers UPnP|",
         {Sign::LOGGED_NO_GATEWAY, Sign::LOGGED_TEST_FAILED}},
        {"begins while relayed, as far as it tells",
         {{0, kSecondNatAnswer}, {0, kSecondNat}, {240, kSecondNatAnswer}, {240, kSecondNat}},
         "",
         {Sign::LOGGED_SECOND_NAT}},
        {"begins before a search that passes",
         {{0, kNoUpnp}, {900, kPassed}, {960, kPassed}, {961, kPublished}, {1300, kPassed}},
         "961 " + direct,
         {}},
        {"begins before a relay's start",
         {{0, kNoUpnp}, {300, kTunnelStarts}, {310, kRelayFailed}},
         "300 not reached: no gateway answers UPnP|",
         {Sign::LOGGED_NO_GATEWAY}},
        {"a relay that fails once, without progress",
         {{0, kStart},
          {4, kTestFailed},
          {5, kTunnelStarts},
          {290, kRelayFailed},
          {410, kTestFailed},
          {411, kTunnelStarts},
          {800, kTestFailed}},
         "0 not reached: the service could not reach the port|"
         "411 relayed: the service could not reach the port|",
         {Sign::LOGGED_TEST_FAILED}},
        {"a power cut of which nothing tells the length",
         {{0, kStart},
          {9, kPublished},
          {300, kPassed},
          {90000, kCopyMissing},
          {90000, "====="},
          {90000, kStart},
          {90009, kPublished},
          {90020, kPause}},
         "9 direct: the ports passed their test and were published|"
         "300 ?: nothing was logged until the daemon started again|90009 " +
             direct,
         {}},
        {"errors only, and an end",
         {{0, "main - syslog severity level set to 3."},
          {9, kTestFailed},
          {9, kRelayFailed},
          {99, "main - syslog severity level set to 3."},
          {999, kSigterm},
          {1999, "main - syslog severity level set to 5."},
          {1999, kStart},
          {2000, kPublished},
          {2999, "main - syslog severity level set to 3."},
          {3000, kTestFailed}},
         "0 ?: the daemon started|99 not running: the daemon ended suddenly|99 ?: the daemon "
         "started|999 not running: the daemon was told to end by a signal|2000 direct: the ports "
         "passed their test and were published|2999 not running: the daemon ended suddenly|2999 "
         "?: the daemon started|",
         {}},
        {"the record, and the tunnel's end",
         {{0, kStart},
          {9, kPublished},
          {9, "VPNManager::closeVPNConnection() - open vpn is not running."}},
         "9 direct: the ports passed their test and were published|",
         {}},
        {"an answer that is too long",
         {{0, kStart},
          {5,
           "TavikClient curlRcvData - Buffer overrun detected, read buffer too small, transfer "
           "aborted"},
          {5, "TavikClient::httpGet  Error: [Failed writing received data to disk/application]"},
          {5,
           "TavikClient::testPort[1] - httpGet for https://x, no response from central server."}},
         "0 not reached: the daemon started|",
         {Sign::LOGGED_ATTEMPT, Sign::LOGGED_SERVICE_NONSENSE}},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        const Evidence evidence = told(row.lines, row.lines.back().first + 60);
        EXPECT_EQ(historyOf(evidence), row.history);
        std::vector<Sign> signs;
        for (const auto& [sign, fact] : evidence.signs) signs.push_back(sign);
        std::vector<Sign> wanted = row.signs;
        std::sort(wanted.begin(), wanted.end());
        EXPECT_EQ(signs, wanted);
    }
}

// A tunnel that stands may be silent for days, unless the daemon searches in vain in every cycle.
TEST(LogStory, ASilenceThatIsNewToARelayedDeviceIsDark) {
    const std::pair<int, std::string> rows[]{
        {300, "7500 ?: nothing was logged until the daemon started again|"},
        {1500, "90000 not running: the daemon ended suddenly|"}};
    for (const auto& [pause, dark] : rows) {
        Lines lines{{0, kStart}, {5, kNoUpnp}, {6, kTunnelStarts}};
        for (int now = pause; now <= 7500; now += pause) lines.emplace_back(now, kNoUpnp);
        lines.insert(lines.end(), {{90000, "====="}, {90000, kStart}});
        EXPECT_EQ(historyOf(told(lines, 90010)), "6 relayed: no gateway answers UPnP|" + dark +
                                                     "90000 not reached: the daemon started|");
    }
}

TEST(LogStory, TellsValuesAndTimes) {
    const Evidence evidence = told({{0, kStart},
                                    {5,
                                     "Router::upnp_discover - Router's external IP address: "
                                     "100.64.3.9 "},
                                    {6, kSecondNatAnswer},
                                    {7, kSecondNat},
                                    {20, kPause}},
                                   30);
    EXPECT_EQ(evidence.signs.at(Sign::LOGGED_SECOND_NAT).text, kSecondNatFact);
    EXPECT_EQ(evidence.signs.at(Sign::LOGGED_SECOND_NAT).when, at(7));
    EXPECT_EQ(evidence.daemon.since, at(0));
    EXPECT_EQ(evidence.daemon.nextCycle, at(140));
    EXPECT_TRUE(evidence.hasProgressLines);
}

TEST(LogStory, TellsPortsThatAreForwardedByHandFromElsewhere) {
    const char* const manual = "ConnectionManager::manualPortForward - allocatedHttpPort 0, x";
    const char* const automatic = "ConnectionManager::forwardPort - forwarding internal port: 80 x";
    const std::pair<Lines, bool> rows[]{{{{0, manual}}, true},
                                        {{{0, manual}, {9, automatic}}, false}};
    for (const auto& [lines, isManual] : rows) {
        EXPECT_EQ(told(lines, 30, true).has(Sign::MANUAL_MODE), isManual);
        EXPECT_FALSE(told(lines, 30).has(Sign::MANUAL_MODE));
    }
}

TEST(LogStory, WordsWhatWasNotLogged) {
    const Evidence evidence = told({{0, kSecondNat}}, 30);
    EXPECT_EQ(evidence.signs.at(Sign::LOGGED_SECOND_NAT).text,
              "the service sees another address than the gateway's");
}

TEST(LogStory, SaysWhoDidNotTakeThePorts) {
    const char* const unsaid =
        "TavikClient::updateServerMapping - failed to get response from localhost for url: [x].";
    const char* const failed =
        "ConnectionManager::createDirectConnection() - failed to update mapping info for x";
    const Evidence evidence = told({{0, kStart}, {9, kPublished}, {9, unsaid}, {9, failed}}, 30);
    EXPECT_EQ(evidence.signs.at(Sign::LOGGED_PUBLISHING_FAILED).text,
              "the ports that passed their test could not be published: the local back end does "
              "not answer");
}

// Before a clock that was set back, in the pause, and after it.
TEST(LogStory, TheNextCycleIsToldDuringThePauseBeforeIt) {
    const std::pair<int, bool> rows[]{{99, false}, {100, true}, {220, true}, {221, false}};
    for (const auto& [now, isTold] : rows) {
        EXPECT_EQ(told({{0, kStart}, {100, kPause}}, now).daemon.nextCycle.has_value(), isTold)
            << now;
    }
}

TEST(LogStory, AClockThatJumpsMakesNoDurations) {
    constexpr int kDay = 86400, kFar = 300 * kDay;
    const std::string fact = "the ports passed their test and were published|";
    const struct {
        const char* name;
        Lines lines;
        std::string history;
    } rows[]{
        {"not set at the first start",
         {{0, kStart}, {kFar, kPublished}, {kFar + 9, kPause}},
         "25920000 direct: " + fact},
        {"set back",
         {{40000, kStart}, {40009, kPublished}, {40010, kPause}, {20000, kPause}, {20140, kStart}},
         "20000 direct: " + fact +
             "20000 not running: the daemon ended suddenly|20140 not reached: the daemon started|"},
        {"lost by a restart, and set again",
         {{kFar, kStart},
          {kFar + 9, kPublished},
          {kFar + 10, kPause},
          {9, kStart},
          {kFar + kDay, kPublished},
          {kFar + kDay + 1, kPause}},
         "25920009 direct: " + fact +
             "25920010 not running: the daemon ended suddenly|26006400 "
             "direct: " +
             fact},
        {"lost by a restart, without progress",
         {{kFar, kStart},
          {kFar + 9, kPublished},
          {9, kStart},
          {kFar + kDay, kPublished},
          {kFar + kDay + 9, kPassed}},
         "25920009 direct: " + fact +
             "25920009 ?: nothing was logged until the daemon started again|26006400 direct: " +
             fact},
        {"far ahead, and set right",
         {{kFar, kStart},
          {kFar + 9, kPublished},
          {kFar + 10, kPause},
          {0, kPause},
          {4 * kDay, kPause},
          {8 * kDay, kStatusFailed}},
         "0 direct: " + fact + "691200 not reached: |"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.name);
        EXPECT_EQ(historyOf(told(row.lines, row.lines.back().first + 60)), row.history);
    }
}

TEST(LogStory, KeepsTheLast2000Periods) {
    LogStory story;
    for (int cycle = 0; cycle < 3000; ++cycle) {
        story.take({at(cycle * 100), kStart});
        story.take({at(cycle * 100 + 8), kPublished});
        story.take({at(cycle * 100 + 9), kSigterm});
        story.take({at(cycle * 100 + 9), kOff});
    }
    Evidence evidence;
    story.finish(evidence);
    EXPECT_EQ(evidence.history.size(), 2000U);
    ASSERT_EQ(evidence.untold.size(), 1U);
    EXPECT_EQ(evidence.untold.front().rfind("the history before its last 2000 periods: ", 0), 0U);
    EXPECT_EQ(evidence.history.back().since, at(299909));
}

}  // namespace
}  // namespace pelorus::doctor
