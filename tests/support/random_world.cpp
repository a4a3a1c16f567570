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
const FakeGateway::Mapping kNeighbours[]{{9091, "192.168.77.30", 80, "Kavra"},
                                         {6881, "192.168.77.20", 6881, "game"}};
RandomWorld* current = nullptr;

std::string settingsOf(Kind kind, const std::string& folder) {
    const std::string local = "=http://127.0.0.1:%d/", own = "\nOPENVPN_";
    return "ENABLEREMOTEACCESS=1\nDYNAMIC_CONFIG=" + folder + "\nDYNAMIC_CONFIG_TMP=" + folder +
           "/copy.ini\nDEVICETYPE=" + (kind == Kind::MAKERS_ROUTER ? "5" : "3") +
           "\nSERVER_BASE_URL=https://cloud.kavra.example\nREMOTE_TESTPORTURL=/test?%s&%s:%d&%s&%s"
           "\nREMOTE_SETFORWARDURL=/record?%s&%s&%s&:%d&%d&%s\nREMOTE_SETCOMMSTATUSURL=/ip?%s&%s&%s"
           "\nLOCAL_SETFORWARDURL" +
           local + "set?%s&%d&%d&%s&%d\nLOCAL_DELFORWARDURL" + local +
           "del?%d\nLOCAL_SETCOMMSTATUSURL" + local + "status?%s\nLOCAL_SETLOCALIPURL" + local +
           "ip?%s" + own + "CONFIG_PATH=" + folder + own + "AUTH_FILE=" + folder + "/auth.txt" +
           own + "PID_FILE=" + folder + "/client.pid\nSTARTCMD_OUTFILE=" + folder +
           "/client.out\nSTARTCMD=start-client\nUPDATE_CONF_WITH_SERVER_CMD=update-client\n"
           "LOG_SUCCESS_TEXT=Completed\nSTATIC_ONLY_KEYS=STARTCMD UPDATE_CONF_WITH_SERVER_CMD "
           "OPENVPN_AUTH_FILE OPENVPN_PID_FILE STARTCMD_OUTFILE DYNAMIC_CONFIG_TMP\nDEVICEID=" +
           kDeviceId + "\nDEVICEAUTH=" + kDeviceAuth + "\nSUBDOMAIN=" + kSubdomain +
           "\nINTERNAL_HTTP_PORT=8080\nINTERNAL_HTTPS_PORT=8443\nMANUAL_PORT_FORWARD=" +
           (kind == Kind::BY_HAND ? "TRUE" : "FALSE") +
           "\nMANUAL_EXTERNAL_HTTP_PORT=18080\n"
           "MANUAL_EXTERNAL_HTTPS_PORT=18443\nDEFAULT_PORTS_ONLY=FALSE\n";
}

// The number after the last colon.
int portIn(const std::string& url) {
    return static_cast<int>(std::strtol(url.c_str() + url.rfind(':') + 1, nullptr, 10));
}

bool isRunning(pid_t process) {
    return process > 0 && waitpid(process, nullptr, WNOHANG) == 0;
}

}  // namespace

// How the linker calls the start of a std::thread.
#define START_THREAD(prefix) \
    prefix##_ZNSt6thread15_M_start_threadESt10unique_ptrINS_6_StateESt14default_deleteIS1_EEPFvvE
extern "C" {
void START_THREAD(__real_)(void* thread, void* state, void (*depend)());
void START_THREAD(__wrap_)(void* thread, void* state, void (*depend)()) {
    const bool watches = current == nullptr || !current->climate.quick;
    if (watches) START_THREAD(__real_)(thread, state, depend);
}
}

unsigned Stream::byte() {
    if (generator) return (*generator)() & 0xffU;
    return next < bytes.size() ? bytes[next++] : 0U;
}

