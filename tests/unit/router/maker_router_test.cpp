#include "unit/router/router_fixture.h"

namespace pelorus {
namespace {

using support::expectLogIs;
using support::FakeCommands;

const std::string kList = "/etc/scripts/tavik_helper.sh list";
const std::string kWan = "/etc/scripts/getip.sh wan";
const std::string kLan = "/etc/scripts/getip.sh lan";

class MakerRouterTest : public RouterTest {
protected:
    MakerRouterTest() {
        commands.answer(kWan, "44.128.0.20\nsecond line\n");
        commands.answer(kLan, " 192.168.77.1 \n");
    }
    void knowAddresses() {
        ASSERT_GT(router.initIpAddrBrenvik(), 0);
        commands.clear();
    }
    void failAll(const std::string& part) {
        FakeCommands::Answer answer;
        answer.fails = true;
        commands.answer(part, answer);
    }
};

struct Addresses {
    const char* name;
    std::string wan;
    std::string lan;
    bool connected;
    std::string externalIp;
    std::string localIp;
};

class ScriptAnswer : public MakerRouterTest, public ::testing::WithParamInterface<Addresses> {};

TEST_P(ScriptAnswer, BecomesTheAddresses) {
    const Addresses& row = GetParam();
    knowAddresses();
    log.clear();
    commands.answer(kWan, row.wan);
    commands.answer(kLan, row.lan);
    EXPECT_EQ(router.initIpAddrBrenvik() > 0, row.connected);
    EXPECT_EQ(router.getExternalIp(), row.externalIp);
    EXPECT_EQ(router.getLocalIp(), row.localIp);
    EXPECT_EQ(commands.lines(), (Texts{kWan, kLan}));
    if (row.connected) {
        expectLogIs({});
    } else {
        expectLogIs({{LOG_ERR,
                      "Router::initIpAddrBrenvik - Not connected to internet. Please check network "
                      "connectivity.\n"}});
    }
    EXPECT_FALSE(router.isInitialized());
    EXPECT_FALSE(router.hasExternalIpChanged());
    EXPECT_FALSE(router.hasLocalIpChanged());
}

INSTANTIATE_TEST_SUITE_P(
    ,
    ScriptAnswer,
    ::testing::Values(Addresses{"BothAreTaken", "44.128.0.9\n", "10.0.0.1\n", true, "44.128.0.9",
                                "10.0.0.1"},
                      Addresses{"WithoutAWanAddressThereIsNoInternet", "\n44.128.0.9\n",
                                "10.0.0.1\n", false, "44.128.0.20", "10.0.0.1"},
                      Addresses{"AnEmptyLanAddressClearsNothing", "44.128.0.9", "", true,
                                "44.128.0.9", "192.168.77.1"},
                      Addresses{"WhatIsNoAddressIsNotTaken", "getip.sh: no link",
                                "10.0.0.1\"; reboot; \"", false, "44.128.0.20", "192.168.77.1"}),
    [](const auto& row) { return row.param.name; });

TEST_F(MakerRouterTest, ScriptsThatCannotBeRunGiveNothing) {
    failAll("/etc/scripts/");
    EXPECT_EQ(router.initIpAddrBrenvik(), 0);
    EXPECT_EQ(router.getLocalIp(), "");
    EXPECT_EQ(router.mapPortBrenvik(80, 9091, "TCP", "Kavra"), 0);
    EXPECT_EQ(router.unmapPortBrenvik(80, 9091, "TCP"), 0);
    EXPECT_TRUE(router.getPortListBrenvik("TCP").empty());
}

const std::string kAdd = "/etc/scripts/tavik_helper.sh add \"TCP,9091,192.168.77.1,80,Kavra\"";

struct ListLine {
    const char* name;
    std::string line;
    int result;
    bool added;
};

class MappingWithList : public MakerRouterTest, public ::testing::WithParamInterface<ListLine> {};

TEST_P(MappingWithList, DecidesByTheEntryOfThePort) {
    const ListLine& row = GetParam();
    knowAddresses();
    commands.answer(kList, row.line);
    EXPECT_EQ(router.mapPortBrenvik(80, 9091, "TCP", "Kavra"), row.result);
    EXPECT_EQ(commands.lines(), row.added ? (Texts{kList, kAdd}) : (Texts{kList}));
}

INSTANTIATE_TEST_SUITE_P(
    ,
    MappingWithList,
    ::testing::Values(
        ListLine{"EmptyListAdds", "", 1, true},
        ListLine{"OwnEntryStands", "BRENVIK,TCP,9091,192.168.77.1,80,Kavra\n", 1, false},
        ListLine{"BlanksAreTrimmed", " BRENVIK , TCP , 9090 - 9092 , 192.168.77.1 , 80 , \r\n", 1,
                 false},
        ListLine{"OthersEntryIsNotTouched", "OTHER,TCP,9091,192.168.77.7,80,web, cam\n", 0, false},
        ListLine{"OthersEntryToThisDeviceIsNotTouched", "OTHER,TCP,9000-9100,192.168.77.1,80,x\n",
                 0, false},
        ListLine{"OwnEntryOfAnOldAddressIsReplaced", "BRENVIK,TCP,9091,192.168.77.9,80,Kavra\n", 1,
                 true},
        ListLine{"OtherProtocolDoesNotCount", "OTHER,UDP,9091,192.168.77.7,80,x\n", 1, true},
        ListLine{"OtherPortDoesNotCount", "OTHER,TCP,9092-9099,192.168.77.7,80,x\n", 1, true},
        ListLine{"UnknownOwnerDoesNotParse", "NOBODY,TCP,9091,192.168.77.7,80,x\n", 1, true},
        ListLine{"BackwardRangeDoesNotParse", "OTHER,TCP,9092-9090,192.168.77.7,80,x\n", 1, true},
        ListLine{"PartialNumberDoesNotParse", "OTHER,TCP,9091x,192.168.77.7,80,x\n", 1, true},
        ListLine{"PortBeyondTheHighestDoesNotParse", "OTHER,TCP,9091-65536,192.168.77.7,80,x\n", 1,
                 true},
        ListLine{"PortZeroDoesNotParse", "OTHER,TCP,0-9091,192.168.77.7,80,x\n", 1, true},
        ListLine{"MissingFieldDoesNotParse", "OTHER,TCP,9091,192.168.77.7,80\n", 1, true},
        ListLine{"NoAddressDoesNotParse", "OTHER,TCP,9091,,80,x\n", 1, true},
        ListLine{"AGoodLineAfterGarbageCounts", ",,,\n\nnonsense\nOTHER,TCP,9091,192.168.77.7,80,",
                 0, false},
        ListLine{
            "AnEndlessLineIsOneLine",
            std::string(5000, 'x') + "\nOTHER,TCP,9091,192.168.77.7,80," + std::string(5000, ','),
            0, false}),
    [](const auto& row) { return row.param.name; });

TEST_F(MakerRouterTest, MappingNeedsAPort) {
    EXPECT_EQ(router.mapPortBrenvik(80, 0, "TCP", "Kavra"), 0);
    EXPECT_EQ(router.mapPortBrenvik(80, -1, "TCP", "Kavra"), 0);
    EXPECT_EQ(router.unmapPortBrenvik(80, 0, "TCP"), 1);
    EXPECT_EQ(commands.lines(), Texts{});
}

TEST_F(MakerRouterTest, OnlyACommandThatCannotBeRunFails) {
    knowAddresses();
    commands.answer("tavik_helper.sh", "", 1);
    EXPECT_EQ(router.mapPortBrenvik(80, 9091, "TCP", "Kavra"), 1);
    EXPECT_EQ(router.unmapPortBrenvik(80, 9091, "TCP"), 1);
    EXPECT_EQ(commands.lines().back(),
              "/etc/scripts/tavik_helper.sh remove \"TCP,9091,192.168.77.1,80\"");
    failAll("tavik_helper.sh add");
    failAll("tavik_helper.sh remove");
    EXPECT_EQ(router.mapPortBrenvik(80, 9091, "TCP", "Kavra"), 0);
    EXPECT_EQ(router.unmapPortBrenvik(80, 9091, "TCP"), 0);
}

TEST_F(MakerRouterTest, NothingLeavesTheQuotes) {
    knowAddresses();
    EXPECT_EQ(router.mapPortBrenvik(80, 9091, "TCP", "a\"$(b)`c`\\"), 1);
    EXPECT_EQ(commands.lines().back(),
              "/etc/scripts/tavik_helper.sh add "
              "\"TCP,9091,192.168.77.1,80,a\\\"\\$(b)\\`c\\`\\\\\"");
}

TEST_F(MakerRouterTest, ListsTheEntriesOfThisDevice) {
    commands.answer(kList,
                    "BRENVIK,TCP,9091-9093,192.168.77.1,80,Kavra\n"
                    "BRENVIK,TCP,9094,192.168.77.2,80,Kavra\n"
                    "BRENVIK,UDP,9095,192.168.77.1,80,Kavra\n"
                    "OTHER,TCP,9096,192.168.77.1,443,mine, too\n");
    // The address is not known yet: the script is asked.
    const std::vector<_BrenvikPortIp> entries = router.getPortListBrenvik("TCP");
    ASSERT_EQ(entries.size(), 2U);
    EXPECT_EQ(entries[0].internalPort, 80);
    EXPECT_EQ(entries[0].firstExternal, 9091);
    EXPECT_EQ(entries[0].lastExternal, 9093);
    EXPECT_EQ(entries[1].owner, "OTHER");
    EXPECT_EQ(entries[1].internalPort, 443);
    EXPECT_EQ(entries[1].lastExternal, 9096);
    EXPECT_EQ(entries[1].description, "mine, too");
    commands.answer(kList, "");
    EXPECT_TRUE(router.getPortListBrenvik("TCP").empty());
}

TEST_F(MakerRouterTest, UnmappingAllTakesOneRemovalAndOnePauseForEachEntry) {
    commands.answer(kList,
                    "BRENVIK,TCP,9091-9093,192.168.77.1,80,Kavra\n"
                    "BRENVIK,TCP,9094,192.168.77.2,80,Kavra\n"
                    "BRENVIK,TCP,9444,192.168.77.1,443,KavraSSL\n");
    router.unmapAllPortBrenvik("TCP");
    EXPECT_EQ(commands.lines(),
              (Texts{kList, kWan, kLan,
                     "/etc/scripts/tavik_helper.sh remove \"TCP,9091,192.168.77.1,80\"",
                     "/etc/scripts/tavik_helper.sh remove \"TCP,9444,192.168.77.1,443\""}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{1, 1}));
}

}  // namespace
}  // namespace pelorus
