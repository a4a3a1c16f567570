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

// NOLINTBEGIN(bugprone-reserved-identifier)
extern "C" {
std::size_t __sanitizer_get_current_allocated_bytes();
const char* __asan_default_options();
const char* __ubsan_default_options();
// A finding must not look like the daemon's exit status 1.
const char* __asan_default_options() {
    return "abort_on_error=1";
}
const char* __ubsan_default_options() {
    return "halt_on_error=1:abort_on_error=1";
}
}
// NOLINTEND(bugprone-reserved-identifier)

namespace pelorus {
namespace {

namespace fs = std::filesystem;
using namespace support;  // NOLINT(google-build-using-namespace)
using Seed = std::uint64_t;

constexpr int kSignals[]{SIGTERM, SIGINT, SIGQUIT};
constexpr unsigned kDeadline = 60;  // seconds
constexpr int kWorkers = 2;
constexpr int kFaultsPerRun = 3;
constexpr unsigned kSignalCycles = 4;  // in one of them the signal comes
constexpr long kNever = std::numeric_limits<long>::max();

// What a run tells the process that plays it, in memory that both share.
struct Report {
    std::atomic<pid_t> daemon;
    std::atomic<int> signal;      // that has to end it
    std::atomic<bool> mayExit;    // cannot start
    std::atomic<bool> isSettled;  // all is well from the signal on
    std::atomic<bool> isSecond;   // a second signal ends it at once
    std::atomic<long> events, lastEvent, cycles;
    std::atomic<unsigned> kind, reached;  // when the signal came
    char left[400];                       // by the shutdown
};
enum Reached : unsigned { NOT_YET, DIRECTLY, THROUGH_RELAY, kReached };
struct Sums {
    std::atomic<long> runs, wrong, events, cycles, fromOutside, faults;
    std::atomic<long> signals[kKinds][kReached];
};
Report* report = nullptr;
Sums* sums = nullptr;

template <typename T>
T* shared() {
    constexpr int kAccess = PROT_READ | PROT_WRITE;
    return new (mmap(nullptr, sizeof(T), kAccess, MAP_SHARED | MAP_ANONYMOUS, -1, 0)) T{};
}

// What a process holds now, bytes and numbers.
struct Held {
#ifdef __SANITIZE_ADDRESS__
    std::size_t heap = __sanitizer_get_current_allocated_bytes();
#else
    std::size_t heap = mallinfo2().uordblks;
#endif
    std::size_t space = 0, resident = 0;  // pages
    long descriptors = std::distance(fs::directory_iterator{"/proc/self/fd"}, {});
    Held() {
        std::ifstream{"/proc/self/statm"} >> space >> resident;
    }
};

constexpr unsigned kFaults = 27, kFirstAtStart = 21;

// One fault, from now on or until it ends; from kFirstAtStart on it is one of the start.
void setFault(unsigned fault, bool on, RandomWorld& world) {
    const auto limit = [on](__rlimit_resource resource, rlim_t value) {
        rlimit limits{};
        getrlimit(resource, &limits);
        limits.rlim_cur = on ? std::min(value, limits.rlim_max) : limits.rlim_max;
        setrlimit(resource, &limits);
    };
    auto& net = FakeNet::get();
    static constexpr int kErrors[]{ENOSPC, EROFS, EMFILE};
    static const char* const kCalls[]{"fork", "setsid", "chdir"};
    constexpr long kYear = 365L * 86400;
    if (fault >= kFirstAtStart && !on) return;
    sums->faults += on ? 1 : 0;
    switch (fault) {  // clang-format off
        case 0: case 1: case 2:
            world.atOpen = [=](bool writing) { return on && (writing || fault == 2) ? kErrors[fault] : 0; };
            return;
        case 3: return limit(RLIMIT_FSIZE, 0);
        case 4: return limit(RLIMIT_NOFILE, 6);
#ifndef __SANITIZE_ADDRESS__
        case 5: return limit(RLIMIT_AS, Held{}.space * 4096 + (2UL << 20U));  // too little for a thread
#endif
        case 6: world.shellFails = on; return;
        case 7: net.interfaces = FakeNet{}.interfaces; if (on) net.interfaces.resize(1); return;
        case 8: net.hostname = on ? "another" : "nas"; return;
        case 9: net.interfacesFail = on; return;
        case 10: return VirtualClock::get().advance(on ? kYear : -kYear);
        case 11: return VirtualClock::get().advance(on ? -kYear : kYear);
        case 12: world.climate.noise = on ? 400 : 0; return;
        case 21: case 22: case 23: FakeProcess::get().failing.insert(kCalls[fault - 21]); return;
        case 24: for (const int stream : {0, 1, 2}) close(stream); return;
        case 25: std::signal(SIGCHLD, SIG_IGN); return;
        case 26: std::setlocale(LC_ALL, "C.UTF-8"); return;
        default: world.weather ^= 1U << (fault % 8);
    }  // clang-format on
}

// Draws the faults, and ends the daemon when they are over.
void planFaults(Stream& dice, RandomWorld& world) {
    constexpr unsigned kMostCycles = 12;
    std::signal(SIGXFSZ, SIG_IGN);  // a full disk sends no signal
    std::multimap<long, std::pair<unsigned, bool>> plan;
    // Where the daemon cannot detach, no other fault would be met.
    const bool cannotDetach = dice.below(10) == 0;
    for (int count = cannotDetach ? 1 : kFaultsPerRun; count > 0; --count) {
        unsigned fault = dice.below(kFaults - 3);
        if (fault >= kFirstAtStart) fault += 3;
        if (cannotDetach) fault = kFirstAtStart + dice.below(3);
        const unsigned from = fault < kFirstAtStart ? dice.below(kMostCycles - 1) : 0;
        plan.insert({from, {fault, true}});
        plan.insert({from + 1 + dice.below(kMostCycles - from), {fault, false}});
        if (cannotDetach || (from == 0 && fault < 6)) report->mayExit = true;
    }
    world.atCycleEnd = [&world, plan] {
        const auto now = plan.equal_range(world.cycles);
        for (auto step = now.first; step != now.second; ++step)
            setFault(step->second.first, step->second.second, world);
        if (world.cycles <= kMostCycles + 1) return;
        world.settle();
        raise(SIGTERM);
    };
    world.atCycleEnd();
}

Reached howReached(const RandomWorld& world) {
    if (world.client != 0) return THROUGH_RELAY;
    return world.published.empty() ? NOT_YET : DIRECTLY;
}

// The daemon from its start, in a process of its own.
[[noreturn]] void runDaemon(Seed seed, bool faulty, const std::string& folder) {
    Stream dice{seed};
    const auto kind = static_cast<Kind>(dice.below(kKinds));
    const bool isInside = dice.below(2) != 0 && !faulty;  // is the signal sent by itself?
    const long cycle = isInside ? dice.below(kSignalCycles) : kNever;
    long moment = 1 + dice.below(1U << dice.below(10));  // events of that cycle
    const int first = faulty ? SIGTERM : kSignals[dice.below(3)];
    const int second = dice.below(4) == 0 ? first : kSignals[dice.below(3)];
    long left = dice.below(4) == 0 && !faulty ? 1 + dice.below(60) : kNever;  // events to that
    report->signal = first;
    Climate climate{faulty ? 0 : dice.below(3) * 20, faulty ? 0U : 100U};
    climate.fierce = dice.below(4) == 0 && !faulty;
    report->isSettled = !climate.fierce;
    report->kind = static_cast<unsigned>(kind);
    RandomWorld world{Stream{seed + 1}, kind, climate, folder};
    if (faulty) planFaults(dice, world);
    world.atEvent = [&, self = 0, isSent = false]() mutable {
        if (std::exchange(self, getpid()) != getpid()) alarm(kDeadline);  // not inherited
        report->daemon = self;
        report->events = world.events;
        report->cycles = world.cycles;
        if (!terminationRequested()) report->reached = howReached(world);
        if (world.cycles >= cycle && --moment <= 0 && !std::exchange(isSent, true)) raise(first);
        if (left == kNever || !terminationRequested() || --left != 0) return;
        report->isSecond = second == first;
        report->signal = second;
        report->lastEvent = world.events;
        raise(second);
    };
    setenv("TAVIK_STATIC_CONFIG", (folder + "/static.ini").c_str(), 1);
    FakeProcess::get().killForReal = true;
    FakeProcess::get().onSelfKill = [&world] {
        world.leftOver().copy(report->left, sizeof report->left - 1);
        sums->cycles += world.cycles;
    };
    char name[] = "pelorus";
    char* arguments[]{name, nullptr};
    runPelorus(1, arguments);
}

std::string textOf(const std::string& file) {
    std::ifstream content{file, std::ios::binary};
    return {std::istreambuf_iterator<char>{content}, {}};
}

// What went wrong in a run; empty when nothing did.
std::string judge(int status, const std::string& folder) {
    const bool cannotStart =
        WIFEXITED(status) && WEXITSTATUS(status) == 1 && report->mayExit && report->cycles == 0;
    if (!cannotStart && (!WIFSIGNALED(status) || WTERMSIG(status) != report->signal))
        return "ends with status " + std::to_string(status) + " " + textOf(folder + "/output");
    if (report->isSecond)
        return report->events == report->lastEvent ? "" : "goes on after a second signal";
    // Where the trouble goes on, what should have been removed may stay.
    if (report->left[0] != '\0' && report->isSettled) return std::string{"leaves"} + report->left;
    for (const auto& file : fs::directory_iterator{folder}) {
        const std::string name = file.path().filename();
        const auto others = fs::perms::group_all | fs::perms::others_all;
        const bool isShown =
            (file.status().permissions() & others) != fs::perms::none || name == "output";
        if (name == "static.ini" || name == "minutes" || !isShown) continue;
        for (const char* secret : {kDeviceId, kDeviceAuth, kSubdomain})
            if (holds(textOf(file.path()), secret)) return "shows a secret in " + name;
    }
    return "";
}

// Starts one run, sends it signals from outside when it does not do that itself, and judges it.
std::string watch(Seed seed, bool faulty, const std::string& folder) {
    new (report) Report{};
    std::fflush(stdout);  // not by the child as well
    const pid_t starter = fork();
    if (starter == 0) {
        const int output = open((folder + "/output").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        for (const int stream : {STDOUT_FILENO, STDERR_FILENO}) dup2(output, stream);
        close(output);
        runDaemon(seed, faulty, folder);
    }
    Stream dice{seed}, moments{seed + 2};
    bool isOutside = (dice.below(kKinds), dice.below(2) == 0) && !faulty;
    const long cycle = moments.below(kSignalCycles);
    int status = 0;
    waitpid(starter, &status, 0);
    // The daemon is nobody's child then but this one's.
    while (waitpid(-1, &status, WNOHANG) == 0) {
        const pid_t daemon = report->daemon;
        if (isOutside && daemon != 0 && daemon != starter && report->cycles >= cycle) {
            usleep(moments.below(1U << moments.below(14)));
            kill(daemon, report->signal);
            ++sums->fromOutside;
            isOutside = false;
        }
        usleep(isOutside ? 10 : 300);
    }
    // A client that is left is in the daemon's session.
    if (report->daemon > 0) kill(-report->daemon, SIGKILL);
    while (waitpid(-1, nullptr, 0) > 0) continue;
    sums->events += report->events;
    if (!faulty) ++sums->signals[report->kind][report->reached];
    return judge(status, folder);
}

int playYears(long days, Seed seed, const std::string& folder) {
    constexpr long kDay = 86400, kMonth = 30 * kDay, kSettled = 16;  // cycles
    RandomWorld world{Stream{seed}, Kind::UPNP, {2, 20, false, true, true}, folder};
    const auto& clock = VirtualClock::get();
    long quiet = 0, opened = 0, odd = 0, checked = 0, wrong = 0, device = 0;
    long before = clock.now();
    std::optional<Held> first;
    world.atCycleEnd = [&] {
        const long passed = clock.now() - std::exchange(before, clock.now());
        device += passed > 0 && passed < kMonth ? passed : 0;  // or the clock has jumped
        // A record that could not be withdrawn is found by the daily check of the names.
        const bool isReached = (world.client != 0) != !world.published.empty();
        const bool isGood = world.weather == 0 && isReached;
        quiet = std::exchange(odd, world.oddities) == odd && isGood ? quiet + 1 : 0;
        const bool hasOpened = std::exchange(opened, world.opened) != opened;
        checked += quiet > kSettled ? 1 : 0;
        wrong += quiet > kSettled && hasOpened ? 1 : 0;
        if (device > days * kDay / 3 && !first) first.emplace();
        if (device < days * kDay) return;
        world.settle();
        raise(SIGTERM);
    };
    auto* const daemon = DaemonControl::getInstance();
    const bool starts =
        GlobalConfig::getInstance()->loadConfig(folder + "/static.ini") && installSignalHandlers();
    daemon->enableRemoteAccess();
    daemon->setSleepTime(30);
    if (starts) daemon->run();
    if (!starts || !first) return 1;
    const Held last;
    const std::string left = world.leftOver();
    std::printf(
        "%ld device days, %ld cycles, %.1f requests an hour; %ld quiet cycles, %ld of them opened a file for writing\n"
        "heap %zu -> %zu bytes, resident %zu -> %zu pages, descriptors %ld -> %ld; left by the shutdown:%s\n",
        device / kDay, world.cycles,
        static_cast<double>(world.requests) * 3600 / static_cast<double>(device), checked, wrong,
        first->heap, last.heap, first->resident, last.resident, first->descriptors,
        last.descriptors, left.c_str());
    const bool isFlat = last.heap < first->heap + 65536 && last.descriptors <= first->descriptors;
    return isFlat && left.empty() && checked > 0 && wrong == 0 ? 0 : 1;
}

// True if signals came before the connection of each kind and after it.
bool showSignals() {
    static constexpr const char* kNames[kKinds]{"UPnP",           "NAT-PMP", "by hand",
                                                "maker's router", "relayed", "failing"};
    bool isWhole = true;
    for (unsigned kind = 0; kind < kKinds; ++kind) {
        const auto& [none, direct, relayed] = sums->signals[kind];
        std::printf("%s: %ld not yet reached, %ld directly, %ld through the relay\n", kNames[kind],
                    none.load(), direct.load(), relayed.load());
        const bool isFailing = static_cast<Kind>(kind) == Kind::FAILING;
        isWhole = isWhole && none > 0 && (direct > 0 || relayed > 0 || isFailing);
    }
    std::printf("%ld signals from outside, in ", sums->fromOutside.load());
    return isWhole;
}

int playRuns(long runs, bool faulty, Seed seed, const std::string& folder) {
    for (int worker = 0; worker < kWorkers; ++worker) {
        if (fork() != 0) continue;
        prctl(PR_SET_CHILD_SUBREAPER, 1);
        report = shared<Report>();
        const std::string own = folder + "/" + std::to_string(worker);
        fs::create_directory(own);
        for (long run = worker; run < runs; run += kWorkers) {
            const Seed next = seed + static_cast<Seed>(run) * 10;
            const std::string wrong = watch(next, faulty, own);
            ++sums->runs;
            if (wrong.empty()) continue;
            ++sums->wrong;
            std::printf("seed %ju: %s\n", static_cast<std::uintmax_t>(next), wrong.c_str());
        }
        std::fflush(stdout);
        std::_Exit(0);
    }
    while (wait(nullptr) > 0) continue;
    bool isWhole = faulty;
    if (faulty) {
        std::printf("%ld faults in ", sums->faults.load());
    } else {
        isWhole = showSignals();
    }
    std::printf("%ld runs, %ld cycles, %ld calls and lines: %ld wrong\n", sums->runs.load(),
                sums->cycles.load(), sums->events.load(), sums->wrong.load());
    return isWhole && sums->runs == runs && sums->wrong == 0 ? 0 : 1;
}

}  // namespace
}  // namespace pelorus

int main(int argc, char** argv) {
    using namespace pelorus;                 // NOLINT(google-build-using-namespace)
    GTEST_FLAG_SET(break_on_failure, true);  // the fakes' own checks end a run
    std::string folder = (fs::temp_directory_path() / "pelorus-endurance-XXXXXX").string();
    if (argc != 4 || mkdtemp(folder.data()) == nullptr) return 2;
    // A shell ignores two of them in what it starts in the background.
    for (const int signal : kSignals) std::signal(signal, SIG_DFL);
    sums = shared<Sums>();
    const std::string mode = argv[1];
    const bool faulty = mode == "faults";
    const long count = std::strtol(argv[2], nullptr, 10);
    const long runs = faulty ? (count + kFaultsPerRun - 1) / kFaultsPerRun : count;
    const Seed seed = std::strtoull(argv[3], nullptr, 10);
    const int status =
        mode == "years" ? playYears(count, seed, folder) : playRuns(runs, faulty, seed, folder);
    if (std::getenv("WORLD_LOG") == nullptr) fs::remove_all(folder);
    return status;
}
