#include <unistd.h>

#include <string>

#include "cloud/tavik_client.h"
#include "common/handles.h"
#include "common/log.h"
#include "common/masks.h"
#include "common/text.h"
#include "config/global_config.h"
#include "config/scrub.h"

namespace pelorus {

namespace {

constexpr const char* kTestPortKey = "REMOTE_TESTPORTURL";
constexpr const char* kMyIpPath = "/api/1.0/rest/myip";
constexpr const char* kPassed = "Success";

constexpr int kPortTestAttempts = 3;
constexpr int kPortTestRetryDelay = 5;  // seconds

// The text between two tags and its place in the answer.
struct TaggedText {
    std::string text;
    std::size_t start = 0;
    std::size_t end = std::string::npos;

    [[nodiscard]] bool closed() const { return end != std::string::npos; }
};

// Only the closing tag is required: without the opening one the text starts where it would if that
// tag stood one character before the answer. A closing tag in front of the text leaves it empty.
TaggedText textBetween(const std::string& answer, const std::string& name) {
    const std::string opening = "<" + name + ">";
    const std::size_t found = answer.find(opening);
    TaggedText tagged;
    tagged.start = found == std::string::npos ? opening.size() - 1 : found + opening.size();
    tagged.end = answer.find("</" + name + ">");
    if (tagged.closed() && tagged.start < tagged.end) {
        tagged.text = answer.substr(tagged.start, tagged.end - tagged.start);
    }
    return tagged;
}

// The external address the server tested; empty when the answer does not tell.
std::string testedAddress(const std::string& response) {
    const TaggedText address = textBetween(response, "external_ip");
    if (!address.closed()) {
        logError("TavikClient::testPort - port map check received badly formatted response:\n");
        logError("%s", scrubSecrets(response).c_str());
        return {};
    }
    logInfo(
        "TavikClient::testPort - PORT TEST RESPONSE, GOT EXTERNAL IP: [%s], start: [%d], end: [%d]. \n",
        scrubSecrets(address.text).c_str(), static_cast<int>(address.start),
        static_cast<int>(address.end));
    return address.text;
}

// Whether the device the server reached is the one the request named; both names are the server's.
bool reachedTheRequestedDevice(const std::string& response) {
    const std::string requested = textBetween(response, "req_device_id").text;
    const std::string responding = textBetween(response, "resp_device_id").text;
    if (requested.empty() || responding.empty()) {
        logError(
            "TavikClient::testPort - Port test response contains empty request device ID and/or response device ID.\n");
        return false;
    }
    return requested == responding;
}

int judgeRespondingDevice(const std::string& response) {
    if (reachedTheRequestedDevice(response)) return PASS_TEST;
    logInfo("TavikClient::testPort - result data [%s]\n", scrubSecrets(response).c_str());
    logError(
        "TavikClient::testPort - Port test response Device ID '%s' is different than the Device ID of this unit '%s'.\n",
        STRIPPED_DEVID_VAL, STRIPPED_DEVID_VAL);
    return FAIL_TEST;
}

void pauseBeforeRetry(int attempt, const std::string& loggedUrl, const Answer* answer) {
    logError("TavikClient::testPort[%d] - port check failed, retrying in %d seconds, url:  [%s].\n",
             attempt, kPortTestRetryDelay, loggedUrl.c_str());
    if (answer != nullptr) {
        logError("TavikClient::testPort[%d] -  failure response from server: [%s].\n", attempt,
                 scrubSecrets(answer->text).c_str());
    }
    sleep(kPortTestRetryDelay);
}

}  // namespace

// What the attempts of one port test share.
struct TavikClient::PortTest {
    const std::string& externalIp;
    const bool checkDoubleNat;
    const MaskedUrl url;
    std::string& remoteExternalIp;

