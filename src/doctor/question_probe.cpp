#include "doctor/question_probe.h"

#include <curl/curl.h>

#include <memory>
#include <optional>

#include "cloud/port_test_answer.h"
#include "cloud/public_address.h"
#include "cloud/url_template.h"
#include "common/handles.h"
#include "common/text.h"
#include "doctor/address_class.h"
#include "doctor/disk_probe.h"
#include "doctor/resolver.h"
#include "doctor/url_host.h"

namespace pelorus::doctor {

namespace {

constexpr long kPatience = 9000;  // milliseconds
constexpr std::size_t kMostReceived = 10238;
constexpr const char* kAddressPath = "/api/1.0/rest/myip";
constexpr const char* kTestKey = "REMOTE_TESTPORTURL";

using CurlHandle = std::unique_ptr<CURL, Releaser<curl_easy_cleanup>>;

std::size_t takeBody(const char* data, std::size_t size, std::size_t count, void* context) {
    auto& body = *static_cast<std::string*>(context);
    if (body.size() + size * count > kMostReceived) return 0;
    body.append(data, size * count);
    return size * count;
}

std::optional<std::string> fetch(const std::string& url) {
    hurryResolver();
    const CurlHandle handle{curl_easy_init()};
    if (!handle) return std::nullopt;
    std::string body;
    curl_easy_setopt(handle.get(), CURLOPT_URL, url.c_str());
    curl_easy_setopt(handle.get(), CURLOPT_TIMEOUT_MS, kPatience);
    curl_easy_setopt(handle.get(), CURLOPT_SSL_VERIFYPEER, 1L);
    curl_easy_setopt(handle.get(), CURLOPT_PROXY, "");
    curl_easy_setopt(handle.get(), CURLOPT_WRITEFUNCTION, takeBody);
    curl_easy_setopt(handle.get(), CURLOPT_WRITEDATA, &body);
    if (curl_easy_perform(handle.get()) != CURLE_OK) return std::nullopt;
    return body;
}

}  // namespace

void askForAddress(const Evidence& evidence, Findings& findings) {
    const std::string server = serviceHost(evidence.setting("SERVER_BASE_URL"));
    if (server.empty()) return;
    const auto body = fetch("http://" + server + kAddressPath);
    if (body && isIpv4Address(*body) && classOf(*body) != AddressClass::NONE) {
        findings.set("seen", *body);
    } else {
        findings.notSeen("public address: the service does not tell it");
    }
}

void askForPortTest(const Evidence& evidence, Findings& findings) {
    const std::string server = serviceHost(evidence.setting("SERVER_BASE_URL"));
    const std::string port = evidence.setting("EXTERNAL_HTTP_PORT");
    const std::string id = evidence.setting("DEVICEID");
    const std::string auth = evidence.setting("DEVICEAUTH");
    if (server.empty() || id.empty() || auth.empty()) return;
    if (leadingInt(port) <= 0) {
        findings.notSeen("port test: no port is published");
        return;
    }
    if (const std::string obstacle = diskObstacle(evidence); !obstacle.empty()) {
        findings.notSeen("port test: not asked for " + obstacle);
        return;
    }
    const std::string url =
        fillTemplate(kTestKey, "https://" + server + evidence.setting(kTestKey),
                     {SecretArgument{id, ""}, evidence.setting("EXTERNAL_IP"), leadingInt(port),
                      std::string{"HTTP"}, SecretArgument{auth, ""}});
    const auto body = url.empty() ? std::nullopt : fetch(url);
    if (body) {
        judgePortTest(*body, std::to_string(leadingInt(port)), findings);
    } else {
        findings.notSeen("port test: the service does not answer");
    }
}

void judgePortTest(const std::string& text, const std::string& port, Findings& findings) {
    const PortTestAnswer answer = readPortTestAnswer(text);
    const bool areNamed = !answer.requestedDevice.empty() && !answer.respondingDevice.empty();
    const bool isOther = areNamed && answer.requestedDevice != answer.respondingDevice;
    if (answer.passed && areNamed && !isOther) {
        findings.add(Sign::PORT_TEST_PASSES, "the service reaches port " + port);
        findings.ok("port test: the service reaches port " + port);
    } else if (!contains(text, "<status>")) {
        findings.notSeen("port test: the service's answer is not understood");
    } else if (answer.passed || isOther) {
        const std::string fault =
            isOther ? "another device answers on port " + port
                    : "what answers on port " + port + " does not say that it is this device";
        findings.add(Sign::OTHER_DEVICE_ANSWERS, fault);
        findings.problem("port test: " + fault);
    } else {
        const std::string fault = "the service does not reach port " + port;
        findings.add(Sign::PORT_TEST_FAILS, fault);
        findings.problem("port test: " + fault);
    }
}

void judgeSeenAddress(const Findings& answer,
                      const std::string& gatewayAddress,
                      Findings& findings) {
    const std::string seen = answer.value("seen");
    if (seen.empty()) return;
    if (seen == gatewayAddress) {
        findings.add(Sign::SERVICE_SEES_SAME_ADDRESS, "the service sees " + seen);
    }
    if (gatewayAddress.empty() || seen == gatewayAddress) {
        findings.ok("public address: the service sees " + seen);
        return;
    }
    const std::string text = "the service sees " + seen + ", the gateway says " + gatewayAddress;
    findings.add(Sign::SERVICE_SEES_OTHER_ADDRESS, text);
    findings.problem("public address: " + text);
}

}  // namespace pelorus::doctor
