#include "cloud/url_template.h"
#include "cloud_fixture.h"
#include "common/handles.h"

namespace pelorus {
namespace {

constexpr const char* kUrl = "http://web.kavra.example/x";

class HttpClientTest : public CloudTest {
protected:
    std::string get(const char* url = kUrl) {
        const MallocHandle<char> data{TavikClient::getInstance()->httpGet(url, size)};
        return data ? std::string(data.get(), static_cast<std::size_t>(size)) : "(null)";
    }

    int size = -7;
};

TEST_F(HttpClientTest, AnAnswerIsKeptAsFarAsItCameAndFits) {
    givenClient();
    const std::string large = std::string(10000, 'a') + std::string(238, 'b');
    web.answer("/x", large);
    EXPECT_EQ(get(), large);
    // clang-format off
    EXPECT_EQ(web.options(), (FakeWeb::Options{{CURLOPT_TIMEOUT_MS, "30000"}, {CURLOPT_WRITEFUNCTION, ""}, {CURLOPT_WRITEDATA, ""}, {CURLOPT_SSLVERSION, "0"}, {CURLOPT_URL, kUrl}, {CURLOPT_SSL_VERIFYPEER, "1"}}));
    // clang-format on
    web.answer("/x", large + "c");
    EXPECT_EQ(get(), "(null)");
    EXPECT_EQ(log.countPart("TavikClient curlRcvData - Buffer overrun detected"), 1);
    web.answer("/x", {"half", CURLE_OPERATION_TIMEDOUT});
    EXPECT_EQ(get(), "half");
    EXPECT_EQ(log.countPart("TavikClient::httpGet  Error: [Timeout was reached]\n"), 1);
    size = -7;
    EXPECT_EQ(get(nullptr) + get(""), "(null)(null)");
    EXPECT_EQ(size, -7);
    EXPECT_EQ(log.countPart("TavikClient:httpGet - empty url\n"), 2);
    web.handlesFail = true;
    EXPECT_EQ(get(), "(null)");
}

TEST_F(HttpClientTest, WithoutCredentialsTheFirstUseReportsDisabledOnce) {
    givenConfig({{"LOCAL_SETCOMMSTATUSURL", "http://127.0.0.1/%d/%s"}}, {{"DEVICEAUTH", ""}});
    web.globalInitFails = true;
    TavikClient::getInstance();
    EXPECT_TRUE(TavikClient::getInstance()->lastPortTestPassed());
    EXPECT_EQ(web.urls(), (Urls{"http://127.0.0.1/0/disabled"}));
    EXPECT_EQ(web.globalInits, 1);
    EXPECT_EQ(log.countPart("TavikClient::initialize() - CURL initialization failed.\n"), 1);
    EXPECT_EQ(log.countPart("initialize() - failed to read DEVICEID, DEVICEAUTH from"), 1);
    EXPECT_EQ(log.countPart("initialize() returned false, set Comm Status to [disabled]\n"), 1);
    setConfig("DEVICEID", "");
    setConfig("DEVICEAUTH", support::kDeviceAuth);
    setConfig("DYNAMIC_CONFIG_TMP", path("gone"));  // every read of a setting complains once
    EXPECT_FALSE(TavikClient::getInstance()->initialize());
    EXPECT_EQ(log.countPart("failed to stat TEMP dynamic config file"), 2) << "both are read";
}

TEST_F(HttpClientTest, OnlyTheHostOfTheFirstUsableBaseCounts) {
    givenConfig();
    TavikClient& client = *TavikClient::getInstance();
    for (const char* const base : {"", "web.kavra.example", "http://a"}) {
        setConfig("SERVER_BASE_URL", base);
        EXPECT_EQ(client.getRestUrl("/%s", HTTP), "/%s");
    }
    EXPECT_EQ(log.countPart("Invalid base server url http://a. Return input urn.\n"), 1);
    setConfig("SERVER_BASE_URL", "x://ab");
    EXPECT_EQ(client.getRestUrl("/%s", HTTPS), "https://ab/%s");
    setConfig("SERVER_BASE_URL", "http://two.x");
    EXPECT_EQ(client.getRestUrl("/a", static_cast<HttpType>(0)), "/a");
    EXPECT_EQ(client.getRestUrl("/%s%n", HTTP), "http://ab/%s%n");
    EXPECT_EQ(log.countPart("getRestUrl - restURL http://ab/_s_n.\n"), 1);
}

TEST_F(HttpClientTest, ALookupGivesTheFirstAddressAndMasksAnUnknownName) {
    TavikClient& client = givenClient();
    net.setName("six", {"2001:db8::1", "44.128.0.20"});
    EXPECT_EQ(client.nsLookup("six"), "2001:db8::1");
    EXPECT_EQ(client.nsLookup("device-7350142.homecloud-smith.kavra.example"), "");
    EXPECT_EQ(log.countPart("hostname: *ID_REMOVED*.*SUBDOMAIN_REMOVED*.kavra.example\n"), 1);
}

TEST_F(HttpClientTest, AUrlTemplateIsFilledOrRefusedWithOneLine) {
    givenConfig();
    const auto row = [&](const std::string& urlTemplate, const std::string& request,
                         const std::string& logged) {
        log.clear();
        const MaskedUrl url = fillMaskedTemplate(
            "SOME_URL", urlTemplate, {SecretArgument{"id%s7", "*ID*"}, -1, "%d&#device-7350142"});
        EXPECT_EQ(url.request + "; " + url.logged, request + "; " + logged) << urlTemplate;
        EXPECT_EQ(log.countPart("SOME_URL"), request.empty() ? 1 : 0) << urlTemplate;
    };
    row("/%s/%d/%s", "/id%s7/-1/%25d%26%23device-7350142", "/*ID*/-1/%25d%26%23*ID_REMOVED*");
    row("/device-7350142/%s/%u", "/device-7350142/id%s7/4294967295",
        "/*ID_REMOVED*/*ID*/4294967295");
    row("/100%%/%%s%s/%i", "/100%/%sid%s7/-1", "/100%/%s*ID*/-1");
    const std::string cut(1023, 'x');
    row(cut + "x", cut, cut);
    for (const char* const refused : {"%s%d%s%s", "%d", "%s%s", "%10s", "/%s%"})
        row(refused, "", "");
}

}  // namespace
}  // namespace pelorus
