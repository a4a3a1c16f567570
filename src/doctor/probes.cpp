#include "doctor/probes.h"

#include <algorithm>
#include <utility>

#include "common/text.h"
#include "doctor/disk_probe.h"
#include "doctor/gateway_probe.h"
#include "doctor/interfaces.h"
#include "doctor/names_probe.h"
#include "doctor/network_probe.h"
#include "doctor/question_probe.h"
#include "doctor/service_probe.h"
#include "doctor/side_by_side.h"
#include "doctor/web_probe.h"

namespace pelorus::doctor {

namespace {

// Starting and ending the processes takes a moment, too.
constexpr std::chrono::milliseconds kLimit{9500};
constexpr int kMakersRouter = 5;

struct Subject {
    const char* name;
    Probe probe;
    bool needsSettings = false;
    Findings found{};
};

// The probes that a device calls for, in the order in which their lines are shown.
std::vector<Subject> subjectsFor(const ProbeChoice& choice, const Evidence& evidence) {
    const auto with = [&evidence](void (*look)(const Evidence&, Findings&)) {
        return [&evidence, look](Findings& findings) { look(evidence, findings); };
    };
    std::vector<Subject> subjects{{"network", lookAtNetwork},
                                  {"web server", with(lookAtWebServer), true},
                                  {"local back end", with(lookAtBackEnd), true},
                                  {"disk", lookAtDisk},
                                  {"central service", with(lookAtService), true}};
    if (leadingInt(evidence.setting("DEVICETYPE")) != kMakersRouter) {
        subjects.push_back({"UPnP", with(askThroughUpnp)});
        subjects.push_back({"NAT-PMP", askThroughNatpmp});
    }
    if (choice.askService) {
        subjects.push_back({"public address", with(askForAddress), true});
        subjects.push_back({"port test", with(askForPortTest), true});
    }
    subjects.push_back({"public names", with(lookAtNames), true});
    subjects.push_back({"relay client", with(lookAtRelayNeeds)});
    return subjects;
}

// Without the settings only what needs none is looked at.
void leaveOut(std::vector<Subject>& subjects, Evidence& evidence) {
    if (evidence.hasSettings()) return;
    const auto rest = std::stable_partition(subjects.begin(), subjects.end(),
                                            [](const Subject& one) { return !one.needsSettings; });
    std::string names;
    for (auto one = rest; one != subjects.end(); ++one) {
        names += (names.empty() ? "" : ", ") + std::string{one->name};
    }
    evidence.checks.push_back(
        {Check::Verdict::NOT_SEEN, Source::SETTINGS, names + ": " + evidence.unreadSettings});
    subjects.erase(rest, subjects.end());
}

void run(std::vector<Subject>& subjects) {
    std::vector<Probe> probes;
    probes.reserve(subjects.size());
    for (const Subject& subject : subjects) probes.push_back(subject.probe);
    std::vector<Findings> found = runSideBySide(probes, kLimit);
    for (std::size_t i = 0; i < subjects.size(); ++i) subjects[i].found = std::move(found[i]);
}

void take(const Findings& findings, Evidence& evidence) {
    for (const auto& [sign, text] : findings.signs()) {
        if (!evidence.has(sign)) evidence.add(sign, Source::NOW, text);
    }
    evidence.checks.insert(evidence.checks.end(), findings.checks().begin(),
                           findings.checks().end());
}

// The gateway of the default route, unless that leads into a tunnel; without addresses if there is
// none.
LanHost lanGateway() {
    const auto route = defaultRoute();
    if (!route) return {};
    for (const Interface& one : interfaces()) {
        if (one.name != route->interface) continue;
        if (one.tunnel || route->gateway.empty()) return {};
        return lanHost(*route);
    }
    return {};
}

// Concludes from several probes, or from one that was cut short.
class Conclusions {
public:
    explicit Conclusions(const std::vector<Subject>& all) : subjects{all} {}

    [[nodiscard]] std::string gatewayAddress() const {
        return externalAddress(answer("UPnP"), answer("NAT-PMP"));
    }

    // What is shown in front of the lines of this subject.
    void add(const Subject& subject, Findings& findings) const {
        const std::string name = subject.name;
        if (name == "UPnP") {
            const LanHost gateway = lanGateway();
            judgeGateway(answer("UPnP"), answer("NAT-PMP"), gateway.addresses, findings);
            if (gateway.isSilent) {
                judgeSilentGateway(answer("UPnP"), answer("NAT-PMP"), gateway.addresses, findings);
            }
            judgeUnfinishedTable(subject.found, findings);
        }
        if (name == "public address") {
            judgeSeenAddress(subject.found, gatewayAddress(), findings);
        }
        if (subject.found.finished() || name == "UPnP" || name == "NAT-PMP") return;
        if (name == "central service") judgeUnfinishedService(subject.found, findings);
        if (findings.checks().empty()) findings.notSeen(name + ": it did not answer in time");
    }

private:
    [[nodiscard]] GatewayAnswer answer(const std::string& name) const {
        for (const Subject& subject : subjects) {
            if (subject.name == name) return readAnswer(subject.found);
        }
        return {};
    }

    const std::vector<Subject>& subjects;
};

}  // namespace

void probe(const ProbeChoice& choice, Evidence& evidence) {
    std::vector<Subject> subjects = subjectsFor(choice, evidence);
    leaveOut(subjects, evidence);
    run(subjects);
    const Conclusions conclusions{subjects};
    evidence.gatewayAddress = conclusions.gatewayAddress();
    for (const Subject& subject : subjects) {
        Findings concluded;
        conclusions.add(subject, concluded);
        take(concluded, evidence);
        take(subject.found, evidence);
    }
}

}  // namespace pelorus::doctor