RandomWorld::RandomWorld(Stream decisions, Kind reachedBy, Climate typical, std::string where)
    : stream{std::move(decisions)}, climate{typical}, kind{reachedBy}, folder{std::move(where)} {
    current = this;
    for (const char* name : {"/pid", "/client.pid", "/client.out", "/auth.txt", "/copy.ini"}) {
        fs::remove(folder + name);
    }
    std::ofstream{folder + "/minutes"} << "0\n";
    std::ofstream{folder + "/static.ini"} << settingsOf(kind, folder);
    std::ofstream{folder + "/dynamicconfig.ini"} << "COMMUNICATION_STATUS=\n";
    fs::copy_file("/bin/sleep", folder + "/openvpn", fs::copy_options::skip_existing);
    takeFakes();
}

RandomWorld::~RandomWorld() {
    stopClient();
    resetFakes();
    current = nullptr;
}

void RandomWorld::resetFakes() {
    FakeGateway::get().reset();
    FakeWeb::get().reset();
    FakeCommands::get().reset();
    VirtualClock::get().reset();
    FakeNet::get().reset();
    FakeFiles::get().reset();
    FakeProcess::get().reset();
    LogCapture::get().reset();
}

void RandomWorld::takeFakes() {
    resetFakes();
    auto& gateway = FakeGateway::get();
    gateway.table.assign(std::begin(kNeighbours), std::end(kNeighbours));
    gateway.onCall([this](const std::string& call) { prepareGateway(call); });
    auto& web = FakeWeb::get();
    web.onCall([&, this](const std::string& url) { web.answerOnce(url, answerTo(url)); });
    auto& shell = FakeCommands::get();
    shell.onCall([&, this](const std::string& line) { shell.answerOnce(line, run(line)); });
    VirtualClock::get().onPause([this](long seconds) { turn(seconds); });
    auto& net = FakeNet::get();
    net.onLookup = [&, this](const std::string& name) {
        event();
        net.names[name] = {published.empty() ? kRelay : published};
        if (has(WRONG_NAMES)) net.names[name] = {"44.128.77.77"};
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
}

void RandomWorld::takeLine(int /*priority*/, const char* text) {
    static const bool shown = std::getenv("WORLD_LOG") != nullptr;
    if (shown) static_cast<void>(!write(STDERR_FILENO, text, std::strlen(text)));
    for (const char* secret : {kDeviceId, kDeviceAuth, kSubdomain}) {
        if (std::strstr(text, secret) != nullptr) fault(text);
    }
    if (std::strncmp(text, "sigTrap - sigConnKilled", 23) == 0) current->settle();
    current->event();
}

void RandomWorld::fault(const char* what) {
    static_cast<void>(!write(STDERR_FILENO, what, std::strlen(what)));
    std::abort();
}

bool RandomWorld::has(unsigned trouble) const {
    unsigned lasting = 0;
    if (kind == Kind::RELAYED || kind == Kind::FAILING) lasting |= NO_GATEWAY;
    if (kind == Kind::FAILING) lasting |= NO_TUNNEL;
    if (!settled) lasting |= climate.steadyGateway ? weather & ~NO_GATEWAY : weather;
    return (lasting & trouble) != 0;
}

bool RandomWorld::isOdd() {
    const bool odd = !settled && stream.chance(climate.noise);
    oddities += odd ? 1 : 0;
    return odd;
}

// clang-format off
std::string RandomWorld::oddText() {
    static const Texts texts{"", "0.0.0.0", "44.128.0.21", "44.128.0.20\r\n", "::1", "%s%n%d", "-1", "9092", "TCP",
        "99999999999999999999", "http://127.0.0.1:80/", "standby", "Completed", "\n\n", kDeviceId, kDeviceAuth,
        "<action>wait</action><wait_time>300</wait_time>", "<action>wait</action><wait_time>2147483647</wait_time>",
        "Success<remote_external_ip>", "</external_ip></resp_device_id>"};
    const auto known = static_cast<unsigned>(texts.size());
    const unsigned pick = stream.below(2 * known);
    if (pick < known) return texts[pick];
    std::string text(stream.below(40), '\0');
    for (char& letter : text) letter = static_cast<char>(stream.below(256));
    while (pick == known && !text.empty() && text.size() < 20'000) text += text;
    return text;
}

// clang-format on

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
    weather = stream.below(2) == 0 ? 0 : stream.below(512) & stream.below(512);
    wan = "44.128.0." + std::to_string(20 + stream.below(2));
    auto& net = FakeNet::get();
    net.hostname = stream.below(8) == 1 ? oddText() : "nas";
    const unsigned broken = climate.steadyGateway ? 0 : stream.below(16);
    net.interfacesFail = broken == 1;  // then no gateway counts as another host
    net.interfaces.resize(1);
    if (!has(NO_INTERFACE)) net.interfaces.push_back({"eth0", kDeviceAddress});
    // Mappings of another address are not this device's: those of before stay.
    if (broken == 2) net.interfaces.push_back({"eth1", "fe80::77"});
    std::ofstream{folder + "/minutes"} << (stream.below(4) == 1 ? oddText() : "0\n");
    if (stream.below(16) == 1)
        VirtualClock::get().advance((365L * 86400) * (stream.below(2) * 2L - 1));
    if (!climate.oddSettings) return;
    // clang-format off
    static const Texts lines{"", "MANUAL_PORT_FORWARD=TRUE", "MANUAL_PORT_FORWARD=FALSE", "DEFAULT_PORTS_ONLY=TRUE",
        "INTERNAL_HTTP_PORT=99999999999", "INTERNAL_HTTP_PORT=", "MANUAL_EXTERNAL_HTTP_PORT=70000", "DEVICEAUTH=",
        "SUBDOMAIN=", "COMMUNICATION_STATUS=connecting", "SERVER_BASE_URL=x", "REMOTE_TESTPORTURL=%s%s%s%s%s%s%n"};
    // clang-format on
    const unsigned pick = stream.below(static_cast<unsigned>(2 * lines.size()));
    otherLines = pick < lines.size() ? lines[pick] : oddText();
    writeSettings("");
}

void RandomWorld::move(Kind newKind) {
    ++oddities;
    kind = newKind;
    FakeGateway::get().table.assign(std::begin(kNeighbours), std::end(kNeighbours));
    otherLines = kind == Kind::BY_HAND ? "MANUAL_PORT_FORWARD=TRUE" : "MANUAL_PORT_FORWARD=FALSE";
    writeSettings("");
}

// As the local web back end does; the new time makes the daemon read it.
void RandomWorld::writeSettings(const std::string& status) const {
    static time_t changes = 0;
    const std::string copy = folder + "/copy.ini";
    if (!fs::exists(copy)) return;
    std::ofstream{copy} << (status.empty() ? "" : "COMMUNICATION_STATUS=" + status + "\n")
                        << otherLines << "\n";
    const timespec times[]{{++changes, 0}, {changes, 0}};
    utimensat(AT_FDCWD, copy.c_str(), times, 0);
}

void RandomWorld::prepareGateway(const std::string& call) {
    event();
    ++requests;
    auto& gateway = FakeGateway::get();
    gateway.upnp = kind != Kind::NATPMP && !has(NO_GATEWAY);
    gateway.natpmp = kind == Kind::NATPMP && !has(NO_GATEWAY);
    gateway.externalIp = wan;
    gateway.externalIpStatus = 0;
    gateway.igdState = gateway.copies = 1;
    gateway.silent = gateway.refuseAll = false;
    gateway.answerDelay = 0;
    gateway.lie.reset();
    gateway.granted = {};
    gateway.failing.clear();
    if (call == "discover 2000 ms") gateway.devices = FakeGateway{}.devices;
    if (!climate.steadyGateway && isOdd()) makeGatewayOdd(call);
}

void RandomWorld::makeGatewayOdd(const std::string& call) {
    auto& gateway = FakeGateway::get();
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
            if (call == "discover 2000 ms") gateway.devices.assign(number % 12, {text(), gateway.devices[0].second});
    }  // clang-format on
}

