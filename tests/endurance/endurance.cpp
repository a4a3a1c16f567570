// endurance MODE RUNS SEED: the daemon in random worlds.
//   signals  RUNS processes, each ended by a termination signal at a random moment
//   faults   RUNS faults of the device and of the service, three to a process
//   years    one process for RUNS device days
// Prints its figures, and the seed of each run that went wrong; exit status 1 then.
#include <fcntl.h>
#include <malloc.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <clocale>
#include <cstring>
#include <filesystem>
#include <fstream>

#include "common/termination.h"
#include "config/global_config.h"
#include "daemon/daemon_control.h"
#include "daemon/signals.h"
#include "daemon/startup.h"
#include "support/fake_files.h"
#include "support/fixture.h"
#include "support/random_world.h"

extern "C" std::size_t __sanitizer_get_current_allocated_bytes();

namespace pelorus {
namespace {

namespace fs = std::filesystem;
using namespace support;  // NOLINT(google-build-using-namespace)
using Seed = std::uint64_t;

constexpr int kSignals[]{SIGTERM, SIGINT, SIGQUIT};
constexpr unsigned kDeadline = 60;  // seconds
constexpr int kWorkers = 2;
constexpr int kFaultsPerRun = 3;
constexpr long kNever = std::numeric_limits<long>::max();

// What a run tells the process that plays it, in memory that both share.
struct Report {
    std::atomic<pid_t> daemon;
    std::atomic<int> signal;     // that has to end it; 0: it exits
    std::atomic<bool> mayExit;   // the files cannot be opened at the start
    std::atomic<bool> isSecond;  // a second signal ends it at once
    std::atomic<long> events, lastEvent;
    char left[400];  // by the shutdown
};
struct Sums {
    std::atomic<long> runs, wrong, events, cycles, seconds, fromOutside;
};
Report* report = nullptr;
Sums* sums = nullptr;

template <typename T>
T* shared() {
    constexpr int kAccess = PROT_READ | PROT_WRITE;
    return new (mmap(nullptr, sizeof(T), kAccess, MAP_SHARED | MAP_ANONYMOUS, -1, 0)) T{};
}

// The daemon from its start, in a process of its own; @p world sends the signal.
[[noreturn]] void runDaemon(RandomWorld& world, const std::string& folder) {
    setenv("TAVIK_STATIC_CONFIG", (folder + "/static.ini").c_str(), 1);
    FakeProcess::get().killForReal = true;
    FakeProcess::get().onSelfKill = [&world] {
        const std::string left = world.leftOver();
        left.copy(report->left, sizeof report->left - 1);
        sums->cycles += world.cycles;
    };
    char name[] = "pelorus";
    char* arguments[]{name, nullptr};
    runPelorus(1, arguments);
}

void note(const RandomWorld& world) {
    static pid_t known = 0;
    const pid_t self = getpid();
    if (std::exchange(known, self) != self) alarm(kDeadline);  // not inherited
    report->daemon = self;
    report->events = world.events;
}

[[noreturn]] void playSignals(Seed seed, const std::string& folder) {
    Stream dice{seed};
    const auto kind = static_cast<Kind>(dice.below(kKinds));
    const long moment = dice.below(2) == 0 ? kNever : 1 + dice.below(1U << dice.below(14));
    const int first = kSignals[dice.below(3)];
    const int second = dice.below(4) == 0 ? first : kSignals[dice.below(3)];
    long left = dice.below(4) == 0 ? 1 + dice.below(60) : kNever;  // events to the second one
    report->signal = first;
    RandomWorld world{Stream{seed + 1}, kind, {dice.below(3) * 20, 100}, folder};
    world.atEvent = [&, isSent = false]() mutable {
        note(world);
        if (world.events >= moment && !std::exchange(isSent, true)) raise(first);
        if (left == kNever || !terminationRequested() || --left != 0) return;
        report->isSecond = second == first;
        report->signal = second;
        report->lastEvent = world.events;
        raise(second);
    };
    runDaemon(world, folder);
}

// What a process holds now, bytes and numbers.
struct Held {
#ifdef __SANITIZE_ADDRESS__
    std::size_t heap = __sanitizer_get_current_allocated_bytes();
#else
    std::size_t heap = mallinfo2().uordblks;
#endif
    std::size_t space = 0, resident = 0;
    long descriptors = std::distance(fs::directory_iterator{"/proc/self/fd"}, {});
    Held() {
        std::ifstream{"/proc/self/statm"} >> space >> resident;
        space *= 4096;
        resident *= 4096;
    }
};

// One fault, from now on or until it ends.
void setFault(unsigned fault, bool on, RandomWorld& world) {
    const auto limit = [on](__rlimit_resource resource, rlim_t value) {
        rlimit limits{};
        getrlimit(resource, &limits);
        limits.rlim_cur = on ? std::min(value, limits.rlim_max) : limits.rlim_max;
        setrlimit(resource, &limits);
    };
    auto& net = FakeNet::get();
    static const auto usual = net.interfaces;
    const int error = fault == 0 ? ENOSPC : fault == 1 ? EROFS : EMFILE;
    constexpr long kYear = 365L * 86400;
    switch (fault) {  // clang-format off
        case 0: case 1: case 2:
            world.atOpen = [=](bool writing) { return on && (writing || fault == 2) ? error : 0; };
            return;
        case 3: return limit(RLIMIT_FSIZE, 0);
        case 4: return limit(RLIMIT_NOFILE, 6);
#ifndef __SANITIZE_ADDRESS__
        case 5: return limit(RLIMIT_AS, Held{}.space + (2UL << 20U));  // too little for a thread
#endif
        case 6: world.shellFails = on; return;
        case 7: net.interfaces.resize(1); if (!on) net.interfaces = usual; return;
        case 8: net.hostname = on ? "another" : "nas"; return;
        case 9: net.interfacesFail = on; return;
        case 10: VirtualClock::get().advance(on ? kYear : -kYear); return;
        case 11: VirtualClock::get().advance(on ? -kYear : kYear); return;
        case 12: world.climate.noise = on ? 400 : 0; return;
        default: world.weather = on ? 1U << (fault % 8) : 0;
    }  // clang-format on
}

// Those of the start. True when the daemon cannot start.
bool setStartFault(unsigned fault) {
    static const char* const calls[]{"fork", "setsid", "chdir"};
    if (fault < 3) FakeProcess::get().failing.insert(calls[fault]);
    if (fault == 3)
        for (const int stream : {0, 1, 2}) close(stream);
    if (fault == 4) std::signal(SIGCHLD, SIG_IGN);
    if (fault == 5) std::setlocale(LC_ALL, "C.UTF-8");
    return fault < 3;
}

[[noreturn]] void playFaults(Seed seed, const std::string& folder) {
    constexpr unsigned kLater = 21, kAtStart = 6, kMostCycles = 12;
    Stream dice{seed};
    const auto kind = static_cast<Kind>(dice.below(kKinds));
    RandomWorld world{Stream{seed + 1}, kind, {}, folder};
    std::signal(SIGXFSZ, SIG_IGN);  // a full disk sends no signal
    report->signal = SIGTERM;
    std::multimap<long, std::pair<unsigned, bool>> plan;
    for (int count = 0; count < kFaultsPerRun; ++count) {
        const unsigned fault = dice.below(kLater + kAtStart);
        if (fault >= kLater) {
            if (setStartFault(fault - kLater)) report->signal = 0;
            continue;
        }
        const long from = dice.below(kMostCycles - 1);
        plan.insert({from, {fault, true}});
        if (from == 0 && fault < 6) report->mayExit = true;
        plan.insert(
            {from + 1 + dice.below(static_cast<unsigned>(kMostCycles - from)), {fault, false}});
    }
    const auto turn = [&] {
        const auto now = plan.equal_range(world.cycles);
        for (auto step = now.first; step != now.second; ++step)
            setFault(step->second.first, step->second.second, world);
        if (world.cycles <= kMostCycles + 1) return;
        world.settle();
        raise(SIGTERM);
    };
    world.atCycleEnd = turn;
    world.atEvent = [&] { note(world); };
    turn();
    runDaemon(world, folder);
}

bool isOfWorld(const std::string& name) {
    return name == "static.ini" || name == "minutes";
}

// What went wrong in a run; empty when nothing did.
std::string judge(int status, const std::string& folder) {
    const int wanted = report->signal;
    const bool failed = WIFEXITED(status) && WEXITSTATUS(status) == 1;
    if (wanted == 0) return failed ? "" : "starts nevertheless";
    if (failed && report->mayExit) return "";
    if (!WIFSIGNALED(status) || WTERMSIG(status) != wanted)
        return "ends with status " + std::to_string(status);
    if (report->isSecond)
        return report->events == report->lastEvent ? "" : "goes on after a second signal";
    if (report->left[0] != '\0') return std::string{"leaves"} + report->left;
    for (const auto& file : fs::directory_iterator{folder}) {
        std::ifstream content{file.path(), std::ios::binary};
        const std::string text{std::istreambuf_iterator<char>{content}, {}};
        const auto mode =
            file.status().permissions() & (fs::perms::group_all | fs::perms::others_all);
        if (isOfWorld(file.path().filename()) || !holds(text, kDeviceAuth)) continue;
        if (mode != fs::perms::none || file.path().filename() == "output")
            return "shows a secret in " + file.path().string();
    }
    return "";
}

using Player = void (*)(Seed, const std::string&);

// Starts one run, sends it signals from outside when it does not do that itself, and judges it.
std::string watch(Player play, Seed seed, const std::string& folder) {
    new (report) Report{};
    const pid_t starter = fork();
    if (starter == 0) {
        const int output = open((folder + "/output").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        dup2(output, STDOUT_FILENO);
        dup2(output, STDERR_FILENO);
        close(output);
        play(seed, folder);
    }
    Stream dice{seed};
    Stream moments{seed + 2};
    bool outside = play == playSignals && (dice.below(kKinds), dice.below(2) == 0);
    int status = 0;
    waitpid(starter, &status, 0);
    // The daemon is nobody's child then but this one's.
    while (waitpid(-1, &status, WNOHANG) == 0) {
        const pid_t daemon = report->daemon;
        if (outside && daemon != 0 && daemon != starter) {
            usleep(moments.below(1U << moments.below(16)));
            kill(daemon, report->signal);
            ++sums->fromOutside;
            outside = false;
        }
        usleep(outside ? 10 : 300);
    }
    // A client that is left is in the daemon's session.
    if (report->daemon > 0) kill(-report->daemon, SIGKILL);
    while (waitpid(-1, nullptr, 0) > 0) continue;
    sums->events += report->events;
    return judge(status, folder);
}

void work(Player play, long runs, Seed seed, int worker, const std::string& folder) {
    prctl(PR_SET_CHILD_SUBREAPER, 1);
    report = shared<Report>();
    fs::create_directory(folder);
    for (long run = worker; run < runs; run += kWorkers) {
        const Seed own = seed + static_cast<Seed>(run) * 10;
        const std::string wrong = watch(play, own, folder);
        ++sums->runs;
        if (wrong.empty()) continue;
        ++sums->wrong;
        std::printf("seed %ju: %s\n", static_cast<std::uintmax_t>(own), wrong.c_str());
        std::fflush(stdout);
    }
}

int playYears(long days, Seed seed, const std::string& folder) {
    constexpr long kDay = 86400, kMonth = 30 * kDay, kQuietCycles = 16;
    RandomWorld world{Stream{seed}, Kind::UPNP, {2, 20, false, false, true}, folder};
    const auto& clock = VirtualClock::get();
    long moved = 0, quiet = 0, opened = 0, odd = 0, disturbed = 0, device = 0,
         lastNow = clock.now();
    std::optional<Held> atFirst;
    world.atCycleEnd = [&] {
        // A jump of the clock is not time that has passed.
        const long passed = clock.now() - lastNow;
        device += passed > 0 && passed < kMonth ? passed : 0;
        lastNow = clock.now();
        quiet = world.oddities == odd && world.weather == 0 ? quiet + 1 : 0;
        odd = world.oddities;
        disturbed += quiet > kQuietCycles && world.opened != opened ? 1 : 0;
        sums->runs += quiet > kQuietCycles ? 1 : 0;
        opened = world.opened;
        if (device > days * kDay / 3 && !atFirst) atFirst.emplace();
        if (device / kMonth > moved) {
            moved = device / kMonth;
            static constexpr Kind kinds[]{Kind::UPNP, Kind::NATPMP, Kind::BY_HAND, Kind::RELAYED};
            world.move(kinds[world.stream.below(4)]);
        }
        if (device < days * kDay) return;
        world.settle();
        raise(SIGTERM);
    };
    const bool starts =
        GlobalConfig::getInstance()->loadConfig(folder + "/static.ini") && installSignalHandlers();
    DaemonControl::getInstance()->enableRemoteAccess();
    DaemonControl::getInstance()->setSleepTime(30);
    if (starts) DaemonControl::getInstance()->run();
    const Held atEnd;
    const std::string left = world.leftOver();
    std::printf(
        "%ld device days, %ld cycles, %.1f requests an hour; %ld quiet cycles, %ld of them opened a file for writing\n"
        "heap %zu -> %zu bytes, resident %zu -> %zu bytes, descriptors %ld -> %ld; left by the shutdown:%s\n",
        device / kDay, world.cycles,
        static_cast<double>(world.requests) * 3600 / static_cast<double>(device), sums->runs.load(),
        disturbed, atFirst->heap, atEnd.heap, atFirst->resident, atEnd.resident,
        atFirst->descriptors, atEnd.descriptors, left.c_str());
    if (world.client > 0) kill(world.client, SIGKILL);
    const bool flat =
        atEnd.heap < atFirst->heap + 65536 && atEnd.descriptors <= atFirst->descriptors;
    return starts && flat && disturbed == 0 ? 0 : 1;
}

int play(const std::string& mode, long count, Seed seed, const std::string& folder) {
    const bool signals = mode == "signals";
    const long runs = signals ? count : (count + kFaultsPerRun - 1) / kFaultsPerRun;
    const Player player = signals ? playSignals : playFaults;
    for (int worker = 0; worker < kWorkers; ++worker) {
        if (fork() != 0) continue;
        work(player, runs, seed, worker, folder + "/" + std::to_string(worker));
        std::_Exit(0);
    }
    int status = 0;
    while (wait(&status) > 0) continue;
    std::printf(
        "%ld runs%s, %ld of them from outside, %ld cycles, %ld calls and lines: %ld wrong\n",
        sums->runs.load(), signals ? "" : (" with " + std::to_string(count) + " faults").c_str(),
        sums->fromOutside.load(), sums->cycles.load(), sums->events.load(), sums->wrong.load());
    return sums->runs == runs && sums->wrong == 0 ? 0 : 1;
}

}  // namespace
}  // namespace pelorus

int main(int argc, char** argv) {
    if (argc != 4) return 2;
    GTEST_FLAG_SET(break_on_failure, true);  // the fakes' own checks end a run
    std::string folder =
        (std::filesystem::temp_directory_path() / "pelorus-endurance-XXXXXX").string();
    if (mkdtemp(folder.data()) == nullptr) return 2;
    pelorus::sums = pelorus::shared<pelorus::Sums>();
    const long count = std::strtol(argv[2], nullptr, 10);
    const pelorus::Seed seed = std::strtoull(argv[3], nullptr, 10);
    const std::string mode = argv[1];
    const int status = mode == "years" ? pelorus::playYears(count, seed, folder)
                                       : pelorus::play(mode, count, seed, folder);
    if (std::getenv("WORLD_LOG") == nullptr) std::filesystem::remove_all(folder);
    return status;
}
