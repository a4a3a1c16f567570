// Twenty cycles of the whole daemon in a random world, or fewer when that sends a signal, and the
// shutdown. Built without access control: the singletons begin each run anew.
#include <filesystem>

#include "cloud/tavik_client.h"
#include "common/stop_budget.h"
#include "common/termination.h"
#include "connection/connection_manager.h"
#include "connection/network_addrs.h"
#include "daemon/daemon_control.h"
#include "daemon/signals.h"
#include "fuzz_world.h"
#include "support/random_world.h"

namespace pelorus::fuzz {

template <class Singleton>
void renew() {
    Singleton* const instance = Singleton::getInstance();
    instance->~Singleton();
    new (instance) Singleton;
}

static void renewAll(const std::string& folder) {
    renew<GlobalConfig>();
    assert(GlobalConfig::getInstance()->loadConfig(folder + "/static.ini"));
    renew<TavikClient>();
    TavikClient::getInstance()->initialize();
    renew<ConnectionManager>();
    renew<NetworkAddrs>();
    renew<DaemonControl>();
}

void tryText(const std::string& text) {
    static struct Folder {
        std::string path = std::filesystem::temp_directory_path() / "pelorus-cycle-XXXXXX";
        Folder() { assert(mkdtemp(path.data()) != nullptr); }
        ~Folder() { std::filesystem::remove_all(path); }
    } folder;
    GTEST_FLAG_SET(break_on_failure, true);
    support::Stream stream{std::vector<std::uint8_t>{text.begin(), text.end()}};
    const auto kind = static_cast<support::Kind>(stream.below(support::kKinds));
    const unsigned signalAt = stream.below(2) == 0 ? 0 : 1 + stream.below(4000);
    const unsigned noise = stream.below(256);
    support::RandomWorld world{
        std::move(stream), kind, {noise, 300, true, true, true}, folder.path};
    bool isRunning = false, isSent = false;
    world.atEvent = [&] {
        const bool isTime = (signalAt != 0 && world.events >= signalAt) || world.cycles >= 20;
        if (!isTime || !isRunning || std::exchange(isSent, true)) return;
        world.settle();
        renewStopBudget(kCycleBudget);
        raise(SIGTERM);
    };
    sigConnKilled = kNoSignal;
    assert(installSignalHandlers());
    renewAll(folder.path);
    DaemonControl::getInstance()->enableRemoteAccess();
    DaemonControl::getInstance()->setSleepTime(30);
    isRunning = true;
    DaemonControl::getInstance()->run();
    isRunning = false;
    assert(world.client == 0);
    renewAll(folder.path);  // what it holds of this world goes before it
}

}  // namespace pelorus::fuzz
