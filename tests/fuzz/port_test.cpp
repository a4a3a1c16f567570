// The central server's answers: to a port test, the sleep poll and the address question.
#include "cloud/port_test_answer.h"
#include "cloud/public_address.h"
#include "cloud/sleep_answer.h"
#include "fuzz_world.h"

void pelorus::fuzz::tryText(const std::string& text) {
    const PortTestAnswer test = readPortTestAnswer(text);
    for (const auto& part : {test.remoteAddress, test.testedAddress}) {
        if (!part || part->text.empty()) continue;
        assert(text.substr(part->start, part->end - part->start) == part->text);
    }
    for (const auto& device : {test.requestedDevice, test.respondingDevice}) {
        assert(text.find(device) != std::string::npos);
    }
    const SleepAnswer sleep = readSleepAnswer(text);
    const bool settled = sleep.kind == SleepAnswer::WAIT || sleep.kind == SleepAnswer::PROCEED;
    assert(sleep.seconds.has_value() == settled);
    assert(sleep.seconds.value_or(0) >= 0);
    const bool isAddress = text.find_first_not_of("0123456789.") == std::string::npos;
    assert(isAddress || !isIpv4Address(text));
}
