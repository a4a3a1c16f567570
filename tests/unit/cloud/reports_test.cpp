// What is reported to the central server and to the local back end: mapping records, the local
// address and the status word.
#include <stdexcept>
#include <string>
#include <vector>

#include "cloud_fixture.h"

namespace pelorus {

namespace {

using support::LogLine;

// One report and what it sends and logs. {} in a text stands for the URL that may be logged.
struct Report {
    bool (*send)();
    std::string method;
    const char* centralUrl;
    const char* maskedUrl;
    const char* localUrl;
    std::string asking;
    std::string answered;
    std::string asking2;
};

std::string withUrl(std::string text, const std::string& url) {
    const std::size_t place = text.find("{}");
    return place == std::string::npos ? text : text.replace(place, 2, url);
}

TavikClient& client() {
    return *TavikClient::getInstance();
}

const Report kUpdate{
    [] {
        return client().updateServerMapping("44.128.0.20", 9091, 9444, "192.168.77.10", 80, 443);
    },
    "updateServerMapping",
    "https://web.kavra.example/set?id=device-7350142&ip=44.128.0.20&lan=192.168.77.10&p=9091&ps=9444&auth=auth-91c2f0aa",
    "https://web.kavra.example/set?id=*ID_REMOVED*&ip=44.128.0.20&lan=192.168.77.10&p=9091&ps=9444&auth=*AUTH_REMOVED*",
    "http://127.0.0.1:80/set?ip=44.128.0.20&p=9091&ps=9444&lan=192.168.77.10&i=80",
    "set port forward url: {}\n",
    "httpGet got Success for *ID_REMOVED*, 26 bytes.\n",
    "update local config url: {}\n"};
const Report kWithdraw{
    [] { return client().deleteServerMapping(80, "192.168.77.10"); },
    "deleteServerMapping",
    "https://web.kavra.example/set?id=device-7350142&ip=NULL&lan=192.168.77.10&p=0&ps=0&auth=auth-91c2f0aa",
    "https://web.kavra.example/set?id=*ID_REMOVED*&ip=NULL&lan=192.168.77.10&p=0&ps=0&auth=*AUTH_REMOVED*",
    "http://127.0.0.1:80/del?i=80",
    "Deleting port mapping from server, url: [{}].\n",
    "httpGet got Success for *ID_REMOVED*, 26 bytes.\n",
    ""};
const Report kAddress{
    [] { return client().updateRemoteCommStatus("192.168.77.10"); },
    "updateRemoteCommStatus",
    "https://web.kavra.example/status?id=device-7350142&auth=auth-91c2f0aa&lan=192.168.77.10",
    "https://web.kavra.example/status?id=*ID_REMOVED*&auth=*AUTH_REMOVED*&lan=192.168.77.10",
    "http://127.0.0.1:80/ip?lan=192.168.77.10",
    "updating central server using url:  {}\n",
    "httpGet got Success for *ID_REMOVED*. 26 bytes from central server.\n",
    "local config using url:  {}\n"};

struct Row : Case {
    const Report& report;
    const char* localAnswer;  // null: none
    bool result;
    std::vector<std::string> errors;
};

class ReportToBoth : public CloudTest, public ::testing::WithParamInterface<Row> {};

TEST_P(ReportToBoth, AsksTheServerAndThenTheBackEnd) {
    const Report& report = GetParam().report;
    givenClient();
    web.answer("web.kavra.example", "Success for device-7350142");
    if (GetParam().localAnswer != nullptr) web.answer("127.0.0.1", GetParam().localAnswer);
    EXPECT_EQ(report.send(), GetParam().result);
    EXPECT_EQ(web.urls(FakeWeb::Side::CENTRAL), Urls{report.centralUrl});
    EXPECT_EQ(web.urls(), (Urls{report.centralUrl, report.localUrl}));

    const std::string prefix = "TavikClient::" + report.method + " - ";
    std::vector<LogLine> wanted{log.lines().at(0),
                                {LOG_INFO, prefix + withUrl(report.asking, report.maskedUrl)},
                                {LOG_NOTICE, prefix + report.answered}};
    if (!report.asking2.empty())
        wanted.push_back({LOG_INFO, prefix + withUrl(report.asking2, report.localUrl)});
    for (const std::string& error : GetParam().errors)
        wanted.push_back({LOG_ERR, withUrl(error, report.localUrl)});
    expectLogIs(wanted);
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(Rows, ReportToBoth, ::testing::Values(
    Row{{"AnAcceptedUpdateCounts"}, kUpdate, "a success", true, {}},
    Row{{"ARefusedUpdateCounts"}, kUpdate, "Success auth-91c2f0aa", true, {"TavikClient::updateServerMapping - failure response received from localhost for url: [{}].\n", "Response: Success *AUTH_REMOVED*"}},
    Row{{"AnUnansweredUpdateFails"}, kUpdate, nullptr, false, {"TavikClient::updateServerMapping - failed to get response from localhost for url: [{}].\n"}},
    Row{{"AnAcceptedWithdrawalCounts"}, kWithdraw, "a success", true, {}},
    Row{{"ARefusedWithdrawalFails"}, kWithdraw, "Success auth-91c2f0aa", false, {"TavikClient::deleteServerMapping - failure response received from localhost for url: [{}]\n", "Response: [Success *AUTH_REMOVED*]\n"}},
    Row{{"AnUnansweredWithdrawalFails"}, kWithdraw, nullptr, false, {"TavikClient::deleteServerMapping - failed to get response from localhost for url: [{}]\n"}},
    Row{{"AnEmptyAnswerToTheAddressCounts"}, kAddress, "", true, {}},
    Row{{"AnUnansweredAddressFails"}, kAddress, nullptr, false, {"TavikClient::updateRemoteCommStatus - failed to get response from local server for url:  {}\n"}}),
    CaseName{});
// clang-format on

class ReportsTest : public CloudTest {
protected:
    const std::vector<Report> all{kUpdate, kWithdraw, kAddress};
};

TEST_F(ReportsTest, WithoutTheServerTheBackEndIsNotTold) {
    givenClient();
    web.answer("127.0.0.1", "success");
    for (const Report& report : all) {
        EXPECT_FALSE(report.send());
        expectLogged(LOG_ERR, "TavikClient::" + report.method +
                                  " - httpGet failed to get response from central server for url " +
                                  report.maskedUrl + ".\n");
    }
    EXPECT_EQ(web.urls(), (Urls{kUpdate.centralUrl, kWithdraw.centralUrl, kAddress.centralUrl}));
}

TEST_F(ReportsTest, WithoutCredentialsNobodyIsTold) {
    givenClient();
    for (const auto& [key, text] :
         {std::pair{"DEVICEAUTH", "Device Auth Code"}, std::pair{"DEVICEID", "Device ID"}}) {
        setConfig(key, "");
        for (const Report& report : all) EXPECT_FALSE(report.send());
        const std::string rest = std::string(" - failed to get ") + text + " from DynamicConfig";
        expectLogged(LOG_ERR, "TavikClient::updateServerMapping" + rest + ".\n");
        expectLogged(LOG_ERR, "TavikClient::deleteServerMapping" + rest + ".\n");
        expectLogged(LOG_ERR, "TavikClient::updateRemoteCommStatus" + rest + "\n");
    }
    EXPECT_EQ(web.urls(), Urls{});
}

TEST_F(ReportsTest, AnAddressTheServerRefusesStillGoesToTheBackEnd) {
    givenClient();
    web.answer("web.kavra.example", "success device-7350142");
    web.answer("127.0.0.1", "no");
    EXPECT_TRUE(kAddress.send());
    expectLoggedInOrder(
        {std::string(
             "TavikClient::updateRemoteCommStatus - failure response received from central server for url:  ") +
             kAddress.maskedUrl + "\n",
         "TavikClient::updateRemoteCommStatus - Response: [success *ID_REMOVED*].\n",
         std::string("TavikClient::updateRemoteCommStatus - local config using url:  ") +
             kAddress.localUrl + "\n"});
}

TEST_F(ReportsTest, ExceptionsStayInside) {
    givenClient();
    FakeWeb::Answer broken;
    broken.action = [](const std::string&) { throw std::runtime_error{"broken"}; };
    web.answer("", broken);
    EXPECT_FALSE(kUpdate.send());
    expectLogged(LOG_ERR, "** TavikClient::httpGet - Throw exception error. **\n");
    web.answer("web.kavra.example", "Success");
    for (const Report& report : all) {
        EXPECT_FALSE(report.send());
        expectLogged(LOG_ERR,
                     "** TavikClient::" + report.method + " - Throw exception error. **\n");
    }
    client().updateLocalCommStatus("relayed");
    expectLogged(LOG_ERR, "** TavikClient::updateLocalCommStatus - Throw exception error. **\n");
}

TEST_F(ReportsTest, OnlyAChangeOfStatusIsSentWhateverTheBackEndSays) {
    givenClient();
    for (const char* word : {"relayed", "relayed", "failed", "relayed"})
        client().updateLocalCommStatus(word);
    const std::string url = "http://127.0.0.1:80/status?is=";
    EXPECT_EQ(web.urls(FakeWeb::Side::LOCAL),
              (Urls{url + "relayed", url + "failed", url + "relayed"}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{1, 1, 1}));
    EXPECT_EQ(commands.lines(), std::vector<std::string>{});
    EXPECT_EQ(
        log.count(
            LOG_ERR,
            "TavikClient::updateLocalCommStatus - failed to get response from localhost for url:  [" +
                url + "relayed]\n"),
        2);
}

TEST_F(ReportsTest, AnAnsweredStatusTouchesTheConfigurationAfterThePause) {
    givenClient();
    support::FakeCommands::Answer afterPause;
    afterPause.action = [this](const std::string&) { EXPECT_EQ(clock.elapsed(), 1); };
    commands.answerOnce("touch", afterPause);
    web.answer("is=relayed", "success");
    client().updateLocalCommStatus("relayed");
    afterPause.fails = true;
    commands.answer("touch", afterPause);
    web.answer("is=failed", "no homecloud-smith");
    client().updateLocalCommStatus("failed");
    EXPECT_EQ(commands.lines(), (std::vector<std::string>(2, "touch /tmp/dynamicconfig.ini")));
    const std::string prefix = "TavikClient::updateLocalCommStatus - ";
    expectLogIs(
        {{LOG_INFO, prefix + "URL : [http://127.0.0.1:80/status?is=relayed].\n"},
         {LOG_INFO, prefix + "Update COMMUNICATION status : [relayed].\n"},
         {LOG_INFO, prefix + "enforced touch to /tmp/dynamicconfig.ini.\n"},
         {LOG_INFO, prefix + "Successful update status.\n\n"},
         {LOG_INFO, prefix + "URL : [http://127.0.0.1:80/status?is=failed].\n"},
         {LOG_INFO, prefix + "Update COMMUNICATION status : [failed].\n"},
         {LOG_ERR,
          prefix +
              "failure response received from localhost for url: [http://127.0.0.1:80/status?is=failed]\n"},
         {LOG_ERR, "Response: [no *SUBDOMAIN_REMOVED*].\n"}});
}

}  // namespace

}  // namespace pelorus
