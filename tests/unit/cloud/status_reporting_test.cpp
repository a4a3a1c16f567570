#include <string>
#include <vector>

#include "cloud_fixture.h"

namespace pelorus {

namespace {

using support::FakeCommands;
using support::LogLine;

struct EventRow : Case {
    const char* status;
    int type;
    std::string state;
    std::string word;
};

class Analytics : public CloudTest, public ::testing::WithParamInterface<EventRow> {};

TEST_P(Analytics, EmitOneEvent) {
    const EventRow& row = GetParam();
    givenClient().sendAnalytics(row.status, static_cast<ConnectionType>(row.type),
                                SUBTYPE_AUTOMATIC);
    const std::string prefix = "TavikClient::sendAnalytics - ";
    expectLoggedInOrder({prefix + "COMMUNICATION status:[" + row.status + "]  connectionType:[" +
                             std::to_string(row.type) + "]  connectionSubType:[1]\n",
                         prefix + "logState:[" + row.state + "]  logType:[" + row.word + "]\n",
                         "cloudConnectivity state=" + row.state + " type=" + row.word});
    EXPECT_EQ(log.countPart("cloudConnectivity"), 1);
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    Analytics,
    ::testing::Values(EventRow{{"DisabledIsConnecting"}, "disabled", 4, "connecting", "disabled"},
                      EventRow{{"AnAttemptNamesItsKind"}, "connecting", 2, "connecting", "relayed"},
                      EventRow{{"Forwarded"}, "portforwarded", 1, "connected", "portforwarded"},
                      EventRow{{"RelayedIgnoresTheKind"}, "relayed", 1, "connected", "relayed"},
                      EventRow{{"AFailureNamesItsKind"}, "failed", 1, "failed", "portforwarded"},
                      EventRow{{"AKindBeyondTheTableIsNone"}, "failed", 5, "failed", "disabled"},
                      EventRow{{"AnUnknownStatusHasFailed"}, "odd", 2, "failed", "disabled"}),
    CaseName{});

class StatusReportingTest : public CloudTest {};

TEST_F(StatusReportingTest, AnalyticsLogWhatTheTablesHold) {
    TavikClient& client = givenClient();
    client.sendAnalytics("relayed", RELAYED, SUBTYPE_NONE);
    client.sendAnalytics("odd", RELAYED, SUBTYPE_NONE);
    const std::string prefix = "TavikClient::sendAnalytics - ";
    expectLoggedInOrder({prefix + "Status2LogState[relayed] = connected\n",
                         prefix + "Status2LogType[relayed] = relayed\n",
                         prefix + "Status2LogState[odd] = NOT_FOUND\n",
                         prefix + "Status2LogType[odd] = NOT_FOUND\n"});
}

struct DiskRow : Case {
    FakeCommands::Answer hdparm;
    const char* deviceType;
    const char* minutes;  // null: no file
    int result;
    std::vector<LogLine> lines;
};

class DiskStandby : public CloudTest, public ::testing::WithParamInterface<DiskRow> {};

TEST_P(DiskStandby, DecidesWhetherATestMayRun) {
    const DiskRow& row = GetParam();
    TavikClient& client = givenClient();
    commands.answer("hdparm -C /dev/sda", row.hdparm);
    setConfig("DEVICETYPE", row.deviceType);
    if (row.minutes != nullptr)
        files.redirect(support::kIdleMinutesFile, writeFile("minutes", row.minutes));
    EXPECT_EQ(client.checkHddStandByMode(), row.result);
    EXPECT_EQ(commands.lines(), std::vector<std::string>{"hdparm -C /dev/sda"});
    expectLogIs(row.lines);
}

const FakeCommands::Answer kStandby{"/dev/sda:\n drive state is:  standby\n"};
const FakeCommands::Answer kActive{"/dev/sda:\n drive state is:  active/idle\n"};
const FakeCommands::Answer kNoAnswer{"", 0, true, {}};
const LogLine kChecking{LOG_INFO, "TavikClient::checkHddStandByMode - checking sleep count.\n"};
const LogLine kIdle{LOG_INFO,
                    "TavikClient::checkHddStandByMode - sleep count > 1, port testing SKIP.\n"};
const LogLine kAsleep{
    LOG_INFO,
    "TavikClient::checkHddStandByMode - drive is in standby, port test is suspended, port testing SKIP.\n"};
const LogLine kNoFile{
    LOG_ERR, "TavikClient::checkHddStandByMode - failed to get open Ostrel sleep count file.\n"};
const LogLine kNoPipe{
    LOG_ERR,
    "TavikClient::checkHddStandByMode - port test not performed - unable to check drive status, popen() returned NULL.\n"};

INSTANTIATE_TEST_SUITE_P(
    Rows,
    DiskStandby,
    ::testing::Values(DiskRow{{"StandbySkips"}, kStandby, "5", "0", 1, {kAsleep}},
                      DiskRow{{"AnUnknownStateSkips"}, kNoAnswer, "5", "0", 1, {kNoPipe}},
                      DiskRow{{"TheMakersRouterCountsNothing"}, kActive, "5", nullptr, 0, {}},
                      DiskRow{{"AMissingCountSkips"}, kActive, "", nullptr, 1, {kNoFile}},
                      DiskRow{
                          {"TwoIdleMinutesSkip"}, kActive, "3", "2\n0\n", 1, {kChecking, kIdle}},
                      DiskRow{{"OneIdleMinuteDoesNot"}, kActive, "3", "1\n9\n", 0, {kChecking}},
                      DiskRow{{"AnEmptyCountDoesNot"}, kActive, "3", "", 0, {kChecking}}),
    CaseName{});

}  // namespace

}  // namespace pelorus
