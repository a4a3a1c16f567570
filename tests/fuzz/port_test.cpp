// Answers of the central server to a port test, the sleep poll and the address question.
#include "cloud/tavik_client.h"
#include "fuzz_world.h"
#include "support/fake_files.h"
#include "support/fake_web.h"

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace pelorus;
    fuzz::begin({{"SERVER_BASE_URL", "https://cloud.kavra.example"},
                 {"REMOTE_TESTPORTURL", "/test?%s&ip=%s&port=%d&%s&%s"}});
    support::FakeFiles::get().reset();
    auto& web = support::FakeWeb::get();
    web.reset();
    web.answer("/", fuzz::asText(data, size));

    auto* client = TavikClient::getInstance();
    client->resetServerSleepTime();
    for (std::string address : {"44.128.0.20", ""}) {
        std::string remote;
        bool relay = false;
        const int result =
            client->testPort(address, 9091, HTTP, false, false, &relay, false, remote);
        fuzz::require(result >= SKIP_TEST && result <= PASS_TEST, "a result of a port test");
        fuzz::require(!relay || result == FAIL_TEST, "a second NAT fails the test");
        fuzz::require(remote.empty() || client->validateIpAddress(remote), "the address seen");
    }
    fuzz::require(client->getServerSleepTime() >= 120, "the least pause");

    std::string own;
    int wait = 0;
    if (client->getMyIP(own, wait)) {
        fuzz::require(client->validateIpAddress(own), "an address is an address");
    }
    web.checkBalance();
    fuzz::finish();
    return 0;
}
