#include "doctor/web_probe.h"

#include "cloud/url_template.h"
#include "common/text.h"
#include "doctor/disk_probe.h"
#include "doctor/interfaces.h"
#include "doctor/tcp.h"
#include "doctor/url_host.h"

namespace pelorus::doctor {

namespace {

constexpr std::chrono::seconds kConnectPatience{2};
constexpr std::chrono::seconds kAnswerPatience{3};
constexpr const char* kBackEndKey = "LOCAL_SETCOMMSTATUSURL";

// Why nothing listens there; empty when something does.
std::string obstacleAt(const std::string& address, int port) {
    const TcpConnection connection{address, port, kConnectPatience};
    return connection.connected() ? std::string{} : connection.obstacle();
}

void silent(Findings& findings, const std::string& text) {
    findings.add(Sign::BACK_END_SILENT, "the local back end " + text);
    findings.problem("local back end " + text);
}

}  // namespace

void lookAtWebServer(const Evidence& evidence, Findings& findings) {
    const int http = scanInt(evidence.setting("INTERNAL_HTTP_PORT").c_str()).value_or(80);
    const int https = scanInt(evidence.setting("INTERNAL_HTTPS_PORT").c_str()).value_or(443);
    const std::string lan = lanAddress();
    const std::string address = lan.empty() ? "127.0.0.1" : lan;
    judgeWebServer(address, {http, obstacleAt(address, http)}, {https, obstacleAt(address, https)},
                   findings);
}

void judgeWebServer(const std::string& address,
                    const WebPort& http,
                    const WebPort& https,
                    Findings& findings) {
    std::string missing;
    for (const WebPort& port : {http, https}) {
        if (port.obstacle.empty()) continue;
        missing += (missing.empty() ? "" : ", ") + std::string{"port "} +
                   std::to_string(port.number) + " of " + address + ": " + port.obstacle;
    }
    if (missing.empty()) {
        findings.ok("web server listens on " + std::to_string(http.number) + " and " +
                    std::to_string(https.number));
        return;
    }
    findings.problem("web server: " + missing);
    if (http.obstacle.empty()) return;
    findings.add(Sign::WEB_SERVER_SILENT, "the web server does not listen, " + missing);
    if (!https.obstacle.empty()) findings.add(Sign::NO_WEB_SERVER, "no web server listens");
}

void lookAtBackEnd(const Evidence& evidence, Findings& findings) {
    const std::string url =
        fillTemplate(kBackEndKey, evidence.setting(kBackEndKey),
                     {leadingInt(evidence.setting("INTERNAL_HTTP_PORT")), std::string{}});
    const auto target = hostOfUrl(url);
    if (!target) {
        findings.notSeen(std::string{"local back end: "} + kBackEndKey + " is no URL");
        return;
    }
    const std::string where = " on port " + std::to_string(target->port);
    const TcpConnection connection{target->host, target->port, kConnectPatience};
    if (!connection.connected()) {
        silent(findings, "does not listen" + where + ": " + connection.obstacle());
    } else if (const std::string obstacle = diskObstacle(evidence); !obstacle.empty()) {
        findings.notSeen("local back end: it listens" + where + ", but is not asked " + obstacle);
    } else if (connection.answers("HEAD / HTTP/1.0\r\n\r\n", kAnswerPatience)) {
        findings.add(Sign::BACK_END_ANSWERS, "the local back end answers" + where);
        findings.ok("local back end answers" + where);
    } else if (evidence.has(Sign::LOGGED_BACK_END_SILENT)) {
        silent(findings, "listens" + where + ", but does not answer");
    } else {
        // The daemon waits ten times as long for a busy device.
        findings.notSeen("local back end: it listens" + where + ", but gave no answer within " +
                         std::to_string(kAnswerPatience.count()) + " s");
    }
}

}  // namespace pelorus::doctor
