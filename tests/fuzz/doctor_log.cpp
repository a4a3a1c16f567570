// A log that the doctor reads: any bytes, compressed or not.
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>

#include "doctor/log_line.h"
#include "doctor/log_source.h"
#include "doctor/log_story.h"
#include "doctor/sharing.h"
#include "fuzz_world.h"

namespace {

constexpr std::chrono::seconds kNow{1795316400};

void checkText(const std::string& text) {
    assert(text.size() < 1000);
    assert(std::all_of(text.begin(), text.end(),
                       [](char letter) { return letter >= ' ' && letter <= '~'; }));
}

void check(const pelorus::doctor::Evidence& evidence) {
    for (const auto& [sign, fact] : evidence.signs) checkText(fact.text);
    for (const auto& period : evidence.history) {
        checkText(period.cause);
        checkText(period.address);
    }
    assert(evidence.history.size() <= 2000);
    assert(evidence.hasLog == evidence.logBegin.has_value());
}

void checkMasks(const std::string& text) {
    const std::multimap<std::string, std::string> settings{{"DEVICEAUTH", "s3cret"}};
    pelorus::doctor::Masks masks{settings, pelorus::doctor::PlaceMasks{{"nas"}}};
    assert(masks.hide(text).find("s3cret") == std::string::npos);
}

}  // namespace

void pelorus::fuzz::tryText(const std::string& text) {
    const int descriptor = memfd_create("log", MFD_CLOEXEC);
    assert(descriptor >= 0);
    assert(write(descriptor, text.data(), text.size()) == static_cast<ssize_t>(text.size()));
    lseek(descriptor, 0, SEEK_SET);

    doctor::LogStory story;
    doctor::LogStream stream{descriptor};
    static_cast<void>(stream.firstStamp(doctor::Time{kNow}));
    static_cast<void>(stream.read([&story](std::string_view line) {
        assert(line.size() <= 8192);
        if (const auto read = doctor::readLogLine(line, doctor::Time{kNow})) story.take(*read);
    }));
    doctor::Evidence evidence;
    evidence.now = doctor::Time{kNow};
    story.finish(evidence);
    check(evidence);
    checkMasks(text.substr(0, 1000));
}
