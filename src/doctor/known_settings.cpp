#include "doctor/known_settings.h"

#include <algorithm>

namespace pelorus::doctor {

namespace {

constexpr std::string_view kIdles = "the daemon idles";
constexpr std::string_view kNoRelay = "there is no relay";
constexpr std::string_view kBareHost = "the request goes to the bare host";
constexpr std::string_view kNoBackEnd = "the local back end is not told";

}  // namespace

const std::vector<KnownSetting>& knownSettings() {
    using Kind = SettingKind;
    static const std::vector<KnownSetting> settings{
        {"DYNAMIC_CONFIG", Kind::PATH, "/dynamicconfig.ini is read", ""},
        {"DYNAMIC_CONFIG_TMP", Kind::PATH, "", ""},
        {"STATIC_ONLY_KEYS", Kind::TEXT, "", ""},
        {"ENABLEREMOTEACCESS", Kind::SWITCH, "remote access is off", ""},
        {"DEVICETYPE", Kind::NUMBER, "", ""},
        {"DEVICEID", Kind::SECRET, kIdles, ""},
        {"DEVICEAUTH", Kind::SECRET, kIdles, ""},
        {"SUBDOMAIN", Kind::SECRET, "", ""},
        {"COMMUNICATION_STATUS", Kind::STATUS, "", ""},
        {"INTERNAL_HTTP_PORT", Kind::PORT, "requests to the local back end go to port 0", ""},
        {"INTERNAL_HTTPS_PORT", Kind::PORT, "", ""},
        {"DEFAULT_PORTS_ONLY", Kind::TRUTH, "", ""},
        {"MANUAL_PORT_FORWARD", Kind::TRUTH, "", ""},
        {"MANUAL_EXTERNAL_HTTP_PORT", Kind::PORT, "", ""},
        {"MANUAL_EXTERNAL_HTTPS_PORT", Kind::PORT, "", ""},
        {"SERVER_BASE_URL", Kind::SERVER, "every request to the service fails", ""},
        {"REMOTE_TESTPORTURL", Kind::SERVICE_TEMPLATE, kBareHost, "ssdss"},
        {"REMOTE_SETFORWARDURL", Kind::SERVICE_TEMPLATE, kBareHost, "sssdds"},
        {"REMOTE_SETCOMMSTATUSURL", Kind::SERVICE_TEMPLATE, kBareHost, "sss"},
        {"LOCAL_SETFORWARDURL", Kind::BACK_END_TEMPLATE, kNoBackEnd, "dsddsd"},
        {"LOCAL_DELFORWARDURL", Kind::BACK_END_TEMPLATE, kNoBackEnd, "dd"},
        {"LOCAL_SETCOMMSTATUSURL", Kind::BACK_END_TEMPLATE, kNoBackEnd, "ds"},
        {"LOCAL_SETLOCALIPURL", Kind::BACK_END_TEMPLATE, kNoBackEnd, "ds"},
        {"OPENVPN_CONFIG_PATH", Kind::PATH, "the relay's commands run in /", ""},
        {"OPENVPN_AUTH_FILE", Kind::PATH, kNoRelay, ""},
        {"OPENVPN_PID_FILE", Kind::PATH, "a tunnel client is neither recognised nor stopped", ""},
        {"UPDATE_CONF_WITH_SERVER_CMD", Kind::COMMAND, "", ""},
        {"STARTCMD", Kind::COMMAND, kNoRelay, ""},
        {"STARTCMD_OUTFILE", Kind::PATH, kNoRelay, ""},
        {"LOG_SUCCESS_TEXT", Kind::TEXT, "the tunnel counts as up whatever its client says", ""},
    };
    return settings;
}

const KnownSetting* findKnownSetting(std::string_view key) {
    const auto& all = knownSettings();
    const auto found = std::find_if(
        all.begin(), all.end(), [&](const KnownSetting& setting) { return setting.key == key; });
    return found == all.end() ? nullptr : &*found;
}

bool isDangerous(const KnownSetting& setting) {
    switch (setting.kind) {
        case SettingKind::PATH:
        case SettingKind::COMMAND:
        case SettingKind::SERVER:
        case SettingKind::SERVICE_TEMPLATE:
        case SettingKind::BACK_END_TEMPLATE:
            return true;
        default:
            return setting.key == "LOG_SUCCESS_TEXT";
    }
}

bool isOfBackEnd(std::string_view key) {
    return key == "EXTERNAL_IP" || key == "EXTERNAL_HTTP_PORT" || key == "EXTERNAL_HTTPS_PORT";
}

}  // namespace pelorus::doctor
