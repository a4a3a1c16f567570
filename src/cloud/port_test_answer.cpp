#include "cloud/port_test_answer.h"

#include "common/text.h"

namespace pelorus {

namespace {

constexpr const char* kPassed = "Success";

// Nothing without the closing tag.
std::optional<TaggedText> textBetween(const std::string& answer, const std::string& name) {
    const std::string opening = "<" + name + ">";
    const std::size_t found = answer.find(opening);
    TaggedText tagged;
    tagged.start = found == std::string::npos ? opening.size() - 1 : found + opening.size();
    tagged.end = answer.find("</" + name + ">");
    if (tagged.end == std::string::npos) return std::nullopt;
    if (tagged.start < tagged.end) {
        tagged.text = answer.substr(tagged.start, tagged.end - tagged.start);
    }
    return tagged;
}

}  // namespace

PortTestAnswer readPortTestAnswer(const std::string& text) {
    PortTestAnswer answer;
    answer.passed = contains(text, kPassed);
    if (contains(text, "<remote_external_ip>")) {
        answer.remoteAddress = textBetween(text, "remote_external_ip");
    }
    answer.testedAddress = textBetween(text, "external_ip");
    answer.requestedDevice = textBetween(text, "req_device_id").value_or(TaggedText{}).text;
    answer.respondingDevice = textBetween(text, "resp_device_id").value_or(TaggedText{}).text;
    return answer;
}

}  // namespace pelorus
