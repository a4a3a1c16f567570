// The doctor's reader of logs: `doctor_log [OURS_IN_100]` writes a log of 200 MB into a temporary
// folder, reads it, and prints how long that took in milliseconds of CPU time, and the most memory
// that was resident, in KiB. OURS_IN_100 says how many of 100 lines are the daemon's (2).
#include <sys/resource.h>

#include <array>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <string>

#include "doctor/device_log.h"

namespace {

namespace fs = std::filesystem;
using pelorus::doctor::Evidence;
using pelorus::doctor::Time;

constexpr std::uintmax_t kSize = 200'000'000;
constexpr std::time_t kBegin = 1790000000;
constexpr int kMillisecondsPerSecond = 1000;

// A relayed cycle of the lab, shortened, and what others log in between.
constexpr std::array<const char*, 12> kOurs{
    "ConnectionManager::createConnection() - checking status & attempting direct connection. "
    "Current connection type 2.",
    "Router::upnp_discover - IGD found at: http://192.168.77.1:5001/ctl/IPConn, local host IP "
    "address: 192.168.77.10 ",
    "Router::upnp_discover - Router's external IP address: 44.128.1.20 ",
    "ConnectionManager::createDirectConnection - Current Status in file system: [relayed].",
    "Router::mapPort() - success - external port: 9091 has been mapped to internal port: 80  ",
    "TavikClient::pollServerForSleepTime - central server gave permission to proceed. Sleep time "
    "is 0 secs.",
    "TavikClient::testPort[1] - httpGet got <port_test><status>failure</status><remote_external_ip>"
    "44.128.0.21</remote_external_ip><external_ip>44.128.1.20</external_ip></port_test>, 210 bytes "
    "from central server.",
    "TavikClient::testPort - Enforce connection as RELAY (double-NAT detected: Server-returned "
    "external IP != router's external IP).",
    "Router::unmapPort() - success - external port: 9091 has been unmapped",
    "ConnectionManager::createRelayConnection() - openVPN process is running.",
    "ConnectionManager::createConnection() - connection type 2 un-changed. connTypeUnchangedCount "
    "1, forceDNSCheck=false",
    "DaemonControl::run - retry connection after 120 secs."};
constexpr std::array<const char*, 4> kOthers{
    "CRON[4711]: (root) CMD (test -x /usr/bin/updatedb && /usr/bin/updatedb --quiet)",
    "smbd[812]: [2026/11/22 02:40:00.123456,  0] ../../source3/smbd/server.c:1741(main)",
    "kernel: [123456.789012] EXT4-fs (sda1): mounted filesystem with ordered data mode. Opts: (null)",
    "systemd[1]: Started Session 4711 of user admin."};

void writeLog(const fs::path& path, int oursIn100) {
    std::ofstream file{path};
    std::uintmax_t written = 0;
    for (std::size_t line = 0; written < kSize; ++line) {
        const std::time_t when = kBegin + static_cast<std::time_t>(line);
        std::tm parts{};
        std::array<char, 32> stamp{};
        std::strftime(stamp.data(), stamp.size(), "%b %e %H:%M:%S nas ",
                      localtime_r(&when, &parts));
        const bool ours = line % 100 < static_cast<std::size_t>(oursIn100);
        const std::string text =
            std::string{stamp.data()} + (ours ? "Pelorus: " : "") +
            (ours ? kOurs.at(line % kOurs.size()) : kOthers.at(line % kOthers.size())) + "\n";
        file << text;
        written += text.size();
    }
}

}  // namespace

int main(int argc, char** argv) {
    std::string folder = fs::temp_directory_path() / "pelorus-bench-XXXXXX";
    if (mkdtemp(folder.data()) == nullptr) return EXIT_FAILURE;
    const std::string log = folder + "/log";
    writeLog(log, argc > 1 ? std::atoi(argv[1]) : 2);

    Evidence evidence;
    evidence.now = Time{std::chrono::seconds{std::time(nullptr)}};
    pelorus::doctor::LogChoice choice;
    choice.files = {log};
    const std::clock_t begin = std::clock();
    lookAtLog(choice, evidence);
    const std::clock_t end = std::clock();
    fs::remove_all(folder);

    struct rusage usage {};
    getrusage(RUSAGE_SELF, &usage);
    std::printf("%ld %ld\n", (end - begin) / (CLOCKS_PER_SEC / kMillisecondsPerSecond),
                usage.ru_maxrss);
    return evidence.hasLog ? EXIT_SUCCESS : EXIT_FAILURE;
}
