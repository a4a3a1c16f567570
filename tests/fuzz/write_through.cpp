// The command that writes a setting: the shell and sed take key, values and path as they are.
#include "common/text.h"
#include "config/replace_command.h"
#include "fuzz_world.h"

namespace {

// Takes a part of the script up to its slash, without escapes. All that is special is escaped.
std::string takePart(std::string& script, const std::string& special) {
    std::string part;
    std::size_t at = 0;
    for (; script.at(at) != '/'; ++at) {
        const bool isEscaped = script[at] == '\\';
        if (isEscaped) ++at;
        assert((special.find(script.at(at)) != std::string::npos) == isEscaped);
        part += script[at];
    }
    script.erase(0, at + 1);
    return part;
}

}  // namespace

// Key, old value, new value and path.
void pelorus::fuzz::tryText(const std::string& text) {
    const auto part = fields(text, 4);
    std::string command = replaceCommand(part[0], part[1], part[2], part[3]);
    replaceAll(command, "'\\''", {'\0'});
    const auto words = fields(command, 1, '\'');  // every second one was quoted
    assert(words[0] == "sed -i " && (words.size() == 3 || (words.size() == 5 && words[2] == " ")));
    std::string script = words[1], path = words.size() == 3 ? words[2].substr(1) : words[3];
    for (std::string* word : {&script, &path}) std::replace(word->begin(), word->end(), '\0', '\'');
    assert(path == part[3]);
    assert(words.size() == 5 || path.find_first_of(" \t\n;|&$`\\\"<>()*?[]#~!{}=") == path.npos);
    assert(script.rfind("s/", 0) == 0);
    script.erase(0, 2);
    assert(takePart(script, "/\\.*[]^$") == part[0] + "=" + part[1]);
    assert(takePart(script, "/\\&") == part[0] + "=" + part[2] && script == "g");
}
