#include "unit/router/router_fixture.h"

namespace pelorus {
namespace {

const std::string kHelper = "/etc/scripts/tavik_helper.sh ";
const std::string kList = kHelper + "list";

class MakerRouterTest : public RouterTest {
protected:
    MakerRouterTest() { commands.answer("getip.sh lan", "192.168.77.1\n"); }
};

TEST_F(MakerRouterTest, OnlyAddressesAreTakenFromTheScript) {
    const auto row = [&](const char* wan, const char* lan, const std::string& addresses) {
        commands.answer("getip.sh wan", wan);
        commands.answer("getip.sh lan", lan);
        const std::string connected = std::to_string(router.initIpAddrBrenvik());
        EXPECT_EQ(connected + " " + router.getExternalIp() + " " + router.getLocalIp(), addresses);
    };
    row("44.128.0.20\nsecond line\n", " 192.168.77.1 \n", "1 44.128.0.20 192.168.77.1");
    row("getip.sh: no link", "10.0.0.1\"; reboot; \"", "0 44.128.0.20 192.168.77.1");
    row("\n44.128.0.9\n", "10.0.0.1\n", "0 44.128.0.20 10.0.0.1");
    row("44.128.0.9", "", "1 44.128.0.9 10.0.0.1");
    EXPECT_EQ(commands.lines().size(), 8U);  // both are always asked
    EXPECT_FALSE(router.isInitialized() || router.hasExternalIpChanged());
}

TEST_F(MakerRouterTest, TheListDecidesWhetherAPortIsMapped) {
    const Texts kept{kList};
    const Texts added{kList, kHelper + "add \"TCP,9091,192.168.77.1,80,Kavra\""};
    const auto row = [&](int result, const Texts& run, const std::string& list) {
        commands.clear();
        commands.answer(kList, list);
        EXPECT_EQ(router.mapPortBrenvik(80, 9091, "TCP", "Kavra"), result) << list;
        EXPECT_EQ(commands.lines(), run) << list;
    };
    router.initIpAddrBrenvik();
    row(1, kept, "BRENVIK,TCP,9091,192.168.77.1,80,Kavra\n");
    row(1, kept, " BRENVIK , TCP , 9090 - 9092 , 192.168.77.1 , 80 , \r\n");
    row(1, added, "BRENVIK,TCP,9091,192.168.77.9,80,Kavra\n");  // an old address of this device
    row(1, added, "OTHER,UDP,9091,192.168.77.7,80,x\n");
    row(0, kept, "OTHER,TCP,9000-65535,192.168.77.1,80,web, cam\n");
    const std::string unreadable =
        ",,,\n\nNOBODY,TCP,9091,192.168.77.1,80,x\nOTHER,TCP,9091X,192.168.77.7,80,x\n"
        "OTHER,TCP,9091-65536,192.168.77.7,80,x\nOTHER,TCP,9091,192.168.77.7,80\n"
        "OTHER,TCP,9091,,80,x\n" +
        std::string(5000, 'x') + "\n";
    row(1, added, unreadable);
    row(0, kept, unreadable + "OTHER,TCP,9091,192.168.77.7,80,");
}

TEST_F(MakerRouterTest, ArgumentsStayInsideTheirQuotes) {
    EXPECT_TRUE(router.mapPortBrenvik(80, 0, "TCP", "Kavra") == 0 && commands.lines().empty());
    EXPECT_TRUE(router.unmapPortBrenvik(80, 0, "TCP") == 1 && commands.lines().empty());
    commands.answer("tavik_helper.sh", "", 1);
    EXPECT_EQ(router.unmapPortBrenvik(80, 9091, "TCP"), 1);
    EXPECT_EQ(router.mapPortBrenvik(80, 9091, "TCP", "a\"$(b)`c`\\"), 1);
    EXPECT_EQ(commands.lines().back(),
              kHelper + "add \"TCP,9091,192.168.77.1,80,a\\\"\\$(b)\\`c\\`\\\\\"");
    commands.answer("/etc/scripts/", support::FakeCommands::Answer{"", 0, true, {}});
    EXPECT_EQ(router.initIpAddrBrenvik() + router.unmapPortBrenvik(80, 9091, "TCP"), 0);
    EXPECT_EQ(router.mapPortBrenvik(80, 9091, "TCP", "Kavra"), 0);
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
              (Texts{kList, "/etc/scripts/getip.sh wan", "/etc/scripts/getip.sh lan",
                     kHelper + "remove \"TCP,9091,192.168.77.1,80\"",
                     kHelper + "remove \"TCP,9096,192.168.77.1,443\""}));
    EXPECT_EQ(clock.pauses(), (std::vector<long>{1, 1}));
    EXPECT_EQ(router.getPortListBrenvik("TCP").front().lastExternal, 9093);
    EXPECT_EQ(router.getPortListBrenvik("TCP").back().description, "mine, too");
}

}  // namespace
}  // namespace pelorus
