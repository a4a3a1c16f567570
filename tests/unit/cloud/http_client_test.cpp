#include <string>

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

TEST_F(HttpClientTest, ATransferSetsItsOptionsInOrderAndNoOthers) {
    givenClient();
    web.answer("/x", "body");
    EXPECT_EQ(get(), "body");
    EXPECT_EQ(web.options(), (FakeWeb::Options{{CURLOPT_TIMEOUT_MS, "30000"},
                                               {CURLOPT_WRITEFUNCTION, ""},
                                               {CURLOPT_WRITEDATA, ""},
                                               {CURLOPT_SSLVERSION, "0"},
                                               {CURLOPT_URL, kUrl},
                                               {CURLOPT_SSL_VERIFYPEER, "1"}}));
}

TEST_F(HttpClientTest, TheLargestAnswerIsTakenAndOneByteMoreIsNone) {
    givenClient();
    FakeWeb::Answer large{std::string(10000, 'a') + std::string(238, 'b'), CURLE_OK, 1000};
    web.answer("/x", large);
    EXPECT_EQ(get(), large.body);
    large.body += 'b';
    web.answer("/x", large);
    EXPECT_EQ(get(), "(null)");
    EXPECT_EQ(log.countPart("TavikClient curlRcvData - Buffer overrun detected"), 1);
}

TEST_F(HttpClientTest, WhatCameBeforeAFailureIsGivenButNothingWithoutAUrlOrAHandle) {
    givenClient();
    web.answer("/x", FakeWeb::Answer{"half", CURLE_OPERATION_TIMEDOUT});
    EXPECT_EQ(get(), "half");
    expectLogged(LOG_ERR, "TavikClient::httpGet  Error: [Timeout was reached]\n");
    EXPECT_EQ(get(nullptr), "(null)");
    EXPECT_EQ(get(""), "(null)");
    EXPECT_EQ(log.count(LOG_INFO, "TavikClient:httpGet - empty url\n"), 2);
    web.failHandles();
    EXPECT_EQ(get(), "(null)");
}

TEST_F(HttpClientTest, WithoutCredentialsTheFirstUseReportsDisabledOnce) {
    givenConfig({{"LOCAL_SETCOMMSTATUSURL", "http://127.0.0.1/%d/%s"}}, {{"DEVICEAUTH", ""}});
    web.failGlobalInit();
    TavikClient::getInstance();
    EXPECT_TRUE(TavikClient::getInstance()->lastPortTestPassed());
    EXPECT_EQ(web.urls(), (Urls{"http://127.0.0.1/0/disabled"}));
    EXPECT_EQ(web.globalInits(), 1);
    expectLogged(LOG_ERR, "TavikClient::initialize() - CURL initialization failed.\n");
    EXPECT_EQ(log.countPart("initialize() returned false, set Comm Status to [disabled]\n"), 1);
}

TEST_F(HttpClientTest, InitializingReadsBothCredentials) {
    TavikClient& client = givenClient();
    setConfig("DEVICEID", "");
    setConfig("DYNAMIC_CONFIG_TMP", path("gone"));  // every read of a setting complains once
    EXPECT_FALSE(client.initialize());
    EXPECT_EQ(log.countPart("failed to stat TEMP dynamic config file"), 2);
}

struct BaseRow {
    const char* name;
    std::string base;
    HttpType type;
    std::string url;
};

class RestUrl : public CloudTest, public ::testing::WithParamInterface<BaseRow> {};

TEST_P(RestUrl, FollowsTheConfiguredBase) {
    const BaseRow& row = GetParam();
    givenConfig({{"SERVER_BASE_URL", row.base}});
    EXPECT_EQ(TavikClient::getInstance()->getRestUrl("/%s", row.type), row.url);
    EXPECT_EQ(log.countPart("Invalid base server url " + row.base + ". Return input urn.\n"),
              row.url == "/%s" ? 1 : 0);
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(, RestUrl, ::testing::Values(
    BaseRow{"TheConfiguredSchemeIsDropped", "https://h.x", HTTP, "http://h.x/%s"},
    BaseRow{"APathOfTheBaseStays", "http://h.x/p", HTTPS, "https://h.x/p/%s"},
    BaseRow{"TwoCharactersAreAHost", "http://ab", HTTPS, "https://ab/%s"},
    BaseRow{"OneCharacterIsNone", "http://a", HTTPS, "/%s"},
    BaseRow{"NoSlashIsNoBase", "web.kavra.example", HTTP, "/%s"},
    BaseRow{"NoBaseIsInvalid", "", HTTP, "/%s"}),
    support::RowName{});
// clang-format on

TEST_F(HttpClientTest, TheServerIsReadOnceAndLoggedWithoutPercentSigns) {
    TavikClient& client = givenClient();
    setConfig("SERVER_BASE_URL", "http://two.x");
    EXPECT_EQ(client.getRestUrl("/a", static_cast<HttpType>(0)), "/a");
    EXPECT_EQ(client.getRestUrl("/%s%n", HTTP), "http://web.kavra.example/%s%n");
    EXPECT_EQ(log.countPart("getRestUrl - restURL http://web.kavra.example/_s_n.\n"), 1);
}

TEST_F(HttpClientTest, ALookupGivesTheFirstAddressAndMasksAnUnknownName) {
    TavikClient& client = givenClient();
    net.setName("four", {"44.128.0.20", "2001:db8::1"});
    net.setName("six", {"2001:db8::1", "44.128.0.20"});
    EXPECT_EQ(client.nsLookup("four"), "44.128.0.20");
    EXPECT_EQ(client.nsLookup("six"), "2001:db8::1");
    EXPECT_EQ(client.nsLookup("device-7350142.homecloud-smith.kavra.example"), "");
    EXPECT_EQ(log.countPart("hostname: *ID_REMOVED*.*SUBDOMAIN_REMOVED*.kavra.example\n"), 1);
    EXPECT_FALSE(client.validateIpAddress("::1"));
    EXPECT_FALSE(client.validateIpAddress(std::string("1.2.3.4\0x", 9)));
}

}  // namespace
}  // namespace pelorus
