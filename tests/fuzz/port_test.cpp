// The central server's answers: to a port test, the sleep poll and the address question.
#include "cloud/port_test_answer.h"
#include "cloud/public_address.h"
#include "cloud/sleep_answer.h"
#include "fuzz_world.h"

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace pelorus;
    const std::string text = fuzz::asText(data, size);

    const PortTestAnswer test = readPortTestAnswer(text);
    for (const auto& part : {test.remoteAddress, test.testedAddress}) {
        if (!part || part->text.empty()) continue;
        fuzz::require(text.substr(part->start, part->end - part->start) == part->text, "a place");
    }
    for (const auto& device : {test.requestedDevice, test.respondingDevice}) {
        fuzz::require(text.find(device) != std::string::npos, "a device of the answer");
    }

    const SleepAnswer sleep = readSleepAnswer(text);
    const bool settled = sleep.kind == SleepAnswer::WAIT || sleep.kind == SleepAnswer::PROCEED;
    fuzz::require(sleep.seconds.has_value() == settled, "a wait when it is settled");
    fuzz::require(sleep.seconds.value_or(0) >= 0, "no negative wait");

    if (isIpv4Address(text)) {
        fuzz::require(text.find_first_not_of("0123456789.") == std::string::npos, "an address");
    }
    return 0;
}
