// The device's public names and the server's URLs. Built without access control: the client derives
// the URLs only once and therefore begins anew.
#include "cloud/tavik_client.h"
#include "connection/connection_manager.h"
#include "fuzz_world.h"

// The server's base URL, the host name and the address that the names have.
void pelorus::fuzz::tryText(const std::string& text) {
    begin("3");
    const auto part = fields(text, 3);
    GlobalConfig::getInstance()->setProperty("SERVER_BASE_URL", part[0], false);
    auto& net = support::FakeNet::get();
    net.hostname = part[1].substr(0, 64);  // the most that Linux has
    auto* const client = TavikClient::getInstance();
    client->~TavikClient();
    new (client) TavikClient;
    client->initialize();
    const std::string plain = client->getRestUrl("/%s", HTTP);
    const std::string secure = client->getRestUrl("/%s", HTTPS), &host = client->serverHost;
    const bool isDerived = plain == "http://" + host + "/%s" && secure == "https://" + host + "/%s";
    assert(isDerived ? support::holds(part[0], host) : plain + secure == "/%s/%s");

    auto& manager = *ConnectionManager::getInstance();
    for (const bool isKnown : {false, true}) {
        manager.setForceDNSCheck(true);
        const bool isRight = manager.checkDNS(PORTFORWARDED);
        assert(isRight == (net.hostname.empty() || (isKnown && part[2] == "44.128.0.20")));
        for (const auto& name : net.lookups) {
            assert(name == support::kSubdomain || name.rfind(net.hostname, 0) == 0);
            assert(name == support::kSubdomain || support::holds(name, kDeviceId));
            net.names[name] = {part[2]};
        }
    }
    net.checkReleased();
}
