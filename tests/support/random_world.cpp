#include "support/random_world.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <fstream>

#include "support/fake_files.h"
#include "support/fixture.h"

namespace pelorus::support {

namespace fs = std::filesystem;

namespace {

constexpr long kShortestCycle = 30;  // seconds
const std::string kRelay = "44.128.0.9";
const std::string kCopy = "/DYNAMIC_CONFIG_TMP", kCredentials = "/OPENVPN_AUTH_FILE";
const std::string kClientPid = "/OPENVPN_PID_FILE", kClientOutput = "/STARTCMD_OUTFILE";
const std::vector<FakeGateway::Mapping> kNeighbours{{9091, "192.168.77.30", 80, "Kavra"},
                                                    {6881, "192.168.77.20", 6881, "game"}};
RandomWorld* current = nullptr;

// The first one in @p url.
int portIn(const std::string& url) {
    const std::size_t at = url.find("port=");
    if (at == std::string::npos) return 0;
    return static_cast<int>(std::strtol(url.c_str() + at + 5, nullptr, 10));
}

bool isRunning(pid_t process) {
    return process > 0 && waitpid(process, nullptr, WNOHANG) == 0;
}

// Ends the process: the daemon did what it must not do.
[[noreturn]] void fault(const char* what) {
    static_cast<void>(!write(STDERR_FILENO, what, std::strlen(what)));
    std::abort();
}

}  // namespace

unsigned Stream::byte() {
    if (generator) return (*generator)() & 0xffU;
    return next < bytes.size() ? bytes[next++] : 0U;
}

RandomWorld::RandomWorld(Stream decisions, Kind reachedBy, Climate typical, std::string where)
    : stream{std::move(decisions)}, climate{typical}, kind{reachedBy}, folder{std::move(where)} {
    current = this;
    fs::copy_file("/bin/sleep", folder + "/openvpn", fs::copy_options::skip_existing);
    std::ofstream{folder + "/minutes"} << "0\n";
    std::ofstream{folder + "/dynamicconfig.ini"} << "COMMUNICATION_STATUS=\n";
    writeStaticSettings();
    takeFakes();
}

RandomWorld::~RandomWorld() {
    stopClient();
    resetFakes();
    current = nullptr;
}

// The sample of the package, and what a device has in addition. A file is named by its setting.
void RandomWorld::writeStaticSettings() const {
    static const auto sources = fs::path{__FILE__}.parent_path().parent_path().parent_path();
    std::ofstream file{folder + "/static.ini"};
    file << std::ifstream{sources / "packaging/config/globalconfig.ini"}.rdbuf();
    for (const std::string& path : {kCopy, kCredentials, kClientPid, kClientOutput}) {
        fs::remove(folder + path);
        file << path.substr(1) << "=" << folder << path << "\n";
    }
    file << "DYNAMIC_CONFIG=" << folder << "\nOPENVPN_CONFIG_PATH=" << folder
         << "\nDEVICEID=" << kDeviceId << "\nDEVICEAUTH=" << kDeviceAuth
         << "\nSUBDOMAIN=" << kSubdomain << "\nDEVICETYPE=" << (kind == Kind::MAKERS_ROUTER ? 5 : 3)
         << "\nMANUAL_PORT_FORWARD=" << (kind == Kind::BY_HAND ? "TRUE" : "FALSE")
         << "\nMANUAL_EXTERNAL_HTTP_PORT=18080\nMANUAL_EXTERNAL_HTTPS_PORT=18443\n"
            "INTERNAL_HTTP_PORT=8080\nINTERNAL_HTTPS_PORT=8443\nSTARTCMD=start-client\n";
}

// As the local web back end does; the new time makes the daemon read it.
void RandomWorld::writeSettings(const std::string& status) const {
    static time_t changes = 0;
    const std::string copy = folder + kCopy;
    if (!fs::exists(copy)) return;
    std::ofstream{copy} << (status.empty() ? "" : "COMMUNICATION_STATUS=" + status + "\n")
                        << "MANUAL_PORT_FORWARD=" << (kind == Kind::BY_HAND ? "TRUE\n" : "FALSE\n")
                        << otherLines << "\n";
    const timespec times[]{{++changes, 0}, {changes, 0}};
    utimensat(AT_FDCWD, copy.c_str(), times, 0);
}

void RandomWorld::takeFakes() {
    resetFakes();
    auto& gateway = FakeGateway::get();
    gateway.table = kNeighbours;
    gateway.onCall([this](const std::string& call) { prepareGateway(call); });
    auto& web = FakeWeb::get();
    web.onCall([&, this](const std::string& url) { web.answerOnce(url, answerTo(url)); });
    auto& shell = FakeCommands::get();
    shell.onCall([&, this](const std::string& line) { shell.answerOnce(line, run(line)); });
    VirtualClock::get().onPause([this](long seconds) { turn(seconds); });
    auto& net = FakeNet::get();
    net.onLookup = [&, this](const std::string& name) {
        event();
        net.names[name] = {has(NAMES) ? "44.128.77.77" : published.empty() ? kRelay : published};
        if (isOdd()) net.names[name] = {oddText(), "fe80::1"};
    };
    auto& files = FakeFiles::get();
    files.redirect(kIdleMinutesFile, folder + "/minutes");
    files.redirect("/tmp/tavik_cm_pid", folder + "/pid");
    files.onOpen = [this](const std::string& path, bool writing) {
        if (path.compare(0, 6, "/proc/") == 0) return 0;  // another thread opens these
        event();
        opened += writing ? 1 : 0;
        return atOpen(writing);
    };
    LogCapture::get().sink = takeLine;
    FakeProcess::get().startsThreads = !climate.fierce;
}

void RandomWorld::takeLine(int /*priority*/, const char* text) {
    static const bool shown = std::getenv("WORLD_LOG") != nullptr;
    if (shown) static_cast<void>(!write(STDERR_FILENO, text, std::strlen(text)));
    for (const char* secret : {kDeviceId, kDeviceAuth, kSubdomain}) {
        if (current->ownSecrets && std::strstr(text, secret) != nullptr) fault(text);
    }
    const bool isSignal = std::strncmp(text, "sigTrap - sigConnKilled", 23) == 0;
    if (isSignal && !current->climate.fierce) current->settle();
    current->event();
}

bool RandomWorld::has(Trouble trouble) const {
    const bool isLasting = (trouble == GATEWAY && kind >= Kind::RELAYED) ||
                           (trouble == TUNNEL && kind == Kind::FAILING);
    const bool canCome = !settled && (climate.fierce || trouble != GATEWAY);
    return isLasting || (canCome && (weather >> trouble & 1U) != 0);
}

bool RandomWorld::isOdd() {
    const bool odd = !settled && stream.chance(climate.noise);
    oddities += odd ? 1 : 0;
    return odd;
}

std::string RandomWorld::oddText() {
    // clang-format off
    static const Texts texts{"", "0.0.0.0", "44.128.0.21", "44.128.0.20\r\n", "::1", "%s%n%d", "-1", "9092", "TRUE",
        "99999999999999999999", "standby", "Initialization Sequence Completed", "\n\n", kDeviceId, kDeviceAuth,
        "<action>wait</action><wait_time>300</wait_time>", "<action>wait</action><wait_time>2147483647</wait_time>",
        "Success<remote_external_ip>", "</external_ip></resp_device_id>"};
    // clang-format on
    const auto known = static_cast<unsigned>(texts.size()), pick = stream.below(2 * known);
    if (pick < known) return texts[pick];
    std::string text(stream.below(40), '\0');
    for (char& letter : text) letter = static_cast<char>(stream.below(256));
    while (pick == known && !text.empty() && text.size() < 20'000) text += text;
    return text;
}

void RandomWorld::event() {
    ++events;
    atEvent();
}

// Each pause; those that end a cycle may change the weather.
void RandomWorld::turn(long seconds) {
    event();
    if (seconds < kShortestCycle) return;
    ++cycles;
    FakeGateway::get().clear();
    FakeWeb::get().clear();
    FakeCommands::get().clear();
    VirtualClock::get().clear();
    FakeNet::get().lookups.clear();
    FakeNet::get().names.clear();
    if (!settled && stream.chance(climate.changes)) changeWeather();
    atCycleEnd();
}

void RandomWorld::changeWeather() {
    ++oddities;
    const bool good = stream.below(2) == 0;
    weather = good ? 0 : stream.below(512) & stream.below(512);
    wan = "44.128.0." + std::to_string(20 + stream.below(2));
    auto& net = FakeNet::get();
    net.hostname = !good && stream.below(8) == 1 ? oddText() : "nas";
    net.interfaces.resize(1);
    if (!has(INTERFACE)) net.interfaces.push_back({"eth0", kDeviceAddress});
    std::ofstream{folder + "/minutes"} << (!good && stream.below(4) == 1 ? oddText() : "0\n");
    constexpr long kYear = 365L * 86400;
    if (stream.below(16) == 1) VirtualClock::get().advance(stream.below(2) == 0 ? kYear : -kYear);
    if (!climate.quick) return;
    if (stream.below(32) == 1) {  // to another home
        static constexpr Kind kHomes[]{Kind::UPNP, Kind::NATPMP, Kind::BY_HAND, Kind::RELAYED,
                                       Kind::FAILING};
        kind = kHomes[stream.below(5)];
        FakeGateway::get().table = kNeighbours;
    }
    static const Texts keys{
        "MANUAL_PORT_FORWARD", "DEFAULT_PORTS_ONLY",        "DEVICEAUTH",     "SUBDOMAIN",
        "INTERNAL_HTTP_PORT",  "MANUAL_EXTERNAL_HTTP_PORT", "SERVER_BASE_URL"};
    if (climate.oddSettings) otherLines = keys[stream.below(7)] + "=" + oddText();
    ownSecrets =
        ownSecrets && !holds(otherLines, "DEVICEAUTH=") && !holds(otherLines, "SUBDOMAIN=");
    writeSettings("");
}

void RandomWorld::prepareGateway(const std::string& call) {
    event();
    ++requests;
    auto& gateway = FakeGateway::get();
    gateway.upnp = kind != Kind::NATPMP && !has(GATEWAY);
    gateway.natpmp = kind == Kind::NATPMP && !has(GATEWAY);
    gateway.externalIp = wan;
    gateway.granted = {};
    gateway.failing.clear();
    std::tie(gateway.externalIpStatus, gateway.igdState, gateway.copies, gateway.silent,
             gateway.refuseAll, gateway.answerDelay, gateway.lie) =
        std::tuple{0, 1, 1, false, false, 0L, std::nullopt};
    const bool searches = call == "discover 2000 ms";
    if (searches) gateway.devices = FakeGateway{}.devices;
    if (!climate.fierce || !isOdd()) return;
    static const Texts calls{"open", "close", "address", "map", "timeout", "read"};
    const unsigned number = stream.below(256);
    const int part = static_cast<int>(number);
    const auto text = [this] { return oddText(); };
    switch (stream.below(11)) {  // clang-format off
        case 0: gateway.upnp = !gateway.upnp; break;
        case 1: gateway.natpmp = !gateway.natpmp; break;
        case 2: gateway.externalIp = text(); break;
        case 3: gateway.externalIpStatus = part - 5; break;
        case 4: gateway.igdState = part % 6; break;
        case 5: gateway.refuseAll = true; break;
        case 6: gateway.silent = true; break;
        case 7: gateway.failing.insert(calls[number % calls.size()]); break;
        case 8: gateway.granted = {part * 257, {}, number % 2 * 100}; break;
        case 9: gateway.answerDelay = part * 30L; gateway.copies = part % 4; break;
        default:
            gateway.lie = {part % 3, text(), text(), text(), text(), text()};
            if (searches) gateway.devices.assign(number % 12, {text(), gateway.devices[0].second});
    }  // clang-format on
}

WebAnswer RandomWorld::answerTo(const std::string& url) {
    event();
    ++requests;
    const auto asks = [&](const char* part) { return holds(url, part); };
    const bool local = asks("127.0.0.1"), odd = isOdd();
    const int port = portIn(url);
    if (has(local ? BACK_END : SERVER)) return FakeWeb::noAnswer();
    if (asks("/rest/port_forward/")) {
        const std::string address = url.substr(url.find('=') + 1);
        published = address.substr(0, address.find('&'));
        if (published == "NULL") published.clear();
        if (!published.empty() && reached.count(port) == 0)
            fault("an unproven port is published\n");
    }
    if (odd) {
        static constexpr CURLcode codes[]{CURLE_OK, CURLE_OPERATION_TIMEDOUT,
                                          CURLE_PEER_FAILED_VERIFICATION, CURLE_PARTIAL_FILE};
        if (stream.below(4) == 1) VirtualClock::get().advance(30);
        std::string text = oddText();
        if (asks("/port_test/") && holds(text, "Success")) reached.insert(port);
        return {text, codes[stream.below(4)]};
    }
    if (asks("/local/comm_status")) writeSettings(url.substr(url.find('=') + 1));
    if (asks("/remote_access_status/")) return "<action>proceed</action>";
    if (asks("/myip")) return {wan};
    if (!asks("/port_test/")) return local ? "success" : "Success";
    const std::string seen = has(NAT) ? "44.128.9.9" : wan;
    const std::string answer = "<external_ip>" + wan + "</external_ip><remote_external_ip>" + seen +
                               "</remote_external_ip>";
    if (!leadsHere(port) || has(PORT) || has(NAT)) return answer;
    reached.insert(port);
    return "Success" + answer +
           "<req_device_id>a</req_device_id><resp_device_id>a</resp_device_id>";
}

bool RandomWorld::leadsHere(int port) const {
    const auto& table = FakeGateway::get().table;
    return kind == Kind::BY_HAND || kind == Kind::MAKERS_ROUTER ||
           std::any_of(table.begin(), table.end(), [&](const auto& held) {
               return held.externalPort == port && held.client == kDeviceAddress;
           });
}

CommandAnswer RandomWorld::run(const std::string& command) {
    event();
    const auto runs = [&](const char* part) { return holds(command, part); };
    CommandAnswer answer;
    const bool isSteady = !climate.quick && (runs("helper.sh") || runs("getip.sh"));
    if (shellFails || (!isSteady && isOdd())) {
        obeys = obeys && !runs("kill -");
        answer.fails = shellFails || stream.below(2) == 1;
        answer.exitStatus = 1 + static_cast<int>(stream.below(255));
        answer.output = oddText();
        return answer;
    }
    const std::size_t quote = command.find('"') + 1;
    const std::string entry = "BRENVIK," + command.substr(quote, command.rfind('"') - quote) +
                              (runs(" remove ") ? "," : "");
    const auto isSame = [&](const std::string& held) { return held.find(entry) == 0; };
    if (runs("hdparm")) answer.output = has(DISK) ? "standby\n" : "active/idle\n";
    if (runs("getip.sh wan")) answer.output = has(INTERFACE) ? "" : wan;
    if (runs("getip.sh lan")) answer.output = kDeviceAddress;
    if (runs(" add ")) helperList.push_back(entry + "\n");
    auto& list = helperList;
    if (runs(" remove ")) list.erase(std::remove_if(list.begin(), list.end(), isSame), list.end());
    for (const auto& held : list) answer.output += runs(" list") ? held : "";
    if (runs("start-client")) startClient();
    if (runs("kill -") && runs(std::to_string(client).c_str())) stopClient();
    return answer;
}

void RandomWorld::startClient() {
    // One that no signal reached is given up after five, and the next start goes on.
    if (isRunning(client) && obeys) fault("a second client is started\n");
    stopClient();
    obeys = true;
    static pid_t kept = 0;
    static const int endsWithUs = std::atexit([] {
        if (kept > 0) kill(kept, SIGKILL);
    });
    EXPECT_EQ(endsWithUs, 0);
    std::string program = folder + "/openvpn", seconds = "36000";  // longer than any run
    char* const arguments[]{program.data(), seconds.data(), nullptr};
    const bool isKept = climate.quick && kept != 0;
    if (!isKept && posix_spawn(&kept, program.c_str(), nullptr, nullptr, arguments, nullptr) != 0)
        kept = 0;
    client = kept;
    if (client == 0) return;
    std::ofstream{folder + kClientOutput}
        << "Peer Connection Initiated with [AF_INET]" << kRelay << ":1194\n"
        << (has(TUNNEL) ? "" : "Initialization Sequence Completed\n");
    // Like the real one, it does not run without.
    if (!(std::ofstream{folder + kClientPid} << client << std::endl)) stopClient();
}

void RandomWorld::stopClient() {
    if (!isRunning(client)) return;
    const pid_t stopped = std::exchange(client, 0);
    if (climate.quick) return;
    kill(stopped, SIGTERM);
    waitpid(stopped, nullptr, 0);
}

std::string RandomWorld::leftOver() const {
    std::string left;
    const auto& table = FakeGateway::get().table;
    for (const auto& held : table) {
        const bool named = held.description.compare(0, 5, "Kavra") == 0;
        // A renewal takes the description away, by which the shutdown finds its mappings.
        if (held.client == kDeviceAddress && (named || kind == Kind::NATPMP))
            left += " " + ::testing::PrintToString(held);
    }
    for (const auto& held : kNeighbours) {
        const bool isThere = std::find(table.begin(), table.end(), held) != table.end();
        if (!isThere) left += " a neighbour's gone";
    }
    for (const auto& entry : helperList) left += " " + entry;
    if (!published.empty()) left += " record of " + published;
    if (isRunning(client)) left += " client";
    if (fs::exists(folder + kClientPid)) left += " client's pid file";
    return left;
}

}  // namespace pelorus::support
