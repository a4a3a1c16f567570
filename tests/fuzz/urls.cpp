// The server's URLs and templates, and the device's public names. Built without access control: the
// client derives the URLs only once and therefore begins anew.
#include "cloud/tavik_client.h"
#include "cloud/url_template.h"
#include "connection/connection_manager.h"
#include "fuzz_world.h"

namespace pelorus::fuzz {

// Whatever a template holds, the result fits and only the request shows secrets. The first byte cuts
// the rest in two: a template and a text argument.
static void fillTemplate(const std::string& text) {
    if (text.empty()) return;
    const std::size_t cut = static_cast<unsigned char>(text[0]) % text.size();
    const std::string urlTemplate = text.substr(1, cut);
    const MaskedUrl url =
        fillMaskedTemplate("KEY", urlTemplate,
                           {SecretArgument{kDeviceId, "*ID_REMOVED*"}, -5, text.substr(1 + cut),
                            SecretArgument{kDeviceAuth, "*AUTH_REMOVED*"}});
    assert(url.request.size() < kUrlBufferSize && url.logged.size() < kUrlBufferSize);
    const bool refused = support::LogCapture::get().countPart("KEY") != 0;
    assert(!refused || (url.request + url.logged).empty());
    assert(refused || urlTemplate.empty() || !url.request.empty() || urlTemplate[0] == '%');
    for (const std::string secret : {kDeviceId, kDeviceAuth}) {
        const bool mayComeFromTemplate = urlTemplate.find_first_of(secret) != std::string::npos;
        assert(mayComeFromTemplate || url.logged.find(secret) == std::string::npos);
    }
}

// The server's base URL, the host name and the address that the names have.
void tryText(const std::string& text) {
    begin("3");
    fillTemplate(text);
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

}  // namespace pelorus::fuzz
