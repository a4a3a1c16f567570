// A world that a stream of bytes decides: what gateways, servers, scripts, names, interfaces and
// clocks answer. Most answers are good, so that a run gets far; some are odd, and the weather
// changes. One at a time.
#ifndef PELORUS_SUPPORT_RANDOM_WORLD_H
#define PELORUS_SUPPORT_RANDOM_WORLD_H

#include <atomic>
#include <random>

#include "support/fake_commands.h"
#include "support/fake_gateway.h"
#include "support/fake_web.h"

namespace pelorus::support {

/// Decisions from bytes. When these have ended, every decision is 0: all is well.
class Stream {
public:
    explicit Stream(std::vector<std::uint8_t> input) : bytes{std::move(input)} {}
    /// Never ends.
    explicit Stream(std::uint64_t seed) : generator{std::mt19937_64{seed}} {}
    /// 0 to @p count - 1.
    unsigned below(unsigned count) {
        return (count < 257 ? byte() : byte() << 8U | byte()) % count;
    }
    bool chance(unsigned perMille) { return below(1000) >= 1000 - perMille; }

private:
    unsigned byte();

    std::vector<std::uint8_t> bytes;
    std::size_t next = 0;
    std::optional<std::mt19937_64> generator;
};

/// How the device is reached; FAILING: not at all.
enum class Kind : unsigned { UPNP, NATPMP, BY_HAND, MAKERS_ROUTER, RELAYED, FAILING };
inline constexpr unsigned kKinds = 6;

/// What goes wrong for a while; bits of the weather.
enum Trouble : unsigned { SERVER, BACK_END, DISK, INTERFACE, NAMES, PORT, NAT, TUNNEL, GATEWAY };

struct Climate {
    unsigned noise = 0;        ///< odd answers, per mille
    unsigned changes = 0;      ///< changes of the weather, per mille of the cycles
    bool oddSettings = false;  ///< other programs write strange ones
    bool quick = false;        ///< the device moves, and one process stands for all relay clients
    /// The gateway is odd, too, no signal settles the world, and no thread watches a bounded call.
    bool fierce = false;
};

class RandomWorld {
public:
    /// Takes over all fakes. static.ini is written to @p where, an existing folder.
    RandomWorld(Stream decisions, Kind reachedBy, Climate typical, std::string where);
    ~RandomWorld();
    RandomWorld(const RandomWorld&) = delete;
    RandomWorld& operator=(const RandomWorld&) = delete;

    /// From now on all is well. A termination signal does it, too.
    void settle() { settled = true; }
    /// What a shutdown should have removed; empty when there is nothing.
    [[nodiscard]] std::string leftOver() const;

    Stream stream;
    Climate climate;
    bool shellFails = false;                                ///< no command can be run
    unsigned weather = 0;                                   ///< a set of troubles
    long events = 0, cycles = 0, requests = 0, opened = 0;  ///< opened: files, for writing
    long oddities = 0;                                      ///< odd answers and changes so far
    pid_t client = 0;                                       ///< of the relay, while it runs
    std::string published;                                  ///< the record's address
    /// Each call that reaches a fake and each log line. Runs in signal handlers, too.
    std::function<void()> atEvent = [] {};
    std::function<void()> atCycleEnd = [] {};                          ///< as its pause begins
    std::function<int(bool writing)> atOpen = [](bool) { return 0; };  ///< the errno of a failure

private:
    static void takeLine(int priority, const char* text);
    void takeFakes();
    void writeStaticSettings() const;
    void writeSettings(const std::string& status) const;
    [[nodiscard]] bool has(Trouble trouble) const;
    bool isOdd();
    std::string oddText();
    void event();
    void turn(long seconds);
    void changeWeather();
    void prepareGateway(const std::string& call);
    WebAnswer answerTo(const std::string& url);
    [[nodiscard]] bool leadsHere(int port) const;
    CommandAnswer run(const std::string& command);
    void startClient();
    void stopClient();

    Kind kind;
    std::string folder, wan = "44.128.0.20";
    std::atomic<bool> settled{false};
    std::string otherLines;  // settings that other programs wrote
    bool ownSecrets = true;  // they left the secrets alone
    std::set<int> reached;   // ports that passed a test
    bool obeys = true;       // no signal to the client was lost
    Texts helperList;        // of the maker's router
};

}  // namespace pelorus::support

#endif
