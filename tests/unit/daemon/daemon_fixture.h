// The fixture of the daemon module: all modules, on a device that reaches a direct connection in
// its first cycle.
#ifndef PELORUS_UNIT_DAEMON_FIXTURE_H
#define PELORUS_UNIT_DAEMON_FIXTURE_H

#include "daemon/daemon_control.h"
#include "support/fake_files.h"
#include "unit/connection/connection_fixture.h"

namespace pelorus {

class DaemonTest : public ConnectionTest {
protected:
    DaemonTest() { setConfig("COMMUNICATION_STATUS", "portforwarded"); }

    static bool endsCycle(const support::LogLine& line) {
        return line.text.find("DaemonControl::run - sleep ") == 0 ||
               line.text.find("DaemonControl::run - retry connection after ") == 0;
    }
    /// Runs @p action within the pause that ends each cycle, with the number of cycles so far.
    template <typename Action>
    void inEachPause(Action action) {
        log.onLine([this, action, cycles = 0U](const support::LogLine& line) mutable {
            if (!endsCycle(line)) return;
            clock.duringPause(1, [=, number = ++cycles] { action(number, line.text); });
        });
    }

    support::FakeProcess& process = support::FakeProcess::get();
    DaemonControl& control = *DaemonControl::getInstance();
};

}  // namespace pelorus

#endif
