// Settings: a line of a configuration file, and the command that writes one.
#include "common/text.h"
#include "config/replace_command.h"
#include "config/setting_line.h"
#include "fuzz_world.h"

namespace {

// Only blanks, quotes and the line feed around key and value go.
void readLine(const std::string& text) {
    const auto [key, value] = pelorus::parseSettingLine(text);
    const std::size_t split = text.find('=', 1);
    if (split == std::string::npos) return assert(key.empty() && value.empty());
    const auto isCut = [](const char* from, const char* to, const char* characters) {
        return std::string{from, to}.find_first_not_of(characters) == std::string::npos;
    };
    assert(isCut(text.data(), key.data(), " \t"));
    assert(key.data() + key.size() == &text[split] && key.find_first_of(" \t") != 0);
    assert(isCut(&text[split] + 1, value.data(), " \t\""));
    assert(isCut(value.data() + value.size(), text.data() + text.size(), " \t\"\n"));
    assert(value.find_first_of(" \t\"") != 0);
    assert(value.empty() || value.find_last_of(" \t\"\n") != value.size() - 1);
}

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

// The line, or else key, old value, new value and path, which the shell and sed take as they are.
void pelorus::fuzz::tryText(const std::string& text) {
    readLine(text);
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
