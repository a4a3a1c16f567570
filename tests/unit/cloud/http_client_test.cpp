#include <cstdlib>
#include <stdexcept>
#include <string>
#include <utility>

#include "cloud_fixture.h"
#include "common/handles.h"

namespace pelorus {

namespace {

constexpr const char* kUrl = "http://web.kavra.example/x";
constexpr auto kNoType = static_cast<HttpType>(0);

class HttpClientTest : public CloudTest {
protected:
    // What httpGet gives; "(null)" for nothing.
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
    std::vector<std::pair<int, std::string>> set;
    for (const auto& [option, value] : web.options()) set.emplace_back(option, value);
    EXPECT_EQ(set, (std::vector<std::pair<int, std::string>>{{CURLOPT_TIMEOUT_MS, "30000"},
                                                             {CURLOPT_WRITEFUNCTION, ""},
                                                             {CURLOPT_WRITEDATA, ""},
                                                             {CURLOPT_SSLVERSION, "0"},
                                                             {CURLOPT_URL, kUrl},
                                                             {CURLOPT_SSL_VERIFYPEER, "1"}}));
    expectLogIs({});
}

TEST_F(HttpClientTest, TheLargestAnswerIsTakenAndOneByteMoreIsNone) {
    givenClient();
    FakeWeb::Answer large;
    large.body = std::string(10000, 'a') + std::string(238, 'b');
    large.chunk = 1000;
    web.answer("/x", large);
    EXPECT_EQ(get(), large.body);
    large.body += 'b';
    web.answer("/x", large);
    EXPECT_EQ(get(), "(null)");
    EXPECT_EQ(size, 0);
    expectLogIs(
        {{LOG_ERR,
          "TavikClient curlRcvData - Buffer overrun detected, read buffer too small, transfer aborted\n"},
         {LOG_ERR,
          "TavikClient::httpGet  Error: [Failed writing received data to disk/application]\n"}});
}

TEST_F(HttpClientTest, AChunkWhoseSizeOverflowsIsAborted) {
    CurlRcvBuffer buffer;
    char byte = 'x';
    EXPECT_EQ(curlRcvData(&byte, std::size_t{1} << 33U, std::size_t{1} << 31U, &buffer), 0U);
    EXPECT_EQ(buffer.data, nullptr);
}

TEST_F(HttpClientTest, WhatCameBeforeAFailureIsGiven) {
    givenClient();
    FakeWeb::Answer partial = FakeWeb::noAnswer(CURLE_OPERATION_TIMEDOUT);
    partial.body = "half";
    web.answer("/x", partial);
    EXPECT_EQ(get(), "half");
    expectLogIs({{LOG_ERR, "TavikClient::httpGet  Error: [Timeout was reached]\n"}});
}

TEST_F(HttpClientTest, WithoutAUrlOrAHandleThereIsNoAnswer) {
    givenClient();
    EXPECT_EQ(get(nullptr), "(null)");
    EXPECT_EQ(get(""), "(null)");
    EXPECT_EQ(size, -7);
    EXPECT_EQ(log.count(LOG_INFO, "TavikClient:httpGet - empty url\n"), 2);
    web.failHandles();
    EXPECT_EQ(get(), "(null)");
    EXPECT_EQ(size, 0);
}

TEST_F(HttpClientTest, WithoutCredentialsTheFirstUseReportsDisabledOnce) {
    givenConfig({{"LOCAL_SETCOMMSTATUSURL", "http://127.0.0.1/%d/%s"}}, {{"DEVICEAUTH", ""}});
    web.answer("127.0.0.1", "success");
    TavikClient::getInstance();
    EXPECT_TRUE(TavikClient::getInstance()->lastPortTestPassed());
    EXPECT_EQ(web.urls(), (Urls{"http://127.0.0.1/0/disabled"}));
    EXPECT_EQ(web.globalInits(), 1);
    expectLoggedInOrder(
        {"TavikClient::initialize() - failed to read DEVICEID, DEVICEAUTH from dynamic config file\n",
         "TavikClient::updateLocalCommStatus - Successful update status.\n\n",
         "TavikClient::getInstance() - initialize() returned false, set Comm Status to [disabled]\n"});
}

TEST_F(HttpClientTest, ALibraryThatDoesNotStartIsLoggedOnly) {
    givenConfig();
    web.failGlobalInit();
    TavikClient::getInstance();
    expectLogIs({{LOG_ERR, "TavikClient::initialize() - CURL initialization failed.\n"}});
}

struct BaseRow : Case {
    std::string base;
    HttpType type;
    const char* url;
    bool valid;
};

class RestUrl : public CloudTest, public ::testing::WithParamInterface<BaseRow> {};

TEST_P(RestUrl, FollowsTheConfiguredBase) {
    givenConfig({{"SERVER_BASE_URL", GetParam().base}});
    EXPECT_EQ(TavikClient::getInstance()->getRestUrl("/%s", GetParam().type), GetParam().url);
    const std::string invalid = "TavikClient::getRestUrl - Invalid base server url " +
                                GetParam().base + ". Return input urn.\n";
    EXPECT_EQ(log.count(LOG_ERR, invalid), GetParam().valid ? 0 : 1);
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    RestUrl,
    ::testing::Values(
        BaseRow{{"TheConfiguredSchemeIsDropped"}, "https://h.x", HTTP, "http://h.x/%s", true},
        BaseRow{{"APathOfTheBaseStays"}, "http://h.x/p", HTTPS, "https://h.x/p/%s", true},
        BaseRow{{"TwoCharactersAreAHost"}, "http://ab", HTTPS, "https://ab/%s", true},
        BaseRow{{"OneCharacterIsNone"}, "http://a", HTTPS, "/%s", false},
        BaseRow{{"NoSlashIsNoBase"}, "web.kavra.example", HTTP, "/%s", false},
        BaseRow{{"NoBaseIsInvalid"}, "", HTTP, "/%s", false}),
    CaseName{});

TEST_F(HttpClientTest, TheServerIsReadOnceAndLoggedWithoutPercentSigns) {
    givenConfig({{"SERVER_BASE_URL", "http://one.x"}});
    TavikClient& client = *TavikClient::getInstance();
    EXPECT_EQ(client.getRestUrl("/a", kNoType), "/a");
    setConfig("SERVER_BASE_URL", "http://two.x");
    EXPECT_EQ(client.getRestUrl("/%s%n", HTTP), "http://one.x/%s%n");
    expectLogIs(
        {{LOG_INFO, "TavikClient::getRestUrl - baseServerUrl http://one.x.\n"},
         {LOG_INFO, "TavikClient::getRestUrl - baseSSLServerUrl https://one.x.\n"},
         {LOG_INFO, "TavikClient::getRestUrl - Invalid http type 0. Use only the input urn.\n"},
         {LOG_INFO, "TavikClient::getRestUrl - restURL /a.\n"},
         {LOG_INFO, "TavikClient::getRestUrl - restURL http://one.x/_s_n.\n"}});
}

TEST_F(HttpClientTest, ALookupGivesTheFirstAddressAndMasksAnUnknownName) {
    TavikClient& client = givenClient();
    net.setName("four", {"44.128.0.20", "2001:db8::1"});
    net.setName("six", {"2001:db8::1", "44.128.0.20"});
    EXPECT_EQ(client.nsLookup("four"), "44.128.0.20");
    EXPECT_EQ(client.nsLookup("six"), "2001:db8::1");
    EXPECT_EQ(client.nsLookup("device-7350142.homecloud-smith.kavra.example"), "");
    expectLogIs(
        {{LOG_ERR,
          "TavikClient::nsLookup() - getAddrInfo failed with error: Name or service not known\n"},
         {LOG_ERR,
          "TavikClient::nsLookup() - getAddrInfo failed hostname: *ID_REMOVED*.*SUBDOMAIN_REMOVED*.kavra.example\n"}});
}

TEST_F(HttpClientTest, OnlyADottedAddressIsValid) {
    const TavikClient& client = givenClient();
    EXPECT_TRUE(client.validateIpAddress("44.128.0.20"));
    const std::string withNul("44.128.0.20\0x", 13);
    for (const std::string& text :
         {std::string{}, std::string{"44.128.0.20\n"}, std::string{"::1"}, withNul}) {
        EXPECT_FALSE(client.validateIpAddress(text)) << text;
    }
}

}  // namespace

}  // namespace pelorus
