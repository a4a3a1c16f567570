#include "unit/router/router_fixture.h"

namespace pelorus {
namespace {

const std::string kHelper = "/etc/scripts/tavik_helper.sh ";
const std::string kList = kHelper + "list";
const std::string kWan = "/etc/scripts/getip.sh wan";
const std::string kLan = "/etc/scripts/getip.sh lan";

class MakerRouterTest : public RouterTest {
protected:
    MakerRouterTest() {
        commands.answer(kWan, "44.128.0.20\nsecond line\n");
        commands.answer(kLan, " 192.168.77.1 \n");
    }
};

TEST_F(MakerRouterTest, OnlyAddressesAreTakenFromTheScript) {
    const auto taken = [&](const std::string& wan, const std::string& lan) {
        commands.answer(kWan, wan);
        commands.answer(kLan, lan);
        const std::string connected = std::to_string(router.initIpAddrBrenvik());
        return connected + " " + router.getExternalIp() + " " + router.getLocalIp();
    };
    EXPECT_EQ(taken("44.128.0.20\nsecond line\n", " 192.168.77.1 \n"),
              "1 44.128.0.20 192.168.77.1");
    EXPECT_EQ(taken("getip.sh: no link", "10.0.0.1\"; reboot; \""), "0 44.128.0.20 192.168.77.1");
    EXPECT_EQ(taken("\n44.128.0.9\n", "10.0.0.1\n"), "0 44.128.0.20 10.0.0.1");
    EXPECT_EQ(taken("44.128.0.9", ""), "1 44.128.0.9 10.0.0.1");
    EXPECT_EQ(commands.count(kWan) + commands.count(kLan), 8);
    EXPECT_EQ(log.countPart("Not connected to internet"), 2);
    EXPECT_FALSE(router.isInitialized() || router.hasExternalIpChanged());
}

// clang-format off
struct ListLine { const char* name; std::string line; int result; bool added; };
class MappingWithList : public MakerRouterTest, public ::testing::WithParamInterface<ListLine> {};
INSTANTIATE_TEST_SUITE_P(, MappingWithList, ::testing::Values(
    ListLine{"OwnEntryStands", "BRENVIK,TCP,9091,192.168.77.1,80,Kavra\n", 1, false},
    ListLine{"BlanksAreTrimmed", " BRENVIK , TCP , 9090 - 9092 , 192.168.77.1 , 80 , \r\n", 1, false},
    ListLine{"OthersEntryIsNotTouchedEvenWhenItLeadsHere", "OTHER,TCP,9000-9100,192.168.77.1,80,web, cam\n", 0, false},
    ListLine{"OwnEntryOfAnOldAddressIsReplaced", "BRENVIK,TCP,9091,192.168.77.9,80,Kavra\n", 1, true},
    ListLine{"OtherProtocolDoesNotCount", "OTHER,UDP,9091,192.168.77.7,80,x\n", 1, true},
    ListLine{"UnknownOwnerDoesNotParse", "NOBODY,TCP,9091,192.168.77.1,80,x\n", 1, true},
    ListLine{"PartialNumberDoesNotParse", "OTHER,TCP,9091x,192.168.77.7,80,x\n", 1, true},
    ListLine{"PortBeyondTheHighestDoesNotParse", "OTHER,TCP,9091-65536,192.168.77.7,80,x\n", 1, true},
    ListLine{"MissingFieldDoesNotParse", "OTHER,TCP,9091,192.168.77.7,80\n", 1, true},
    ListLine{"NoAddressDoesNotParse", "OTHER,TCP,9091,,80,x\n", 1, true},
    ListLine{"AnEndlessLineIsOneLineAndALineAfterGarbageCounts", ",,,\n\n" + std::string(5000, 'x') + "\nOTHER,TCP,9091,192.168.77.7,80,", 0, false}), RowName{});
// clang-format on

TEST_P(MappingWithList, DecidesByTheEntryOfThePort) {
    const ListLine& row = GetParam();
    const std::string add = kHelper + "add \"TCP,9091,192.168.77.1,80,Kavra\"";
    ASSERT_GT(router.initIpAddrBrenvik(), 0);
    commands.clear();
    commands.answer(kList, row.line);
    EXPECT_EQ(router.mapPortBrenvik(80, 9091, "TCP", "Kavra"), row.result);
    EXPECT_EQ(commands.lines(), row.added ? (Texts{kList, add}) : (Texts{kList}));
}

TEST_F(MakerRouterTest, ArgumentsStayInsideTheirQuotes) {
    EXPECT_EQ(router.mapPortBrenvik(80, 0, "TCP", "Kavra"), 0);
    EXPECT_EQ(router.unmapPortBrenvik(80, 0, "TCP"), 1);
    EXPECT_EQ(commands.lines(), Texts{});
    commands.answer("tavik_helper.sh", "", 1);
    EXPECT_EQ(router.unmapPortBrenvik(80, 9091, "TCP"), 1);
    EXPECT_EQ(router.mapPortBrenvik(80, 9091, "TCP", "a\"$(b)`c`\\"), 1);
    EXPECT_EQ(commands.lines().back(),
              kHelper + "add \"TCP,9091,192.168.77.1,80,a\\\"\\$(b)\\`c\\`\\\\\"");
    commands.answer("/etc/scripts/", support::FakeCommands::Answer{"", 0, true, {}});
    EXPECT_EQ(router.initIpAddrBrenvik(), 0);
    EXPECT_EQ(router.mapPortBrenvik(80, 9091, "TCP", "Kavra"), 0);
    EXPECT_EQ(router.unmapPortBrenvik(80, 9091, "TCP"), 0);
}

TEST_F(MakerRouterTest, ListsAndRemovesTheEntriesOfThisDevice) {
    commands.answer(kList,
                    "BRENVIK,TCP,9091-9093,192.168.77.1,80,Kavra\n"
                    "BRENVIK,TCP,9094,192.168.77.2,80,Kavra\n"
                    "BRENVIK,UDP,9095,192.168.77.1,80,Kavra\n"
                    "OTHER,TCP,9096,192.168.77.1,443,mine, too\n");
    router.unmapAllPortBrenvik("TCP");
    // The address was not known yet: the script is asked.
    EXPECT_EQ(commands.lines(),
              (Texts{kList, kWan, kLan, kHelper + "remove \"TCP,9091,192.168.77.1,80\"",
                     kHelper + "remove \"TCP,9096,192.168.77.1,443\""}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{1, 1}));
    const std::vector<_BrenvikPortIp> entries = router.getPortListBrenvik("TCP");
    ASSERT_EQ(entries.size(), 2U);
    EXPECT_EQ(entries[0].lastExternal, 9093);
    EXPECT_EQ(entries[1].description, "mine, too");
}

}  // namespace
}  // namespace pelorus
