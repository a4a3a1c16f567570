// Mapping records, the local address, the status word, analytics and the state of the disk.
#include <stdexcept>

#include "cloud_fixture.h"
#include "config/scrub.h"

namespace pelorus {
namespace {

struct Report {
    bool (*send)();
    std::string centralUrl;
    std::string localUrl;
};

TavikClient& client() {
    return *TavikClient::getInstance();
}

// clang-format off
const Report kUpdate{
    [] { return client().updateServerMapping("44.128.0.20", 9091, 9444, "192.168.77.10", 80, 443); },
    "https://web.kavra.example/set?id=device-7350142&ip=44.128.0.20&lan=192.168.77.10&p=9091&ps=9444&auth=auth-91c2f0aa",
    "http://127.0.0.1:80/set?ip=44.128.0.20&p=9091&ps=9444&lan=192.168.77.10&i=80"};
const Report kWithdraw{
    [] { return client().deleteServerMapping(80, "192.168.77.10"); },
    "https://web.kavra.example/set?id=device-7350142&ip=NULL&lan=192.168.77.10&p=0&ps=0&auth=auth-91c2f0aa",
    "http://127.0.0.1:80/del?i=80"};
const Report kAddress{
    [] { return client().updateRemoteCommStatus("192.168.77.10"); },
    "https://web.kavra.example/status?id=device-7350142&auth=auth-91c2f0aa&lan=192.168.77.10",
    "http://127.0.0.1:80/ip?lan=192.168.77.10"};
// clang-format on

class ReportsTest : public CloudTest {
protected:
    ReportsTest() { givenClient(); }
    static void expectFailures() {
        for (const Report& report : {kUpdate, kWithdraw, kAddress}) EXPECT_FALSE(report.send());
    }
};

TEST_F(ReportsTest, GoToTheServerAndThenToTheBackEnd) {
    // Part of the error line, empty for no failure; "-" for nobody answers.
    const auto row = [&](const Report& report, const char* central, const char* local, bool result,
                         const std::string& error) {
        web.reset();
        log.clear();
        if (*central != '-') web.answer("web.kavra.example", central);
        if (*local != '-') web.answer("127.0.0.1", local);
        EXPECT_EQ(report.send(), result) << error;
        Urls asked{report.centralUrl};
        if (*central != '-') asked.push_back(report.localUrl);
        EXPECT_EQ(web.urls(), asked);
        EXPECT_EQ(log.countPart("fail"), error.empty() ? 0 : 1) << log.dump();
        EXPECT_GT(log.countPart(error), 0) << error;
        EXPECT_GT(log.countPart(scrubSecrets(report.centralUrl)), 0);
    };
    // clang-format off
    row(kUpdate, "any device-7350142", "a success", true, "");
    row(kUpdate, "any", "Success auth-91c2f0aa", true, "failure response received from localhost for url: [http://127.0.0.1:80/set?");
    row(kUpdate, "any", "-", false, "failed to get response from localhost for url: [");
    row(kUpdate, "-", "", false, "httpGet failed to get response from central server for url https");
    row(kWithdraw, "any device-7350142", "a success", true, "");
    row(kWithdraw, "any", "Success auth-91c2f0aa", false, "failure response received from localhost for url: [");
    row(kWithdraw, "any", "-", false, "failed to get response from localhost for url: [");
    row(kWithdraw, "-", "", false, "httpGet failed to get response from central server for url https");
    row(kAddress, "Success", "no", true, "");
    row(kAddress, "success device-7350142", "no", true, "failure response received from central server for url:  https");
    row(kAddress, "Success", "-", false, "failed to get response from local server for url:  http:");
    row(kAddress, "-", "", false, "httpGet failed to get response from central server for url https");
    // clang-format on
}

TEST_F(ReportsTest, WithoutCredentialsOrTemplatesNobodyIsTold) {
    setConfig("DEVICEAUTH", "");
    expectFailures();
    setConfig("DEVICEID", "");
    expectFailures();
    EXPECT_EQ(web.urls(), Urls{});
    EXPECT_EQ(log.countPart("failed to get Device Auth Code from DynamicConfig"), 3);
    EXPECT_EQ(log.countPart("failed to get Device ID from DynamicConfig"), 3);
    setConfig("DEVICEID", support::kDeviceId);
    setConfig("DEVICEAUTH", support::kDeviceAuth);
    web.answer("web.kavra.example", "Success");
    for (const std::string key :
         {"LOCAL_SETFORWARDURL", "LOCAL_DELFORWARDURL", "LOCAL_SETLOCALIPURL",
          "LOCAL_SETCOMMSTATUSURL", "REMOTE_SETFORWARDURL", "REMOTE_SETCOMMSTATUSURL"}) {
        setConfig(key, "%n");
        expectFailures();
        client().updateLocalCommStatus(key);
        EXPECT_GT(log.countPart("URL template of " + key + " asks for more"), 0);
    }
}

TEST_F(ReportsTest, ExceptionsStayInside) {
    FakeWeb::Answer broken{""};
    broken.action = [] { throw std::runtime_error{"broken"}; };
    web.answer("", broken);
    EXPECT_FALSE(kUpdate.send());
    EXPECT_EQ(log.countPart("** TavikClient::httpGet - Throw exception error. **\n"), 1);
    web.answer("web.kavra.example", "Success");
    expectFailures();
    client().updateLocalCommStatus("relayed");
    const auto fail = [](const std::string&) { throw std::runtime_error{"broken"}; };
    commands.answer("hdparm", FakeCommands::Answer{"", 0, false, fail});
    EXPECT_EQ(client().checkHddStandByMode(), 1);
    EXPECT_EQ(log.countPart(" - Throw exception error. **\n"), 1 + 3 + 1 + 1);
}

TEST_F(ReportsTest, OnlyAChangeOfStatusIsSent) {
    const auto afterPause = [this](const std::string&) {
        EXPECT_EQ(clock.pauses().size(), web.urls().size()) << "touched after the pause";
    };
    commands.answer("touch", FakeCommands::Answer{"", 0, false, afterPause});
    web.answer("is=relayed", "success");
    web.answer("is=failed", "no homecloud-smith");
    for (const char* word : {"relayed", "relayed", "failed", "connecting", "connecting", "relayed"})
        client().updateLocalCommStatus(word);
    const std::string url = "http://127.0.0.1:80/status?is=";
    EXPECT_EQ(web.urls(),
              (Urls{url + "relayed", url + "failed", url + "connecting", url + "relayed"}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{1, 1, 1, 1}));
    EXPECT_EQ(commands.lines(), (std::vector<std::string>(3, "touch /tmp/dynamicconfig.ini")));
    EXPECT_EQ(log.countPart("Successful update status.\n\n"), 2);
    EXPECT_EQ(log.countPart("Response: [no *SUBDOMAIN_REMOVED*].\n"), 1);
    EXPECT_EQ(log.countPart("failed to get response from localhost for url:  [" + url), 1);
}

TEST_F(ReportsTest, AnalyticsEmitOneEvent) {
    const auto row = [&](const char* status, int type, const std::string& event) {
        client().sendAnalytics(status, static_cast<ConnectionType>(type), SUBTYPE_AUTOMATIC);
        EXPECT_EQ(log.lines().back().text, "cloudConnectivity state=" + event) << status << type;
    };
    row("disabled", 4, "connecting type=disabled");
    row("connecting", 2, "connecting type=relayed");
    row("portforwarded", 1, "connected type=portforwarded");
    row("relayed", 1, "connected type=relayed");
    row("failed", 1, "failed type=portforwarded");
    row("failed", 5, "failed type=disabled");  // beyond the table
    row("odd", 2, "failed type=disabled");
    EXPECT_EQ(log.countPart("[odd] = NOT_FOUND\n"), 2);
}

TEST_F(ReportsTest, ADiskAsleepOrUnknownSkipsTheTest) {
    const auto row = [&](int skips, const std::string& state, const char* type,
                         const std::string& last) {
        log.clear();
        const std::string output = "/dev/sda:\n drive state is:  " + state + "\n";
        commands.answer("hdparm -C /dev/sda", FakeCommands::Answer{output, 0, state.empty(), {}});
        setConfig("DEVICETYPE", type);
        EXPECT_EQ(client().checkHddStandByMode(), skips) << last;
        EXPECT_EQ(log.lines().empty() ? "" : log.lines().back().text, last);
    };
    const auto minutes = [&](const char* text) {
        support::FakeFiles::get().redirect(support::kIdleMinutesFile, writeFile("minutes", text));
    };
    // clang-format off
    row(1, "idle", "", "TavikClient::checkHddStandByMode - failed to get open Ostrel sleep count file.\n");
    minutes("2\n0\n");
    row(1, "standby", "5", "TavikClient::checkHddStandByMode - drive is in standby, port test is suspended, port testing SKIP.\n");
    row(1, "", "5", "TavikClient::checkHddStandByMode - port test not performed - unable to check drive status, popen() returned NULL.\n");
    row(1, "idle", "3", "TavikClient::checkHddStandByMode - sleep count > 1, port testing SKIP.\n");
    row(0, "idle", "5", "");  // the maker's router counts nothing
    minutes("1\n9\n");
    row(0, "idle", "3", "TavikClient::checkHddStandByMode - checking sleep count.\n");
    minutes("");
    row(0, "idle", "3", "TavikClient::checkHddStandByMode - checking sleep count.\n");
    // clang-format on
}

}  // namespace
}  // namespace pelorus
