#include "doctor/causes.h"

#include <algorithm>
#include <utility>

#include "doctor/log_signs.h"

namespace pelorus::doctor {

namespace {

using Reaches = std::vector<Reach>;
using S = Sign;

const Reaches kEnded{Reach::NOT_RUNNING};
const Reaches kOff{Reach::SWITCHED_OFF};
const Reaches kNotReached{Reach::NOT_REACHED, Reach::UNKNOWN};
const Reaches kNotDirect{Reach::RELAYED, Reach::NOT_REACHED, Reach::UNKNOWN};
const Reaches kRunning{Reach::DIRECT, Reach::RELAYED, Reach::NOT_REACHED, Reach::UNKNOWN};

std::vector<Cause> workingCauses() {
    return {
        {"settings-unreadable",
         kEnded,
         {{S::STATIC_FILE_UNREADABLE}, {S::DYNAMIC_FILE_UNREADABLE}, {S::LOGGED_START_FAILED}},
         {S::DAEMON_RUNS},
         "The daemon does not start, because it cannot load its settings.",
         "Restore the file that is named, or make room for its copy, then start the service; "
         "pelorus-doctor --settings says what else is wrong with it."},
        {"switched-off",
         kOff,
         {{S::REMOTE_ACCESS_OFF}, {S::LOGGED_REMOTE_ACCESS_OFF}},
         {},
         "Remote access is switched off in the settings.",
         "Switch it on in the device's own pages, if it is wanted."},
        {"not-running",
         kEnded,
         {{S::DAEMON_GONE}, {S::LOGGED_END}},
         {},
         "The daemon is not running.",
         "Start the service. If it ends again, its log and the system's journal say why."},
        {"credentials-missing",
         kNotDirect,
         {{S::CREDENTIALS_MISSING}, {S::LOGGED_CREDENTIALS_MISSING}},
         {},
         "The device has no credentials for the service, so the daemon waits for them.",
         "Register the device with the service; the daemon notices the credentials by itself."},
        {"no-network",
         kNotReached,
         {{S::NO_INTERFACE_UP}, {S::NO_ADDRESS}, {S::NO_DEFAULT_ROUTE}, {S::LOGGED_NO_ADDRESS}},
         {},
         "The device has no working connection to the home network.",
         "Check the cable or the wireless connection, and that the gateway gives out addresses."},
        {"gateway-off",
         kNotDirect,
         {{S::GATEWAY_SILENT, S::SERVICE_UNRESOLVED}, {S::GATEWAY_SILENT, S::SERVICE_UNREACHABLE}},
         {},
         "The gateway does not answer at all.",
         "Check that the gateway is switched on, and the cables between it and the device."},
        {"gateway-without-address",
         kNotDirect,
         {{S::GATEWAY_WITHOUT_ADDRESS}, {S::LOGGED_GATEWAY_WITHOUT_ADDRESS}},
         {S::GATEWAY_ADDRESS_PUBLIC, S::GATEWAY_ADDRESS_SHARED, S::GATEWAY_ADDRESS_PRIVATE,
          S::GATEWAY_ELSEWHERE},
         "The gateway has no internet address.",
         "Check the gateway's connection to the provider, and restart it."},
    };
}

std::vector<Cause> serviceCauses() {
    return {
        {"clock-wrong",
         kRunning,
         {{S::CLOCK_WRONG}},
         {},
         "The device's clock is wrong, so it takes the service's certificate for invalid.",
         "Set the clock, and check the time server in the device's settings."},
        {"service-unresolved",
         kRunning,
         {{S::SERVICE_UNRESOLVED}, {S::LOGGED_SERVICE_UNRESOLVED}},
         {S::SERVICE_REACHED},
         "The device cannot find the central service by its name.",
         "Check which name server the device uses; restarting the gateway often helps."},
        {"service-certificate",
         kRunning,
         {{S::SERVICE_CERTIFICATE_BAD}, {S::LOGGED_SERVICE_CERTIFICATE}},
         {S::SERVICE_REACHED, S::SERVICE_UNRESOLVED, S::CLOCK_WRONG},
         "The central service cannot prove that it is the right one, so the device tells it nothing.",
         "If other devices are all right, look for a proxy or filter that intercepts TLS, and for "
         "outdated certificate authorities on this device. Otherwise the maker has to act."},
        {"service-unreachable",
         kRunning,
         {{S::SERVICE_UNREACHABLE}, {S::LOGGED_SERVICE_UNREACHABLE}},
         {S::SERVICE_REACHED},
         "The central service cannot be reached.",
         "Check whether other devices get into the internet. If they do, the service is down or "
         "filtered: wait, the daemon tries again in every cycle."},
    };
}

std::vector<Cause> answerCauses() {
    return {
        {"service-asks-to-wait",
         kNotReached,
         {{S::LOGGED_SERVICE_WAIT}},
         {},
         "The central service has asked the device to wait.",
         "Nothing needs to be done: the daemon goes on by itself when the wait is over."},
        {"service-silent",
         kNotDirect,
         {{S::LOGGED_SERVICE_SILENT}, {S::LOGGED_TEST_UNANSWERED}},
         {S::SERVICE_UNRESOLVED, S::SERVICE_UNREACHABLE, S::SERVICE_CERTIFICATE_BAD,
          S::LOGGED_SERVICE_UNRESOLVED, S::LOGGED_SERVICE_UNREACHABLE,
          S::LOGGED_SERVICE_CERTIFICATE,
          S::LOGGED_SERVICE_NONSENSE},  // of a test: an answer that is too long is dropped
         "The central service takes connections but does not answer the device's requests.",
         "The maker has to look at the service; the daemon tries again in every cycle."},
        {"service-answers-nonsense",
         kNotDirect,
         {{S::LOGGED_SERVICE_NONSENSE}},
         {S::SERVICE_UNRESOLVED, S::SERVICE_UNREACHABLE, S::SERVICE_CERTIFICATE_BAD},
         "The central service answers with something that the daemon cannot use.",
         "The maker has to look at the service and its URL in the settings."},
    };
}

std::vector<Cause> publishingCauses() {
    return {
        {"another-device-answers",
         kNotDirect,
         {{S::OTHER_DEVICE_ANSWERS}, {S::LOGGED_OTHER_DEVICE}},
         {},
         "Another device answers at the ports that were opened for this one.",
         "Look in the gateway's pages which device the ports lead to, and remove old entries."},
        {"manual-ports-invalid",
         kNotDirect,
         {{S::MANUAL_PORT_INVALID, S::MANUAL_MODE}, {S::LOGGED_MANUAL_PORT_INVALID}},
         {},
         "The ports that were entered by hand are not valid port numbers.",
         "Enter the two ports that the gateway forwards (1 to 65535), or switch to automatic."},
        {"manual-ruled-out",
         kNotDirect,
         {{S::LOGGED_MANUAL_RULED_OUT}, {S::LOGGED_SECOND_NAT, S::MANUAL_MODE}},
         {},
         "The ports forwarded by hand are not tested, because a second router was found earlier.",
         "Switch to automatic until the device is reached once, or restart the service."},
        {"manual-ports-closed",
         kNotDirect,
         {{S::LOGGED_TEST_FAILED, S::MANUAL_MODE}, {S::PORT_TEST_FAILS, S::MANUAL_MODE}},
         {},
         "The ports entered by hand cannot be reached from the internet.",
         "Forward exactly these ports in the gateway to this device's address, or switch to "
         "automatic."},
        {"publishing-failed",
         kNotDirect,
         {{S::LOGGED_PUBLISHING_FAILED}},
         {S::BACK_END_SILENT, S::LOGGED_BACK_END_SILENT},
         "The ports work, but their record could not be stored.",
         "Nothing needs to be done: the next search publishes them. If it lasts, look at the log of "
         "the device's back end, and tell the maker."},
        {"names-lead-elsewhere",
         kRunning,
         {{S::NAMES_LEAD_ELSEWHERE}, {S::LOGGED_NAMES_LEAD_ELSEWHERE}},
         {S::NAMES_RIGHT},
         "The device's public names lead to another address.",
         "After a change this takes some minutes. If it lasts, restart the service; then the maker "
         "has to look at the names."},
        {"names-unresolved",
         kRunning,
         {{S::NAMES_UNRESOLVED}, {S::LOGGED_NAMES_UNRESOLVED}},
         {S::NAMES_RIGHT, S::NAMES_LEAD_ELSEWHERE},
         "The device's public names do not lead to one address.",
         "After a change this takes some minutes. If it lasts, the maker has to look at the names."},
    };
}

std::vector<Cause> deviceCauses() {
    return {
        {"web-server-silent",
         kRunning,
         {{S::WEB_SERVER_SILENT}},
         {S::CREDENTIALS_MISSING, S::MANUAL_MODE},
         "The device's own web server does not listen on its HTTP port, so every port test fails "
         "even if the way is open.",
         "Start the web server, or correct INTERNAL_HTTP_PORT and INTERNAL_HTTPS_PORT."},
        {"back-end-silent",
         kRunning,
         {{S::BACK_END_SILENT}, {S::LOGGED_BACK_END_SILENT}},
         {S::BACK_END_ANSWERS},
         "The device's local back end does not answer, so no status can be stored.",
         "Restart the device's web server, and look at its log."},
        {"back-end-refuses",
         kNotDirect,
         {{S::LOGGED_BACK_END_REFUSES}},
         {},
         "The device's local back end does not accept what the daemon reports.",
         "Look at the back end's log, and at the LOCAL_... URLs in the settings. An answer that takes "
         "too long counts as a refusal."},
        {"relay-client-missing",
         kNotReached,
         {{S::RELAY_CLIENT_MISSING}},
         {},
         "The relay cannot be used, because openvpn is not installed.",
         "Install openvpn."},
        {"tunnel-device-missing",
         kNotReached,
         {{S::TUNNEL_DEVICE_MISSING}},
         {},
         "The relay cannot be used, because the system has no tunnel device.",
         "Load the kernel's tun module."},
    };
}

std::vector<Cause> clientCauses() {
    return {
        {"tunnel-files-unwritable",
         kNotReached,
         {{S::TUNNEL_FILES_UNWRITABLE}},
         {},
         "The relay cannot be used, because its client's files cannot be written.",
         "Make room in the folders that the settings name for them, and check that they exist."},
        {"tunnel-client-does-not-start",
         kNotReached,
         {{S::LOGGED_TUNNEL_NO_OUTPUT}},
         {S::TUNNEL_FILES_UNWRITABLE},
         "The relay cannot be used, because its client does not start.",
         "Run STARTCMD of the settings by hand in OPENVPN_CONFIG_PATH, and read what it says."},
        {"relay-refused",
         kNotReached,
         {{S::TUNNEL_REFUSED}},
         {},
         "The relay refuses the device's credentials.",
         "Register the device anew, or have the maker check its account."},
        {"tunnel-died",
         kNotReached,
         {{S::TUNNEL_GONE}, {S::LOGGED_TUNNEL_DIED}},
         {S::LOGGED_RELAY_DOES_NOT_COME_UP, S::TUNNEL_RUNS},
         "The tunnel's client has died.",
         "Nothing needs to be done: the next cycle starts another. If it recurs, look at the "
         "client's output."},
        {"two-tunnels",
         {Reach::RELAYED},
         {{S::SECOND_TUNNEL_CLIENT}},
         {},
         "Two tunnel clients run, and may disconnect each other.",
         "Stop the older one with kill -9, or restart the device."},
    };
}

std::vector<Cause> relayCauses() {
    return {
        {"relay-unresolved",
         kNotReached,
         {{S::RELAY_UNRESOLVED}},
         {S::TUNNEL_SAYS_UP},
         "The tunnel's client cannot find the relay by its name.",
         "Check which name server the device uses; restarting the gateway often helps."},
        {"relay-certificate",
         kNotReached,
         {{S::RELAY_CERTIFICATE_BAD}},
         {S::TUNNEL_SAYS_UP},
         "The tunnel's client does not accept the relay's certificate.",
         "Check the device's clock. If it is right, the maker has to look at the relay's certificate "
         "and at the client's configuration."},
        {"relay-does-not-come-up",
         kNotReached,
         {{S::LOGGED_RELAY_DOES_NOT_COME_UP}, {S::TUNNEL_UNANSWERED}},
         {S::TUNNEL_SAYS_UP, S::TUNNEL_REFUSED, S::TUNNEL_FILES_UNWRITABLE, S::RELAY_UNRESOLVED,
          S::RELAY_CERTIFICATE_BAD},
         "The tunnel to the relay does not come up.",
         "Check that the provider lets the relay's port through; otherwise the relay is down."},
    };
}

std::vector<Cause> addressCauses() {
    return {
        {"wrong-gateway-answers",
         kNotDirect,
         {{S::GATEWAY_ELSEWHERE, S::LOGGED_SECOND_NAT},
          {S::GATEWAY_ELSEWHERE, S::SERVICE_SEES_OTHER_ADDRESS},
          {S::GATEWAY_ELSEWHERE, S::GATEWAY_ADDRESS_PRIVATE},
          {S::GATEWAY_ELSEWHERE, S::GATEWAY_ADDRESS_SHARED},
          {S::GATEWAY_ELSEWHERE, S::GATEWAY_WITHOUT_ADDRESS},
          {S::GATEWAY_ELSEWHERE, S::GATEWAY_HIDES_ADDRESS}},
         {S::LOGGED_MANUAL_RULED_OUT},
         "A device that does not seem to be your gateway answers as one, and no port opened on it can "
         "be reached.",
         "Look which device has that address. If it is an access point or another router, switch "
         "UPnP off on it."},
        {"shared-address",
         kNotDirect,
         {{S::GATEWAY_ADDRESS_SHARED}},
         {S::LOGGED_SECOND_NAT, S::GATEWAY_ELSEWHERE},
         "The provider gives your gateway a shared address, at which nothing can be reached.",
         "Ask the provider for a public IPv4 address. Until then the relay is the right way."},
        {"second-nat",
         kNotDirect,
         {{S::LOGGED_SECOND_NAT, S::GATEWAY_ADDRESS_SHARED},
          {S::LOGGED_SECOND_NAT},
          {S::GATEWAY_ADDRESS_PRIVATE},
          {S::SERVICE_SEES_OTHER_ADDRESS}},
         {S::LOGGED_MANUAL_RULED_OUT, S::GATEWAY_ELSEWHERE},
         "A second router stands in front of your gateway, and no port opened on the gateway can be "
         "reached.",
         "Put the provider's box into bridge mode, or ask the provider for a public IPv4 address. "
         "Until then the relay is the right way."},
    };
}

std::vector<Cause> gatewayCauses() {
    return {
        {"no-gateway-protocol",
         kNotDirect,
         {{S::NO_GATEWAY_ANSWERS}, {S::LOGGED_NO_GATEWAY}},
         {S::GATEWAY_FOUND, S::OWN_ROUTER, S::NO_INTERFACE_UP, S::NO_ADDRESS},
         "The gateway lets no device open ports: it answers neither UPnP nor NAT-PMP.",
         "Switch UPnP on in the gateway's settings, or forward two ports by hand."},
        {"gateway-hides-address",
         kNotDirect,
         {{S::GATEWAY_HIDES_ADDRESS}},
         {S::NO_GATEWAY_ANSWERS, S::GATEWAY_ELSEWHERE},
         "The gateway does not tell its internet address, so the daemon does not rely on its ports.",
         "Look for the address in the gateway's pages. If it is private or begins with 100.64 to "
         "100.127, ask the provider for a public IPv4 address; otherwise restart the gateway."},
        {"ports-taken",
         kNotDirect,
         {{S::LOGGED_PORT_HELD_BY_OTHER}, {S::DEFAULT_PORTS_ONLY, S::PORT_HELD_BY_OTHER}},
         {S::LOGGED_GATEWAY_REFUSES},
         "The ports that this device may use lead to another address at home.",
         "Remove that entry in the gateway, or allow other ports "
         "(DEFAULT_PORTS_ONLY)."},
        {"gateway-refuses",
         kNotDirect,
         {{S::LOGGED_GATEWAY_REFUSES}},
         {},
         "The gateway refuses ports that the device needs.",
         "Allow this device to open ports in the gateway's settings. Some gateways forward only to "
         "ports from 1024 up: then move the web server there."},
    };
}

std::vector<Cause> outsideCauses() {
    return {
        {"mapping-lost",
         {Reach::DIRECT, Reach::NOT_REACHED},
         {{S::OUR_MAPPINGS_MISSING}},
         {},
         "The gateway no longer forwards the published ports.",
         "Nothing needs to be done: the next port test notices, and the ports are mapped again. "
         "Restarting the service does it at once."},
        {"address-changed",
         kNotReached,
         {{S::GATEWAY_ADDRESS_CHANGED}},
         {},
         "The gateway has got another internet address, and the device is published at the old one.",
         "Nothing needs to be done: the next port test notices, and the new address is published. "
         "Restarting the service does it at once."},
        {"port-filtered",
         kNotDirect,
         {{S::LOGGED_TEST_FAILED}, {S::PORT_TEST_FAILS}},
         {S::MANUAL_MODE, S::NO_GATEWAY_ANSWERS, S::LOGGED_NO_GATEWAY, S::OUR_MAPPINGS_MISSING},
         "The gateway opens the ports, but nothing from the internet comes through them.",
         "A filter in the gateway or at the provider is in the way: look there for a firewall, or "
         "ask the provider."},
        {"disk-asleep",
         kNotDirect,
         {{S::LOGGED_TEST_SKIPPED_DISK}},
         {},
         "The disk sleeps, and a test of the ports would wake it, so none is made.",
         "Use the device: the next cycle after the disk has woken tests the ports."},
        {"settling",
         kNotReached,
         {{S::LOGGED_ATTEMPT}, {S::CHANGED_SINCE}},
         {},
         "The daemon is at work, or has not noticed yet that something has changed.",
         "Wait for the end of the next cycle, and ask again."},
    };
}

// First what keeps the daemon from working at all, then what it needs for both ways, then what
// keeps the relay away, then the direct way.
std::vector<Cause> table() {
    std::vector<Cause> rows;
    for (const auto& group :
         {workingCauses, serviceCauses, answerCauses, publishingCauses, deviceCauses, clientCauses,
          relayCauses, addressCauses, gatewayCauses, outsideCauses}) {
        for (Cause& cause : group()) rows.push_back(std::move(cause));
    }
    return rows;
}

bool isAmong(const Reaches& reaches, Reach reach) {
    return std::find(reaches.begin(), reaches.end(), reach) != reaches.end();
}

// The first list of which everything was seen; null without one.
const std::vector<Sign>* carriedBy(const Cause& cause, const Evidence& evidence) {
    const auto has = [&](Sign sign) { return evidence.has(sign); };
    if (std::any_of(cause.notSeen.begin(), cause.notSeen.end(), has)) return nullptr;
    for (const std::vector<Sign>& signs : cause.seen) {
        if (std::all_of(signs.begin(), signs.end(), has)) return &signs;
    }
    return nullptr;
}

// What an attempt ended with comes before a look at the names that is older: up to a day.
bool isOvertaken(Sign sign, const Evidence& evidence) {
    if (sign != S::LOGGED_NAMES_LEAD_ELSEWHERE && sign != S::LOGGED_NAMES_UNRESOLVED) return false;
    const auto looked = evidence.signs.at(sign).when;
    return std::any_of(evidence.signs.begin(), evidence.signs.end(), [&](const auto& seen) {
        return isOutcome(seen.first) && seen.second.when > looked;
    });
}

}  // namespace

const std::vector<Cause>& allCauses() {
    static const std::vector<Cause> causes = table();
    return causes;
}

std::vector<NamedCause> findCauses(const Evidence& evidence, Reach reach) {
    std::vector<NamedCause> found, overtaken;
    for (const Cause& cause : allCauses()) {
        if (!isAmong(cause.when, reach)) continue;
        const std::vector<Sign>* const signs = carriedBy(cause, evidence);
        if (signs == nullptr) continue;
        NamedCause named{&cause, {}};
        for (const Sign sign : *signs) named.proofs.push_back(evidence.signs.at(sign));
        (isOvertaken(signs->front(), evidence) ? overtaken : found).push_back(std::move(named));
    }
    found.insert(found.end(), overtaken.begin(), overtaken.end());
    return found;
}

}  // namespace pelorus::doctor
