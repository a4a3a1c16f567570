#include "common/log.h"

#include "support/fixture.h"

namespace pelorus::support {
namespace {

using LogTest = PelorusTest;

TEST_F(LogTest, OutsideTextIsNoFormatAndLongLinesAreCutToTheBuffer) {
    const std::string text(5000, 'x');
    logLine(LOG_ALERT, "answer %s, %d bytes\n", "100%s%n", 7);
    logError("%s", text.c_str());
    logWarning("%d", 1);
    logNotice("%d", 2);
    logInfo("%d", 3);
    logDebug("%d", 4);
    logDebug("\x1b[2J\r\x7f\n\xc2\x80\xc2\x9f\xc2\xa0\xc3\x80\xc2\n");
    expectLogIs({{LOG_ALERT, "answer 100%s%n, 7 bytes\n"},
                 {LOG_ERR, text.substr(0, 1279)},
                 {LOG_WARNING, "1"},
                 {LOG_NOTICE, "2"},
                 {LOG_INFO, "3"},
                 {LOG_DEBUG, "4"},
                 {LOG_DEBUG, " [2J  \n    \xc2\xa0\xc3\x80\xc2\n"}});
}

}  // namespace
}  // namespace pelorus::support
