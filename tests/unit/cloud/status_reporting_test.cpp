#include <string>

#include "cloud_fixture.h"

namespace pelorus {
namespace {

class StatusReportingTest : public CloudTest {};

TEST_F(StatusReportingTest, AnalyticsEmitOneEvent) {
    TavikClient& client = givenClient();
    const auto row = [&](const char* name, const char* status, int type, const std::string& event) {
        SCOPED_TRACE(name);
        log.clear();
        client.sendAnalytics(status, static_cast<ConnectionType>(type), SUBTYPE_AUTOMATIC);
        EXPECT_EQ(log.lines().back().text, "cloudConnectivity state=" + event);
    };
    row("disabled is connecting", "disabled", 4, "connecting type=disabled");
    row("an attempt names its kind", "connecting", 2, "connecting type=relayed");
    row("forwarded", "portforwarded", 1, "connected type=portforwarded");
    row("relayed ignores the kind", "relayed", 1, "connected type=relayed");
    row("a failure names its kind", "failed", 1, "failed type=portforwarded");
    row("an attempt is no kind", "failed", 3, "failed type=disabled");
    row("a kind beyond the table is none", "failed", 5, "failed type=disabled");
    row("an unknown status has failed", "odd", 2, "failed type=disabled");
    EXPECT_EQ(log.countPart("[odd] = NOT_FOUND\n"), 2);
}

TEST_F(StatusReportingTest, ADiskAsleepOrUnknownSkipsTheTest) {
    TavikClient& client = givenClient();
    const auto row = [&](int skips, const std::string& state, const char* type,
                         const std::string& last) {
        log.clear();
        const std::string output = "/dev/sda:\n drive state is:  " + state + "\n";
        commands.answer("hdparm -C /dev/sda", FakeCommands::Answer{output, 0, state.empty(), {}});
        setConfig("DEVICETYPE", type);
        EXPECT_EQ(client.checkHddStandByMode(), skips) << last;
        EXPECT_EQ(log.countPart("checkHddStandByMode - " + last + "\n"), 1) << log.dump();
    };
    const auto minutes = [&](const char* text) {
        files.redirect(support::kIdleMinutesFile, writeFile("minutes", text));
    };
    row(1, "idle", "", "failed to get open Ostrel sleep count file.");
    minutes("2\n0\n");
    row(1, "standby", "5", "drive is in standby, port test is suspended, port testing SKIP.");
    row(1, "", "5",
        "port test not performed - unable to check drive status, popen() returned NULL.");
    row(1, "idle", "3", "sleep count > 1, port testing SKIP.");
    minutes("1\n9\n");
    row(0, "idle", "3", "checking sleep count.");
    minutes("");
    row(0, "idle", "3", "checking sleep count.");
    log.clear();
    setConfig("DEVICETYPE", "5");  // the maker's router counts nothing
    EXPECT_EQ(client.checkHddStandByMode(), 0);
    EXPECT_TRUE(log.lines().empty());
}

}  // namespace
}  // namespace pelorus
