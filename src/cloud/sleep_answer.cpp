#include "cloud/sleep_answer.h"

#include "common/text.h"

namespace pelorus {

namespace {

constexpr const char* kWaitAction = "<action>wait</action>";
constexpr const char* kProceedAction = "<action>proceed</action>";
const std::string kWaitTimeTag = "<wait_time>";

}  // namespace

SleepAnswer readSleepAnswer(const std::string& text) {
    const std::size_t action = text.find(kWaitAction);
    if (action == std::string::npos) {
        if (contains(text, kProceedAction)) return {SleepAnswer::PROCEED, 0};
        return {SleepAnswer::NO_ACTION};
    }
    const std::size_t tag = text.find(kWaitTimeTag, action);
    if (tag == std::string::npos) return {SleepAnswer::NO_TIME};
    const auto seconds = scanInt(text.c_str() + tag + kWaitTimeTag.size());
    if (seconds.value_or(-1) < 0) return {SleepAnswer::BAD_TIME};
    return {SleepAnswer::WAIT, *seconds};
}

}  // namespace pelorus
