// One port test. Private to the module; callers use TavikClient::testPort.
#ifndef PELORUS_CLOUD_PORT_TEST_H
#define PELORUS_CLOUD_PORT_TEST_H

#include <optional>
#include <string>

#include "cloud/answer.h"
#include "cloud/port_test_answer.h"
#include "cloud/url_template.h"
#include "common/connection_types.h"

namespace pelorus {

class TavikClient;

/// Asks the server up to three times to connect back to the device, and judges its answers.
class PortTest {
public:
    struct Input {
        std::string externalIp;  ///< address to be tested; empty: the one the server sees
        int port = 0;
        HttpType type = HTTP;  ///< protocol the server uses on that port
        bool checkHddSleep = false;
        bool skipDoubleNatCheck = false;
    };
    struct Outcome {
        PortTestResult result = FAIL_TEST;
        bool enforceRelay = false;     ///< the router stands behind another NAT
        std::string externalIp;        ///< as given, or what the server tested in its place
        std::string remoteExternalIp;  ///< address the server saw, when the test passed
    };

    PortTest(TavikClient& client, Input input);

    /// Call it once. Blocks for up to three requests and three pauses of 5 seconds.
    [[nodiscard]] Outcome run();

private:
    [[nodiscard]] std::optional<PortTestResult> findObstacle();
    void prepareUrl();
    void makeAttempt();
    void request();
    void takeRemoteAddress();
    [[nodiscard]] bool isBehindSecondNat() const;
    void pauseBeforeRetry() const;
    void reportFailure();
    void takeTestedAddress();
    [[nodiscard]] PortTestResult judgeRespondingDevice() const;
    [[nodiscard]] bool reachedTheRequestedDevice() const;

    TavikClient& client;
    const Input input;
    MaskedUrl url;
    int attempt = 0;               // number of the current one, from 1
    std::optional<Answer> answer;  // to the current attempt
    PortTestAnswer reading;        // of that answer; as of an empty text when there was none
    Outcome outcome;
};

}  // namespace pelorus

#endif
