// What servers and the disk answer, in whole exchanges: every reader is given the same text.
#include "cloud/port_test_answer.h"
#include "cloud/public_address.h"
#include "cloud/tavik_client.h"
#include "fuzz_world.h"

namespace {

// The size of each piece follows from its first byte.
void receiveInPieces(std::string text) {
    constexpr std::size_t kLargest = 10238;  // bytes
    pelorus::CurlRcvBuffer buffer;
    for (std::size_t at = 0, piece = 1; at < text.size() && piece != 0; at += piece) {
        const std::size_t first = static_cast<unsigned char>(text[at]);
        const std::size_t wanted = std::min(first * 8 + 1, text.size() - at);
        piece = pelorus::curlRcvData(&text[at], 1, wanted, &buffer);
        assert(piece == (at + wanted <= kLargest ? wanted : 0));
    }
    assert((std::string{buffer.data, buffer.data + buffer.size} ==
            (text.size() <= kLargest ? text : "")));
    std::free(buffer.data);  // NOLINT(*-no-malloc): allocated by curlRcvData
}

// The positions go into the log; the addresses themselves are what stands between them.
void readPortTest(const std::string& text) {
    const pelorus::PortTestAnswer test = pelorus::readPortTestAnswer(text);
    for (const auto& part : {test.remoteAddress, test.testedAddress}) {
        if (!part || part->text.empty()) continue;
        assert(text.substr(part->start, part->end - part->start) == part->text);
    }
    for (const auto& device : {test.requestedDevice, test.respondingDevice}) {
        assert(pelorus::support::holds(text, device));
    }
}

}  // namespace

void pelorus::fuzz::tryText(const std::string& text) {
    readPortTest(text);
    begin("3");
    auto& config = *GlobalConfig::getInstance();
    config.setProperty("SERVER_BASE_URL", "https://web.kavra.example", false);
    config.setProperty("REMOTE_TESTPORTURL", "/t?%s&%s&%d&%s&%s", false);
    config.setProperty("REMOTE_SETFORWARDURL", "/f?%s&%s&%s&%d&%d&%s", false);
    config.setProperty("REMOTE_SETCOMMSTATUSURL", "/s?%s&%s&%s", false);
    config.setProperty("LOCAL_SETFORWARDURL", "http://127.0.0.1:%d/f?%s&%d&%d&%s", false);
    config.setProperty("LOCAL_DELFORWARDURL", "http://127.0.0.1:%d/d", false);
    config.setProperty("LOCAL_SETCOMMSTATUSURL", "http://127.0.0.1:%d/s?%s", false);
    config.setProperty("LOCAL_SETLOCALIPURL", "http://127.0.0.1:%d/i?%s", false);
    std::string received = text;
    while (received.size() < text.size() % 4 * 4000) received += text;
    receiveInPieces(received);
    auto& web = support::FakeWeb::get();
    web.answer("", support::WebAnswer{text});
    support::FakeCommands::get().answer("hdparm", text);
    const TemporaryFile minutes{"minutes", text};
    support::FakeFiles::get().redirect(support::kIdleMinutesFile, minutes.path);

    auto& client = *TavikClient::getInstance();
    client.resetServerSleepTime();
    std::string seen, remote;
    int wait = 0;
    assert(client.getMyIP(seen, wait) == (wait == 0 && isIpv4Address(text)) && wait >= 0);
    const bool sleeps = client.checkHddStandByMode() != 0;
    std::string address = text.size() % 2 == 0 ? "" : "44.128.0.20";
    bool isRelayed = false;
    const int result = client.testPort(address, 9091, HTTP, false, true, &isRelayed, false, remote);
    assert((result == SKIP_TEST) == (sleeps || wait > 0));
    assert(result != PASS_TEST || support::holds(text, "Success"));
    assert(remote.empty() || isIpv4Address(remote));
    client.updateServerMapping(address, 9091, 9444, address, 80, 443);
    client.deleteServerMapping(80, address);
    client.updateRemoteCommStatus(address);
    client.updateLocalCommStatus(result == PASS_TEST ? "portforwarded" : "failed");
    client.updateLocalCommStatus("relayed");
    const auto isPlain = [](char letter) {
        return std::isalnum(letter) != 0 || support::holds("/:?&%.-_~", {letter});
    };
    for (const std::string& url : web.urls()) assert(std::all_of(url.begin(), url.end(), isPlain));
    web.checkBalance();
}