    int attempt = 0;  // number of the running one, from 1
    std::optional<Answer> answer{};
    std::string response{};  // text of the answer, empty when there was none
    TaggedText remote{};     // the address the server saw, empty when the answer does not tell
    bool passed = false;
    bool doubleNat = false;
};

int TavikClient::testPort(std::string& externalIp,
                          int port,
                          HttpType type,
                          bool /*flag*/,
                          bool checkHddSleep,
                          bool* enforceRelay,
                          bool skipDoubleNatCheck,
                          std::string& remoteExternalIp) {
    remoteExternalIp.clear();
    *enforceRelay = false;
    const int obstacle = portTestObstacle(checkHddSleep);
    if (obstacle != 0) return obstacle;

    PortTest test{externalIp, !skipDoubleNatCheck, portTestUrl(externalIp, port, type),
                  remoteExternalIp};
    while (!test.passed && test.attempt < kPortTestAttempts) {
        ++test.attempt;
        attemptPortTest(test);
        if (test.doubleNat) {
            *enforceRelay = true;
            return FAIL_TEST;
        }
    }
    portMapCheckSuccess = test.passed;
    if (!test.passed) {
        updateLocalCommStatus("failed");
        logError("TavikClient::testPort - port map check failed.\n");
        return FAIL_TEST;
    }
    logInfo("TavikClient::testPort - port map check success.\n");
    if (externalIp.empty()) externalIp = testedAddress(test.response);
    return judgeRespondingDevice(test.response);
}

// The result of a test that cannot be run now; 0 when it can.
int TavikClient::portTestObstacle(bool checkHddSleep) {
    if (checkHddSleep && checkHddStandByMode() != 0) {
        logInfo("TavikClient::testPort - hard disk is asleep.\n");
        return SKIP_TEST;
    }
    if (serverRequestedSleep()) {
        logInfo("TavikClient::testPort - server has requested sleep.\n");
        return SKIP_TEST;
    }
    if (getDeviceID().empty()) {
        logError("TavikClient::testPort - failed to get Device ID from DynamicConfig.\n");
        return FAIL_TEST;
    }
    if (getDeviceAuth().empty()) {
        logError("TavikClient::testPort - failed to get Device Auth Code from DynamicConfig.\n");
        return FAIL_TEST;
    }
    return 0;
}

// The request itself goes over HTTPS whatever protocol is tested.
MaskedUrl TavikClient::portTestUrl(const std::string& externalIp, int port, HttpType type) {
    const std::string path = setting(kTestPortKey);
    MaskedUrl url = fillMaskedTemplate(
        kTestPortKey, getRestUrl(path, HTTPS),
        {SecretArgument{getDeviceID(), STRIPPED_DEVID_VAL}, externalIp, port,
         type == HTTP ? "HTTP" : "HTTPS", SecretArgument{getDeviceAuth(), STRIPPED_DEVAUTH_VAL}});
    logInfo("TavikClient::testPort[1-3] - Port Test URL: [%s].\n", url.logged.c_str());
    return url;
}

void TavikClient::attemptPortTest(PortTest& test) try {
    requestPortTest(test);
    readRemoteAddress(test);
    if (test.passed) {
        logInfo("TavikClient::testPort - port test succeeded for requested external IP: [%s]\n",
                scrubSecrets(test.externalIp).c_str());
        return;
    }
    logInfo("TavikClient::testPort - port test failed for requested external IP: [%s]\n",
            scrubSecrets(test.externalIp).c_str());
    lookForDoubleNat(test);
    if (test.doubleNat) return;
    // The pause follows the last attempt too.
    pauseBeforeRetry(test.attempt, test.url.logged, test.answer ? &*test.answer : nullptr);
} catch (...) {
    logError("** TavikClient::testPort - Throw exception error. **\n");
    test.passed = false;
}

void TavikClient::requestPortTest(PortTest& test) {
    test.response.clear();
    test.answer = fetchCentral(test.url);
    logInfo("TavikClient::testPort[%d] - port check URL: [%s].\n", test.attempt,
            test.url.logged.c_str());
    if (!test.answer) {
        logError("TavikClient::testPort[%d] - httpGet for %s, no response from central server.\n",
                 test.attempt, test.url.logged.c_str());
        return;
    }
    test.response = test.answer->text;
    test.passed = contains(test.response, kPassed);
    logNotice("TavikClient::testPort[%d] - httpGet got %s, %d bytes from central server.\n",
              test.attempt, scrubSecrets(test.response).c_str(), test.answer->size);
}

void TavikClient::readRemoteAddress(PortTest& test) {
    const std::string tag = "remote_external_ip";
    test.remote = textBetween(test.response, tag);
    if (!test.remote.closed() || !contains(test.response, "<" + tag + ">")) {
        test.remote = {};
        logInfo(
            "TavikClient::testPort - Cannot retrieve remote_external_ip from test port response\n");
        return;
    }
    logInfo("TavikClient::testPort - Response remote external IP: [%s].\n",
            scrubSecrets(test.remote.text).c_str());
    if (test.passed && validateIpAddress(test.remote.text)) {
        test.remoteExternalIp = test.remote.text;
    }
}

// When the server sees another address than the router's own, the router itself stands behind
// another NAT: the port it forwards cannot be reached from the internet.
void TavikClient::lookForDoubleNat(PortTest& test) const {
    const std::string& remote = test.remote.text;
    if (!test.checkDoubleNat || remote.empty() || test.externalIp.empty()) return;
    logInfo(
        "TavikClient::testPort - Requested external IP: [%s] / Respond remote external IP: [%s].\n",
        scrubSecrets(test.externalIp).c_str(), scrubSecrets(remote).c_str());
    if (validateIpAddress(remote) && remote != test.externalIp) {
        logError(
            "TavikClient::testPort - Enforce connection as RELAY (double-NAT detected: Server-returned external IP != router's external IP).\n");
        test.doubleNat = true;
        return;
    }
    logInfo(
        "TavikClient::testPort - PORT TEST RESPONSE, GOT REMOTE EXTERNAL IP: [%s], start: [%d], end: [%d]\n",
        scrubSecrets(remote).c_str(), static_cast<int>(test.remote.start),
        static_cast<int>(test.remote.end));
}

bool TavikClient::getMyIP(std::string& ip, int& waitSeconds) try {
    if (serverRequestedSleep()) {
        waitSeconds = pollServerForSleepTime();
        logInfo("TavikClient::getMyIP - server has requested sleep %d seconds.\n", waitSeconds);
        return false;
    }
    waitSeconds = 0;
    const std::string url =
        fillTemplate("the public address path", getRestUrl(kMyIpPath, HTTP), {});
    logInfo("TavikClient::getMyIP - get my IP url: %s\n", scrubSecrets(url).c_str());
    int size = 0;
    const MallocHandle<char> data{httpGet(url.c_str(), size)};
    if (!data) {
        logError(
            "TavikClient::getMyIP - httpGet failed to get response from central server for url %s.\n",
            scrubSecrets(url).c_str());
        return false;
    }
    // As it came: an address with so much as a line feed behind it is not accepted.
    ip.assign(data.get(), static_cast<std::size_t>(size));
    logInfo("TavikClient::getMyIP - httpGet Response [%d bytes]: %s\n", size,
            scrubSecrets(ip).c_str());
    return validateIpAddress(ip);
} catch (...) {
    logError("** TavikClient::getMyIP - Throw exception error. **\n");
    return false;
}

}  // namespace pelorus