WebAnswer RandomWorld::answerTo(const std::string& url) {
    event();
    ++requests;
    const auto asks = [&](const char* part) { return holds(url, part); };
    const bool local = asks("127.0.0.1");
    const bool odd = isOdd();
    if (has(local ? NO_BACK_END : NO_SERVER)) return FakeWeb::noAnswer();
    if (asks("/record?")) {
        const std::string address = url.substr(url.find('&') + 1);
        published = address.substr(0, address.find('&'));
        if (published == "NULL") published.clear();
        const int port = portIn(url);
        if (!published.empty() && reached.count(port) == 0)
            fault("an unproven port is published\n");
    }
    if (odd) {
        // clang-format off
        static constexpr CURLcode codes[]{CURLE_OK, CURLE_COULDNT_RESOLVE_HOST, CURLE_OPERATION_TIMEDOUT, CURLE_OK,
            CURLE_SSL_CONNECT_ERROR, CURLE_PEER_FAILED_VERIFICATION, CURLE_RECV_ERROR, CURLE_PARTIAL_FILE};
        // clang-format on
        if (stream.below(4) == 1) VirtualClock::get().advance(30);
        std::string text = oddText();
        if (asks("/test?") && holds(text, "Success")) reached.insert(portIn(url));
        return {text, codes[stream.below(8)]};
    }
    if (asks("/status?")) writeSettings(url.substr(url.find('?') + 1));
    if (asks("/remote_access_status/")) return "<action>proceed</action>";
    if (asks("/myip")) return {wan};
    if (asks("/test?")) return testPort(portIn(url));
    return local ? "success" : "Success";
}

