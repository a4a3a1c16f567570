// twelve_days: prints what the daemon logs in twelve days in which much goes wrong, as a device's
// syslog keeps it. The daemon is the real one, its world and its clock are the unit tests'. Without
// watcher threads.
#include <syslog.h>

#include <array>
#include <cstdlib>
#include <ctime>
#include <filesystem>

#include "daemon/startup.h"
#include "support/log_capture.h"
#include "support/random_world.h"
#include "support/virtual_clock.h"

namespace pelorus {
namespace {

using namespace support;  // NOLINT(google-build-using-namespace)

constexpr time_t kHour = 3600;
constexpr time_t kBegin = 1'793'606'400;  // 2 November 2026, 08:00 in UTC
constexpr time_t kDay = 24 * kHour, kLength = 12 * kDay;

// What is wrong from when on.
struct Spell {
    time_t from;  // seconds since the beginning
    unsigned weather;
};
constexpr unsigned bit(Trouble trouble) {
    return 1U << trouble;
}
constexpr std::array kSpells{
    Spell{0, 0},
    Spell{2 * kDay + 11 * kHour, bit(SERVER) | bit(TUNNEL)},  // the service is down
    Spell{2 * kDay + 20 * kHour, 0},
    Spell{4 * kDay + 6 * kHour, bit(NAT)},  // the provider's box is no bridge any more
    Spell{7 * kDay + 9 * kHour, 0},
    Spell{9 * kDay + 2 * kHour, bit(GATEWAY) | bit(PORT)},  // UPnP is off after an update
    Spell{11 * kDay + 12 * kHour, 0},
};

void (*countLine)(int, const char*) = nullptr;

void printLine(int priority, const char* text) {
    constexpr int kShown = LOG_INFO;
    countLine(priority, text);
    if (LOG_PRI(priority) > kShown) return;
    const time_t now = VirtualClock::get().now();
    std::array<char, 40> stamp{};
    tm parts{};
    static_cast<void>(std::strftime(stamp.data(), stamp.size(), "%Y-%m-%dT%H:%M:%S+00:00",
                                    gmtime_r(&now, &parts)));
    const std::string line{text};
    std::printf("%s nas Pelorus[812]: %s\n", stamp.data(),
                line.substr(0, line.find_last_not_of('\n') + 1).c_str());
}

// The daemon detaches, and ends with the log.
[[noreturn]] void play(const std::string& folder) {
    RandomWorld world{
        Stream{std::vector<std::uint8_t>{}}, Kind::UPNP, {0, 0, false, true, true}, folder};
    VirtualClock& clock = VirtualClock::get();
    clock.set(kBegin);
    countLine = std::exchange(LogCapture::get().sink, printLine);
    world.atCycleEnd = [&] {
        const time_t passed = clock.now() - kBegin;
        for (const Spell& spell : kSpells) {
            if (passed >= spell.from) world.weather = spell.weather;
        }
        if (passed < kLength) return;
        std::filesystem::remove_all(folder);
        std::exit(0);  // the log ends while the daemon runs
    };
    setenv("TAVIK_STATIC_CONFIG", (folder + "/static.ini").c_str(), 1);
    std::array<std::string, 3> words{"pelorus", "-l", "6"};
    std::array<char*, 4> arguments{words[0].data(), words[1].data(), words[2].data(), nullptr};
    runPelorus(words.size(), arguments.data());
}

}  // namespace
}  // namespace pelorus

int main() {
    std::string folder = std::filesystem::temp_directory_path() / "pelorus-days-XXXXXX";
    const bool isByLine = std::setvbuf(stdout, nullptr, _IOLBF, 0) == 0;  // nothing twice by a fork
    if (!isByLine || mkdtemp(folder.data()) == nullptr) return 2;
    pelorus::play(folder);
}
