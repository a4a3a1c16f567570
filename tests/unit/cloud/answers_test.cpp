// Reading the server's answers.
#include "cloud/port_test_answer.h"
#include "cloud/public_address.h"
#include "cloud/sleep_answer.h"
#include "support/fixture.h"

namespace pelorus {
namespace {

struct Row {
    const char* name;
    std::string text;
    std::string wanted;
};

const std::string kWait = "<action>wait</action>";
const std::string kProceed = "<action>proceed</action>";

class SleepAnswers : public ::testing::TestWithParam<Row> {};

TEST_P(SleepAnswers, AreRead) {
    const char* const kinds[] = {"no action", "proceed", "wait", "no time", "bad time"};
    const SleepAnswer answer = readSleepAnswer(GetParam().text);
    EXPECT_EQ(kinds[answer.kind] + (answer.seconds ? " " + std::to_string(*answer.seconds) : ""),
              GetParam().wanted);
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(, SleepAnswers, ::testing::Values(
    Row{"ATimeMayFollowLaterAndEndInAnything", kWait + "x <wait_time> 300s", "wait 300"},
    Row{"AWaitMayBeZero", kWait + "<wait_time>0</wait_time>", "wait 0"},
    Row{"ANegativeTimeIsBad", kWait + "<wait_time>-1</wait_time>", "bad time"},
    Row{"AWordIsABadTime", kWait + "<wait_time>soon", "bad time"},
    Row{"AnEarlierTimeIsNotSeen", "<wait_time>300</wait_time>" + kWait, "no time"},
    Row{"WaitBeatsProceed", kProceed + kWait + "<wait_time>300", "wait 300"},
    Row{"ProceedIsNoWait", kProceed + "<wait_time>300", "proceed 0"},
    Row{"CaseMatters", "<ACTION>wait</ACTION><wait_time>300", "no action"}),
    support::RowName{});
// clang-format on

std::string shown(const std::optional<TaggedText>& tagged) {
    if (!tagged) return "none";
    return tagged->text + " " + std::to_string(tagged->start) + " " + std::to_string(tagged->end);
}

class PortTestAnswers : public ::testing::TestWithParam<Row> {};

TEST_P(PortTestAnswers, AreRead) {
    const PortTestAnswer answer = readPortTestAnswer(GetParam().text);
    EXPECT_EQ((answer.passed ? "passed, " : "failed, ") + shown(answer.remoteAddress) + ", " +
                  shown(answer.testedAddress) + ", " + answer.requestedDevice + ", " +
                  answer.respondingDevice,
              GetParam().wanted);
}

// clang-format off
INSTANTIATE_TEST_SUITE_P(, PortTestAnswers, ::testing::Values(
    Row{"AnEmptyOneSaysNothing", "", "failed, none, none, , "},
    Row{"SuccessMayStandAnywhere", "no success, Success", "passed, none, none, , "},
    Row{"TheRemoteAddress", "<remote_external_ip>44.1</remote_external_ip>", "failed, 44.1 20 24, none, , "},
    Row{"TheRemoteAddressMustBeOpened", "0123456789012345678944.1</remote_external_ip>", "failed, none, none, , "},
    Row{"TheRemoteAddressMustBeClosed", "<remote_external_ip>44.1", "failed, none, none, , "},
    Row{"TheTestedAddress", "<external_ip>44.1</external_ip>", "failed, none, 44.1 13 17, , "},
    Row{"AnUnopenedTestedAddressStartsAtTwelve", "Success 0123here</external_ip>", "passed, none, here 12 16, , "},
    Row{"AnAddressClosedBeforeItIsOpenedIsEmpty", "</external_ip><external_ip>x", "failed, none,  27 0, , "},
    Row{"BothDevices", "<req_device_id>a</req_device_id><resp_device_id>b</resp_device_id>", "failed, none, none, a, b"},
    Row{"ADeviceMustBeClosed", "<req_device_id>a<resp_device_id>b", "failed, none, none, , "}),
    support::RowName{});
// clang-format on

TEST(PublicAddress, IsFourNumbersAndNothingElse) {
    EXPECT_TRUE(isIpv4Address("44.128.0.9"));
    for (const std::string text : {"", "44.128.0", "44.128.0.9\n", "44.128.0.256", "::1"}) {
        EXPECT_FALSE(isIpv4Address(text)) << text;
    }
    EXPECT_FALSE(isIpv4Address(std::string("1.2.3.4\0x", 9)));
}

}  // namespace
}  // namespace pelorus
