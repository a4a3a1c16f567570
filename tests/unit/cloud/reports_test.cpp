// Mapping records, the local address, the status word, analytics and the state of the disk.
#include <sys/stat.h>

#include <filesystem>
#include <stdexcept>

#include "cloud_fixture.h"

namespace pelorus {
namespace {

enum Report { UPDATE, WITHDRAW, ADDRESS };

class ReportsTest : public CloudTest {
protected:
    bool send(Report report) {
        if (report == ADDRESS) return client.updateRemoteCommStatus("192.168.77.10");
        if (report == WITHDRAW) return client.deleteServerMapping(80, "192.168.77.10");
        return client.updateServerMapping("44.128.0.20", 9091, 9444, "192.168.77.10", 80, 443);
    }
};

TEST_F(ReportsTest, GoToTheServerAndThenToTheBackEnd) {
    // Sends with these answers; an empty failure is none.
    const auto row = [&](Report report, const FakeWeb::Answer& central,
                         const FakeWeb::Answer& local, bool result, const std::string& failure) {
        log.clear();
        web.answer("web.kavra.example", central);
        web.answer("127.0.0.1", local);
        EXPECT_EQ(send(report), result) << failure;
        EXPECT_EQ(log.countPart("fail"), failure.empty() ? 0 : 1) << log.dump();
        EXPECT_GT(log.countPart(failure), 0) << failure << log.dump();
    };
    // clang-format off
    row(UPDATE, "any device-7350142", "a success", true, "");
    row(WITHDRAW, "any device-7350142", "a success", true, "");
    row(ADDRESS, "Success", "no", true, "");
    EXPECT_EQ(web.urls(), (Urls{
        "https://web.kavra.example/set?id=device-7350142&ip=44.128.0.20&lan=192.168.77.10&p=9091&ps=9444&auth=auth-91c2f0aa",
        "http://127.0.0.1:80/set?ip=44.128.0.20&p=9091&s=9444&lan=192.168.77.10&i=80",
        "https://web.kavra.example/set?id=device-7350142&ip=NULL&lan=192.168.77.10&p=0&ps=0&auth=auth-91c2f0aa",
        "http://127.0.0.1:80/del?i=80",
        "https://web.kavra.example/status?id=device-7350142&auth=auth-91c2f0aa&lan=192.168.77.10",
        "http://127.0.0.1:80/ip?lan=192.168.77.10"}));
    web.clear();
    const std::string silent = "httpGet failed to get response from central server for url https://web.kavra.example/";
    row(UPDATE, none, "", false, silent + "set?id=*ID_REMOVED*&ip=44.128.0.20&lan=192.168.77.10&p=9091&ps=9444&auth=*AUTH_REMOVED*.");
    row(WITHDRAW, none, "", false, silent + "set?id=*ID_REMOVED*&ip=NULL&lan=192.168.77.10&p=0&ps=0&auth=*AUTH_REMOVED*.");
    row(ADDRESS, none, "", false, silent + "status?id=*ID_REMOVED*&auth=*AUTH_REMOVED*&lan=192.168.77.10.");
    EXPECT_EQ(web.count("127.0.0.1"), 0) << "the back end is told although the server was not";
    row(UPDATE, "any", none, false, "failed to get response from localhost for url: [http:");
    row(WITHDRAW, "any", none, false, "failed to get response from localhost for url: [http:");
    row(ADDRESS, "Success", none, false, "failed to get response from local server for url:  http:");
    row(UPDATE, "any", "Success auth-91c2f0aa", true, "failure response received from localhost for url: [http:");
    row(WITHDRAW, "any", "Success auth-91c2f0aa", false, "failure response received from localhost for url: [http:");
    row(ADDRESS, "success device-7350142", "no", true, "failure response received from central server for url:  https:");
    // clang-format on
}

TEST_F(ReportsTest, WithoutTemplatesOrCredentialsNobodyIsTold) {
    const auto without = [&](const std::string& key, const char* value, const std::string& line) {
        setConfig(key, value);
        EXPECT_FALSE(send(UPDATE) || send(WITHDRAW) || send(ADDRESS));
        client.updateLocalCommStatus(key);
        EXPECT_GT(log.countPart(line), 0) << key;
    };
    web.answer("web.kavra.example", "Success");
    for (const std::string key :
         {"LOCAL_SETFORWARDURL", "LOCAL_DELFORWARDURL", "LOCAL_SETLOCALIPURL",
          "LOCAL_SETCOMMSTATUSURL", "REMOTE_SETFORWARDURL", "REMOTE_SETCOMMSTATUSURL"})
        without(key, "%n", "URL template of " + key + " asks for more");
    web.clear();
    without("DEVICEAUTH", "", "failed to get Device Auth Code from DynamicConfig");
    without("DEVICEID", "", "failed to get Device ID from DynamicConfig");
    EXPECT_EQ(web.urls(), Urls{});
    EXPECT_EQ(log.countPart("from DynamicConfig"), 3 + 3);
}

TEST_F(ReportsTest, ExceptionsStayInside) {
    const auto fail = [](const auto&...) { throw std::runtime_error{"broken"}; };
    FakeWeb::Answer broken{""};
    broken.action = fail;
    web.answer("", broken);
    EXPECT_FALSE(send(UPDATE));
    web.answer("web.kavra.example", "Success");
    EXPECT_FALSE(send(UPDATE) || send(WITHDRAW) || send(ADDRESS));
    client.updateLocalCommStatus("relayed");
    commands.answer("hdparm", FakeCommands::Answer{"", 0, false, fail});
    EXPECT_EQ(client.checkHddStandByMode(), 1);
    EXPECT_EQ(log.countPart(" - Throw exception error. **\n"), 1 + 3 + 1 + 1);
}

TEST_F(ReportsTest, OnlyAChangeOfStatusIsSent) {
    clock.duringPause(1, [&] { EXPECT_EQ(commands.lines(), Urls{}) << "touched too early"; });
    web.answer("is=relayed", "success");
    web.answer("is=failed", "no homecloud-smith");
    for (const char* word : {"relayed", "relayed", "failed", "connecting", "connecting", "relayed"})
        client.updateLocalCommStatus(word);
    const std::string url = "http://127.0.0.1:80/status?is=";
    EXPECT_EQ(web.urls(),
              (Urls{url + "relayed", url + "failed", url + "connecting", url + "relayed"}));
    EXPECT_EQ(clock.pauses(), std::vector<long>(4, 1));
    EXPECT_EQ(commands.lines(), std::vector<std::string>(3, "touch /tmp/dynamicconfig.ini"));
    EXPECT_EQ(log.countPart("Successful update status.\n\n"), 2);
    EXPECT_EQ(log.countPart("Response: [no *SUBDOMAIN_REMOVED*].\n"), 1);
}

TEST_F(ReportsTest, AnalyticsEmitOneEvent) {
    const auto row = [&](const char* status, int type, const std::string& event) {
        client.sendAnalytics(status, static_cast<ConnectionType>(type), SUBTYPE_AUTOMATIC);
        EXPECT_EQ(log.lines().back().text, "cloudConnectivity state=" + event) << status << type;
    };
    row("disabled", 4, "connecting type=disabled");
    row("connecting", 2, "connecting type=relayed");
    row("portforwarded", 1, "connected type=portforwarded");
    row("relayed", 1, "connected type=relayed");
    row("failed", 1, "failed type=portforwarded");
    row("failed", 5, "failed type=disabled");  // beyond the table
    row("odd", 2, "failed type=disabled");
}

TEST_F(ReportsTest, ADiskAsleepOrUnknownSkipsTheTest) {
    const auto row = [&](int skips, const std::string& state, const char* type, const char* last) {
        log.clear();
        commands.answer("hdparm -C /dev/sda",
                        FakeCommands::Answer{"\n" + state, 0, state.empty(), {}});
        setConfig("DEVICETYPE", type);
        EXPECT_EQ(client.checkHddStandByMode(), skips) << last;
        EXPECT_EQ(log.countPart(last), log.lines().empty() ? 0 : 1) << log.dump();
    };
    support::FakeFiles::get().redirect(support::kIdleMinutesFile, path("minutes"));
    mkfifo(path("minutes").c_str(), 0666);  // planted to block
    row(1, "state: idle", "", "failed to get open Ostrel sleep count file.\n");
    std::filesystem::remove(path("minutes"));
    writeFile("minutes", "2\n0\n");
    row(1, "state: standby", "5", "drive is in standby, port test is suspended");
    row(1, "", "5", "unable to check drive status, popen() returned NULL.\n");
    row(1, "state: idle", "3", "sleep count > 1, port testing SKIP.\n");
    row(0, "state: idle", "5", "");  // the maker's router counts nothing
    writeFile("minutes", "1\n9\n");
    row(0, "state: idle", "3", "checking sleep count.\n");
    writeFile("minutes", "");
    row(0, "state: idle", "3", "checking sleep count.\n");
}

}  // namespace
}  // namespace pelorus
