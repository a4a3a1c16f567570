#include "doctor/gateway_probe.h"

namespace pelorus::doctor {

GatewayAnswer readAnswer(const Findings& findings) {
    GatewayAnswer answer;
    answer.gateway = findings.value("gateway");
    answer.address = findings.value("address");
    answer.connected = findings.value("unconnected").empty();
    answer.unanswered = findings.value("announced");
    if (!answer.gateway.empty()) {
        answer.state = GatewayAnswer::State::FOUND;
    } else if (findings.finished() && !findings.value("silent").empty()) {
        answer.state = GatewayAnswer::State::SILENT;
    }
    return answer;
}

void judgeUnfinishedTable(const Findings& found, Findings& findings) {
    if (found.finished() || found.value("gateway").empty() || !found.checks().empty()) return;
    findings.notSeen("gateway's table: it could not be read in time");
}

}  // namespace pelorus::doctor
