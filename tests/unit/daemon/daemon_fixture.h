// The fixture of the daemon room: all rooms between a fake gateway and a fake web.
#ifndef PELORUS_UNIT_DAEMON_FIXTURE_H
#define PELORUS_UNIT_DAEMON_FIXTURE_H

#include <string>
#include <vector>

#include "common/termination.h"
#include "daemon/daemon_control.h"
#include "support/fake_files.h"
#include "support/fake_gateway.h"
#include "support/fake_process.h"
#include "support/fake_web.h"
#include "support/fixture.h"

namespace pelorus::support {

class DaemonTest : public PelorusTest {
protected:
    DaemonTest() {
        web.reset();
        gateway.reset();
        files.reset();
        web.answer("/setstatus", "success");
        web.answer("/setforward", "success");
        web.answer("/delforward", "success");
        web.answer("/remote_access_status/", "<action>proceed</action>");
        web.answer("/forward?", "Success");
        web.answer("/test?",
                   "<s>Success</s><remote_external_ip>44.128.0.20</remote_external_ip>"
                   "<req_device_id>a</req_device_id><resp_device_id>a</resp_device_id>");
        commands.answer("hdparm", "drive state is:  active/idle\n");
        files.redirect(kIdleMinutesFile, writeFile("minutes", "0\n"));
    }

    void TearDown() override {
        for (const int signal : {SIGINT, SIGTERM, SIGQUIT}) {
            static_cast<void>(std::signal(signal, SIG_DFL));
        }
        sigConnKilled = kNoSignal;
        web.checkBalance();
        gateway.checkReleased();
        PelorusTest::TearDown();
    }

    /// A device that reaches a direct connection in its first cycle.
    [[nodiscard]] Settings settings() const {
        return {{"SERVER_BASE_URL", "https://cloud.kavra.example"},
                {"ENABLEREMOTEACCESS", "1"},
                {"COMMUNICATION_STATUS", "portforwarded"},
                {"INTERNAL_HTTP_PORT", "80"},
                {"INTERNAL_HTTPS_PORT", "443"},
                {"REMOTE_TESTPORTURL", "/test?%s&ip=%s&port=%d&%s&%s"},
                {"REMOTE_SETFORWARDURL", "/forward?%s&%s&%s&%d&%d&%s"},
                {"LOCAL_SETFORWARDURL", "http://127.0.0.1:%d/setforward?%s&%d&%d&%s&%d"},
                {"LOCAL_DELFORWARDURL", "http://127.0.0.1:%d/delforward?%d"},
                {"LOCAL_SETCOMMSTATUSURL", "http://127.0.0.1:%d/setstatus?%s"},
                {"OPENVPN_CONFIG_PATH", folder},
                {"OPENVPN_AUTH_FILE", path("auth.txt")},
                {"STARTCMD", "start-client"},
                {"STARTCMD_OUTFILE", path("client.out")},
                {"LOG_SUCCESS_TEXT", "Completed"},
                {"OPENVPN_PID_FILE", path("client.pid")}};
    }

    /// Runs @p action within the pause that ends cycle @p number (1: the next one).
    void inPauseOfCycle(int number, const VirtualClock::Action& action) {
        log.onLine([this, number, action, seen = 0](const LogLine& line) mutable {
            const bool endsCycle =
                line.text.find("DaemonControl::run - sleep ") == 0 ||
                line.text.find("DaemonControl::run - retry connection after ") == 0;
            if (endsCycle && ++seen == number) clock.duringPause(1, action);
        });
    }

    /// The status words told to the local back end, in order.
    [[nodiscard]] std::vector<std::string> statusWords() const {
        const std::string part = "/setstatus?";
        std::vector<std::string> words;
        for (const auto& url : web.urls()) {
            const auto at = url.find(part);
            if (at != std::string::npos) words.push_back(url.substr(at + part.size()));
        }
        return words;
    }

    FakeWeb& web = FakeWeb::get();
    FakeGateway& gateway = FakeGateway::get();
    FakeFiles& files = FakeFiles::get();
    FakeProcess& process = FakeProcess::get();
    DaemonControl& control = *DaemonControl::getInstance();
};

}  // namespace pelorus::support

#endif
