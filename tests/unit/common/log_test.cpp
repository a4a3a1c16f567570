#include "common/log.h"

#include "support/fixture.h"

namespace pelorus::support {
namespace {

using LogTest = PelorusTest;

TEST_F(LogTest, OutsideTextIsNoFormatAndLongLinesAreCutToTheBuffer) {
    const std::string text(5000, 'x');
    logLine(LOG_ERR, "answer %s, %d bytes\n", "100%s%n", 7);
    logLine(LOG_INFO, "%s", text.c_str());
    logLineCut(1024, LOG_INFO, "%s", text.c_str());
    logLineCut(4000, LOG_INFO, "%s", text.c_str());
    expectLogIs({{LOG_ERR, "answer 100%s%n, 7 bytes\n"},
                 {LOG_INFO, text.substr(0, 1279)},
                 {LOG_INFO, text.substr(0, 1023)},
                 {LOG_INFO, text.substr(0, 1279)}});
}

}  // namespace
}  // namespace pelorus::support
