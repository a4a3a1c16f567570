#include "common/log.h"

#include <csignal>
#include <string>

#include "support/fixture.h"

namespace pelorus::support {
namespace {

class LogTest : public PelorusTest {};

TEST_F(LogTest, TextFromOutsideIsNoFormat) {
    logLine(LOG_ERR, "answer %s, %d bytes\n", "100%s%n", 7);
    expectLogIs({{LOG_ERR, "answer 100%s%n, 7 bytes\n"}});
}

TEST_F(LogTest, LongLinesAreCutToTheBuffer) {
    const std::string text(5000, 'x');
    logLine(LOG_INFO, "%s", text.c_str());
    logLineCut(1024, LOG_INFO, "%s", text.c_str());
    logLineCut(4000, LOG_INFO, "%s", text.c_str());
    EXPECT_EQ(log.texts(), (std::vector<std::string>{text.substr(0, 1279), text.substr(0, 1023),
                                                     text.substr(0, 1279)}));
}

extern "C" void logFromHandler(int signal) {
    logLine(LOG_ERR, "handler %d\n", signal);
}

// The capture refuses a line that is sent within another one: with the real log, its sender
// would wait for ever for the lock it holds itself.
TEST_F(LogTest, AHandlerThatLogsWaitsForTheLineBeingSent) {
    for (const int signal : {SIGINT, SIGTERM, SIGQUIT}) {
        log.clear();
        std::signal(signal, logFromHandler);
        log.onLine([&](const LogLine& line) {
            if (line.text == "first\n") raise(signal);
        });
        logLine(LOG_INFO, "first\n");
        expectLogIs({{LOG_INFO, "first\n"}, {LOG_ERR, "handler " + std::to_string(signal) + "\n"}});
        std::signal(signal, SIG_DFL);
    }
}

}  // namespace
}  // namespace pelorus::support
