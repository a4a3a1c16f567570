#include "common/log.h"

#include "support/fixture.h"

namespace pelorus::support {
namespace {

using LogTest = PelorusTest;

TEST_F(LogTest, OutsideTextIsNoFormatAndLongLinesAreCutToTheBuffer) {
    const std::string text(5000, 'x');
    logLine(LOG_ALERT, "answer %s, %d bytes\n", "100%s%n", 7);
    logError("%s", text.c_str());
    logWarning("%s", "\x1b[2J\r\x07\x7f\n");
    logNotice("%d", 2);
    logInfo("%d", 3);
    logDebug("%d", 4);
    expectLogIs({{LOG_ALERT, "answer 100%s%n, 7 bytes\n"},
                 {LOG_ERR, text.substr(0, 1279)},
                 {LOG_WARNING, " [2J   \n"},
                 {LOG_NOTICE, "2"},
                 {LOG_INFO, "3"},
                 {LOG_DEBUG, "4"}});
}

}  // namespace
}  // namespace pelorus::support
