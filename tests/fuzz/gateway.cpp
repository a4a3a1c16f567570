// A UPnP gateway: the list of devices, the external address and the mappings it reports.
#include "common/text.h"
#include "fuzz_world.h"
#include "router/router.h"

// Three numbers, the address, seven texts of a mapping, the address of another interface, then URLs
// and search targets.
void pelorus::fuzz::tryText(const std::string& text) {
    begin("3");
    auto& gateway = support::FakeGateway::get();
    const auto part = fields(text, 12);
    gateway.igdState = leadingInt(part[0]);
    gateway.externalIpStatus = leadingInt(part[1]);
    gateway.externalIp = part[3];
    gateway.lie = {
        leadingInt(part[2]), part[4], part[5], part[6], part[7], part[8], part[9], part[10]};
    if (part.size() > 13) gateway.devices.clear();
    for (std::size_t at = 12; at + 1 < part.size(); at += 2) {
        gateway.devices.emplace_back(part[at].substr(0, part[at].find(' ')), part[at + 1]);
    }
    support::FakeNet::get().interfaces.push_back({"eth1", part[11]});
    gateway.onCall([](const auto& /*line*/) { support::VirtualClock::get().advance(10); });

    Router router;
    router.initLocalIp();
    const bool found = router.upnp_discover();
    assert(!found || (!router.getExternalIp().empty() && router.getExternalIp().size() <= 16));
    for (const auto& line : gateway.calls("igd ")) {
        for (const auto& url : fields(line.substr(4), 1, ' ')) {
            const std::string host = url.substr(7, url.find_first_of(":/", 7) - 7);
            assert(url.rfind("http://", 0) == 0 && host != support::kDeviceAddress &&
                   host != part[11]);
            assert(host.find_first_not_of("0123456789.") == std::string::npos);
            assert(host.rfind("127.", 0) != 0 && host.rfind("0.", 0) != 0);
        }
    }
    int port = 9091;
    const bool mapped = router.mapPort(80, port, "TCP", "Kavra", false);
    assert(!mapped || (found && port == 9091 && part[4] != "192.168.77.30"));
    static_cast<void>(router.isPortMapped(port, "TCP"));
    router.unmapAllPorts("TCP", "Kavra");
    const bool isOwn = part[4] == support::kDeviceAddress && part[6] == "Kavra";
    assert(isOwn || gateway.count("unmap ") == 0);
    assert(gateway.count("entry #") <= 4 * 7);
    gateway.checkReleased();
}
