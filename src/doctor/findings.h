// What one probe found, and how it gets from the probe's process to the doctor's.
#ifndef PELORUS_DOCTOR_FINDINGS_H
#define PELORUS_DOCTOR_FINDINGS_H

#include <functional>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "doctor/evidence.h"

namespace pelorus::doctor {

/// The text without control characters and bytes beyond ASCII, cut to @p most characters.
[[nodiscard]] std::string plainText(std::string_view text, std::size_t most = 200);

/// Signs, lines of what was checked, and values from which the doctor concludes. All texts are
/// plain. Each record is handed to the sender, if there is one, the moment it is added: what a
/// probe had found before it was killed is not lost.
class Findings {
public:
    /// Takes one line, which ends with a line feed.
    using Sender = std::function<void(const std::string& line)>;

    struct Seen {
        Sign sign;
        std::string text;
    };

    Findings() = default;
    explicit Findings(Sender recipient) : send{std::move(recipient)} {}

    void add(Sign sign, const std::string& text);
    void ok(const std::string& text) { check(Check::Verdict::OK, text); }
    void problem(const std::string& text) { check(Check::Verdict::PROBLEM, text); }
    void notSeen(const std::string& text) { check(Check::Verdict::NOT_SEEN, text); }
    /// @p name consists of letters.
    void set(const std::string& name, const std::string& value);
    /// Says that nothing more comes.
    void finish();

    /// Takes what another process has sent. False when it is not a sequence of such lines, signs
    /// that no probe gives included; the records before the fault are then taken. A last line
    /// without its end is ignored.
    [[nodiscard]] bool read(std::string_view text);

    [[nodiscard]] const std::vector<Seen>& signs() const { return seen; }
    [[nodiscard]] const std::vector<Check>& checks() const { return lines; }
    [[nodiscard]] bool finished() const { return complete; }
    [[nodiscard]] bool has(Sign sign) const;
    /// Empty when it was not set.
    [[nodiscard]] std::string value(const std::string& name) const;

private:
    void check(Check::Verdict verdict, const std::string& text);
    [[nodiscard]] bool readLine(std::string_view line);
    void pass(char kind, const std::string& subject, const std::string& text) const;

    Sender send;
    std::vector<Seen> seen;
    std::vector<Check> lines;
    std::map<std::string, std::string> values;
    bool complete = false;
};

}  // namespace pelorus::doctor

#endif