WebAnswer RandomWorld::testPort(int port) {
    const auto& table = FakeGateway::get().table;
    const bool leadsHere = kind == Kind::BY_HAND || kind == Kind::MAKERS_ROUTER ||
                           std::any_of(table.begin(), table.end(), [&](const auto& held) {
                               return held.externalPort == port && held.client == kDeviceAddress;
                           });
    const std::string seen = has(OTHER_NAT) ? "44.128.9.9" : wan;
    const std::string answer = "<external_ip>" + wan + "</external_ip><remote_external_ip>" + seen +
                               "</remote_external_ip>";
    if (!leadsHere || has(PORT_CLOSED | OTHER_NAT)) return answer;
    reached.insert(port);
    return "Success" + answer +
           "<req_device_id>a</req_device_id><resp_device_id>a</resp_device_id>";
}

CommandAnswer RandomWorld::run(const std::string& command) {
    event();
    const auto runs = [&](const char* part) { return holds(command, part); };
    CommandAnswer answer;
    const bool ofGateway = runs("helper.sh") || runs("getip.sh");
    if (shellFails || (!(ofGateway && climate.steadyGateway) && isOdd())) {
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
    if (runs("hdparm")) answer.output = has(DISK_ASLEEP) ? "standby\n" : "active/idle\n";
    if (runs("getip.sh wan")) answer.output = has(NO_INTERFACE) ? "" : wan;
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
    std::string program = folder + "/openvpn", seconds = "600";
    char* const arguments[]{program.data(), seconds.data(), nullptr};
    static pid_t kept = 0;
    posix_spawn_file_actions_t streams;
    posix_spawn_file_actions_init(&streams);
    posix_spawn_file_actions_addclosefrom_np(&streams, 0);
    const bool isOld = climate.quick && kept != 0;
    if (isOld) client = kept;
    const bool starts =
        isOld || posix_spawn(&client, program.c_str(), &streams, nullptr, arguments, nullptr) == 0;
    posix_spawn_file_actions_destroy(&streams);
    if (!starts) return;
    kept = client;
    std::ofstream{folder + "/client.out"} << "Peer Connection Initiated with [AF_INET]" << kRelay
                                          << ":1194\n"
                                          << (has(NO_TUNNEL) ? "" : "Completed\n");
    std::ofstream pidFile{folder + "/client.pid"};
    // Like the real one, it does not run without.
    if (!(pidFile << client << std::endl)) stopClient();
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
        if (std::find(table.begin(), table.end(), held) == table.end())
            left += " a neighbour's gone";
    }
    for (const auto& entry : helperList) left += " " + entry;
    if (!published.empty()) left += " record of " + published;
    if (isRunning(client)) left += " client";
    if (fs::exists(folder + "/client.pid")) left += " client.pid";
    struct stat status {};
    const std::string credentials = folder + "/auth.txt";
    if (stat(credentials.c_str(), &status) == 0 && (status.st_mode & 077U) != 0)
        left += " open auth.txt";
    return left;
}

}  // namespace pelorus::support
