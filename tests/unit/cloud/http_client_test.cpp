#include "cloud/url_template.h"
#include "cloud_fixture.h"
#include "common/handles.h"

namespace pelorus {
namespace {

using HttpClientTest = CloudTest;
using FirstUseTest = support::PelorusTest;

TEST_F(HttpClientTest, AnAnswerIsKeptAsFarAsItCameAndFits) {
    int size = -7;
    const auto get = [&](const char* url) {
        const MallocHandle<char> data{client.httpGet(url, size)};
        return data ? std::string(data.get(), static_cast<std::size_t>(size)) : "(null)";
    };
    EXPECT_EQ(get(nullptr) + get(""), "(null)(null)");
    EXPECT_EQ(size, -7);
    const std::string large = std::string(10000, 'a') + std::string(238, 'b');
    web.answer("x", large);
    EXPECT_EQ(get("x"), large);
    const FakeWeb::Options options{
        {CURLOPT_TIMEOUT_MS, "30000"}, {CURLOPT_WRITEFUNCTION, ""}, {CURLOPT_WRITEDATA, ""},
        {CURLOPT_SSLVERSION, "0"},     {CURLOPT_URL, "x"},          {CURLOPT_SSL_VERIFYPEER, "1"}};
    EXPECT_EQ(web.options(), options);
    web.answer("x", large + "c");
    EXPECT_EQ(get("x"), "(null)");
    web.answer("x", {"half", CURLE_OPERATION_TIMEDOUT});
    EXPECT_EQ(get("x"), "half");
    EXPECT_EQ(log.countPart("TavikClient::httpGet  Error: [Timeout was reached]\n"), 1);
    web.handlesFail = true;
    EXPECT_EQ(get("x"), "(null)");
}

TEST_F(FirstUseTest, ReportsDisabledOnceWithoutCredentials) {
    givenConfig({{"LOCAL_SETCOMMSTATUSURL", "http://127.0.0.1/%d/%s"}}, {{"DEVICEAUTH", ""}});
    FakeWeb::get().globalInitFails = true;
    TavikClient::getInstance();
    EXPECT_TRUE(TavikClient::getInstance()->lastPortTestPassed());
    EXPECT_EQ(FakeWeb::get().urls(), (Urls{"http://127.0.0.1/0/disabled"}));
    EXPECT_EQ(FakeWeb::get().globalInits, 1);
    EXPECT_EQ(log.countPart("TavikClient::initialize() - CURL initialization failed.\n"), 1);
    EXPECT_EQ(log.countPart("initialize() - failed to read DEVICEID, DEVICEAUTH from"), 1);
    setConfig("DEVICEID", "");
    setConfig("DEVICEAUTH", support::kDeviceAuth);
    EXPECT_FALSE(TavikClient::getInstance()->initialize());
}

TEST_F(FirstUseTest, OnlyTheHostOfTheFirstUsableBaseCounts) {
    givenConfig();
    const auto url = [&](const char* base, const char* urn, int type) {
        setConfig("SERVER_BASE_URL", base);
        return TavikClient::getInstance()->getRestUrl(urn, static_cast<HttpType>(type));
    };
    EXPECT_EQ(url("", "/%s", HTTP) + url("web.kavra.example", "/%d", HTTP), "/%s/%d");
    EXPECT_EQ(url("http://a", "/%s", HTTP), "/%s");
    EXPECT_EQ(url("x://ab", "/%s", HTTPS), "https://ab/%s");
    EXPECT_EQ(url("http://two.x", "/a", 0), "/a");
    EXPECT_EQ(url("http://two.x", "/%s%n", HTTP), "http://ab/%s%n");
    EXPECT_EQ(log.countPart("getRestUrl - restURL http://ab/_s_n.\n"), 1);
}

TEST_F(HttpClientTest, ALookupGivesTheFirstAddressAndMasksAnUnknownName) {
    net.names["six"] = {"2001:db8::1", "44.128.0.20"};
    EXPECT_EQ(client.nsLookup("six"), "2001:db8::1");
    EXPECT_EQ(client.nsLookup("device-7350142.homecloud-smith.kavra.example"), "");
    EXPECT_EQ(log.countPart("hostname: *ID_REMOVED*.*SUBDOMAIN_REMOVED*.kavra.example\n"), 1);
}

TEST_F(HttpClientTest, AUrlTemplateIsFilledOrRefusedWithOneLine) {
    const auto row = [&](const std::string& urlTemplate, const std::string& filled) {
        log.clear();
        const MaskedUrl url = fillMaskedTemplate(
            "SOME_URL", urlTemplate, {SecretArgument{"id%s7", "*ID*"}, -1, "%d&#device-7350142"});
        EXPECT_EQ(url.request + "; " + url.logged, filled) << urlTemplate;
        EXPECT_EQ(log.countPart("SOME_URL"), url.request.empty() ? 1 : 0) << urlTemplate;
    };
    row("/%s/%d/%s", "/id%s7/-1/%25d%26%23device-7350142; /*ID*/-1/%25d%26%23*ID_REMOVED*");
    row("/device-7350142%s/%u", "/device-7350142id%s7/4294967295; /*ID_REMOVED**ID*/4294967295");
    row("/100%%/%%s%s/%i", "/100%/%sid%s7/-1; /100%/%s*ID*/-1");
    const std::string cut(1023, 'x');
    row(cut + "x", cut + "; " + cut);
    for (const auto* const refused : {"%s%d%s%s", "%d", "%s%s", "%10s", "/%s%"}) row(refused, "; ");
}

}  // namespace
}  // namespace pelorus
