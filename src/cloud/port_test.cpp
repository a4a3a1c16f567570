#include "cloud/port_test.h"

#include <unistd.h>

#include <utility>

#include "cloud/public_address.h"
#include "cloud/tavik_client.h"
#include "common/log.h"
#include "common/masks.h"
#include "config/global_config.h"
#include "config/scrub.h"

namespace pelorus {

namespace {

constexpr const char* kTestPortKey = "REMOTE_TESTPORTURL";

constexpr int kAttempts = 3;
constexpr int kRetryDelay = 5;  // seconds

}  // namespace

int TavikClient::testPort(std::string& externalIp,
                          int port,
                          HttpType type,
                          bool /*flag*/,
                          bool checkHddSleep,
                          bool* enforceRelay,
                          bool skipDoubleNatCheck,
                          std::string& remoteExternalIp) {
    const PortTest::Outcome outcome =
        PortTest{*this, {externalIp, port, type, checkHddSleep, skipDoubleNatCheck}}.run();
    externalIp = outcome.externalIp;
    *enforceRelay = outcome.enforceRelay;
    remoteExternalIp = outcome.remoteExternalIp;
    return outcome.result;
}

PortTest::PortTest(TavikClient& testingClient, Input testInput)
    : client{testingClient}, input{std::move(testInput)} {
    outcome.externalIp = input.externalIp;
}

PortTest::Outcome PortTest::run() {
    if (const auto obstacle = findObstacle()) {
        outcome.result = *obstacle;
        return outcome;
    }
    prepareUrl();
    while (!reading.passed && !outcome.enforceRelay && attempt < kAttempts) {
        ++attempt;
        makeAttempt();
    }
    if (outcome.enforceRelay) return outcome;
    client.portMapCheckSuccess = reading.passed;
    if (reading.passed) {
        logInfo("TavikClient::testPort - port map check success.\n");
        takeTestedAddress();
        outcome.result = judgeRespondingDevice();
    } else {
        reportFailure();
    }
    return outcome;
}

// The result of a test that cannot be run now.
std::optional<PortTestResult> PortTest::findObstacle() {
    if (input.checkHddSleep && client.checkHddStandByMode() != 0) {
        logInfo("TavikClient::testPort - hard disk is asleep.\n");
        return SKIP_TEST;
    }
    if (client.serverRequestedSleep()) {
        logInfo("TavikClient::testPort - server has requested sleep.\n");
        return SKIP_TEST;
    }
    if (client.getDeviceID().empty()) {
        logError("TavikClient::testPort - failed to get Device ID from DynamicConfig.\n");
        return FAIL_TEST;
    }
    if (client.getDeviceAuth().empty()) {
        logError("TavikClient::testPort - failed to get Device Auth Code from DynamicConfig.\n");
        return FAIL_TEST;
    }
    return std::nullopt;
}

// The request itself goes over HTTPS whatever protocol is tested.
void PortTest::prepareUrl() {
    const std::string path = setting(kTestPortKey);
    url = fillMaskedTemplate(kTestPortKey, client.getRestUrl(path, HTTPS),
                             {SecretArgument{client.getDeviceID(), STRIPPED_DEVID_VAL},
                              input.externalIp, input.port, input.type == HTTP ? "HTTP" : "HTTPS",
                              SecretArgument{client.getDeviceAuth(), STRIPPED_DEVAUTH_VAL}});
    logInfo("TavikClient::testPort[1-3] - Port Test URL: [%s].\n", url.logged.c_str());
}

void PortTest::makeAttempt() try {
    request();
    takeRemoteAddress();
    if (reading.passed) {
        logInfo("TavikClient::testPort - port test succeeded for requested external IP: [%s]\n",
                scrubSecrets(input.externalIp).c_str());
        return;
    }
    logInfo("TavikClient::testPort - port test failed for requested external IP: [%s]\n",
            scrubSecrets(input.externalIp).c_str());
    outcome.enforceRelay = isBehindSecondNat();
    if (!outcome.enforceRelay) pauseBeforeRetry();
} catch (...) {
    logError("** TavikClient::testPort - Throw exception error. **\n");
    reading = {};
}

void PortTest::request() {
    reading = {};
    answer = client.fetchCentral(url);
    logInfo("TavikClient::testPort[%d] - port check URL: [%s].\n", attempt, url.logged.c_str());
    if (!answer) {
        logError("TavikClient::testPort[%d] - httpGet for %s, no response from central server.\n",
                 attempt, url.logged.c_str());
        return;
    }
    reading = readPortTestAnswer(answer->text);
    logNotice("TavikClient::testPort[%d] - httpGet got %s, %d bytes from central server.\n",
              attempt, scrubSecrets(answer->text).c_str(), answer->size);
}

void PortTest::takeRemoteAddress() {
    if (!reading.remoteAddress) {
        logInfo(
            "TavikClient::testPort - Cannot retrieve remote_external_ip from test port response\n");
        return;
    }
    const std::string& address = reading.remoteAddress->text;
    logInfo("TavikClient::testPort - Response remote external IP: [%s].\n",
            scrubSecrets(address).c_str());
    if (reading.passed && isIpv4Address(address)) outcome.remoteExternalIp = address;
}

// When the server sees another address than the router's own, the router itself stands behind
// another NAT: the port it forwards cannot be reached from the internet.
bool PortTest::isBehindSecondNat() const {
    if (input.skipDoubleNatCheck || input.externalIp.empty()) return false;
    if (!reading.remoteAddress || reading.remoteAddress->text.empty()) return false;
    const TaggedText& remote = *reading.remoteAddress;
    logInfo(
        "TavikClient::testPort - Requested external IP: [%s] / Respond remote external IP: [%s].\n",
        scrubSecrets(input.externalIp).c_str(), scrubSecrets(remote.text).c_str());
    if (isIpv4Address(remote.text) && remote.text != input.externalIp) {
        logError(
            "TavikClient::testPort - Enforce connection as RELAY (double-NAT detected: Server-returned external IP != router's external IP).\n");
        return true;
    }
    logInfo(
        "TavikClient::testPort - PORT TEST RESPONSE, GOT REMOTE EXTERNAL IP: [%s], start: [%d], end: [%d]\n",
        scrubSecrets(remote.text).c_str(), static_cast<int>(remote.start),
        static_cast<int>(remote.end));
    return false;
}

// Also pauses after the last attempt.
void PortTest::pauseBeforeRetry() const {
    logError("TavikClient::testPort[%d] - port check failed, retrying in %d seconds, url:  [%s].\n",
             attempt, kRetryDelay, url.logged.c_str());
    if (answer) {
        logError("TavikClient::testPort[%d] -  failure response from server: [%s].\n", attempt,
                 scrubSecrets(answer->text).c_str());
    }
    sleep(kRetryDelay);
}

void PortTest::reportFailure() {
    client.updateLocalCommStatus("failed");
    logError("TavikClient::testPort - port map check failed.\n");
}

// Only if no address was requested. Stays empty if the answer names none.
void PortTest::takeTestedAddress() {
    if (!input.externalIp.empty()) return;
    if (!reading.testedAddress) {
        logError("TavikClient::testPort - port map check received badly formatted response:\n");
        logError("%s", scrubSecrets(answer->text).c_str());
        return;
    }
    const TaggedText& address = *reading.testedAddress;
    logInfo(
        "TavikClient::testPort - PORT TEST RESPONSE, GOT EXTERNAL IP: [%s], start: [%d], end: [%d]. \n",
        scrubSecrets(address.text).c_str(), static_cast<int>(address.start),
        static_cast<int>(address.end));
    outcome.externalIp = address.text;
}

PortTestResult PortTest::judgeRespondingDevice() const {
    if (reachedTheRequestedDevice()) return PASS_TEST;
    logInfo("TavikClient::testPort - result data [%s]\n", scrubSecrets(answer->text).c_str());
    logError(
        "TavikClient::testPort - Port test response Device ID '%s' is different than the Device ID of this unit '%s'.\n",
        STRIPPED_DEVID_VAL, STRIPPED_DEVID_VAL);
    return FAIL_TEST;
}

// Both identifiers are the server's: they are compared with each other, not with this device's own.
bool PortTest::reachedTheRequestedDevice() const {
    if (reading.requestedDevice.empty() || reading.respondingDevice.empty()) {
        logError(
            "TavikClient::testPort - Port test response contains empty request device ID and/or response device ID.\n");
        return false;
    }
    return reading.requestedDevice == reading.respondingDevice;
}

}  // namespace pelorus
