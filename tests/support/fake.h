// What the fakes share.
#ifndef PELORUS_SUPPORT_FAKE_H
#define PELORUS_SUPPORT_FAKE_H

#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <string>
#include <utility>
#include <vector>

namespace pelorus::support {

inline bool isBlocked(int signal) {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    return sigismember(&mask, signal) == 1;
}

/// For a library that may hold a lock which the handler's log line needs.
inline void expectTerminationHeld() {
    EXPECT_TRUE(isBlocked(SIGINT) && isBlocked(SIGTERM) && isBlocked(SIGQUIT))
        << "the handler could wait for a lock forever";
}

/// One object for the calls that the linker leads to a fake. Never destroyed: the code under test
/// still calls it at the end of the process.
template <class Fake>
struct Single {
    static Fake& get() {
        static auto* const instance = new Fake;
        return *instance;
    }
    void reset() { get() = Fake{}; }
};

/// Answers requests by a part of their text.
template <class Answer>
class Script {
public:
    /// Answers every request that holds @p part. A later rule goes before an earlier one.
    void answer(const std::string& part, Answer answer) {
        rules.emplace_back(part, std::move(answer));
    }
    /// Answers the next request that holds @p part, before any standing rule; several for one
    /// part in the order in which they were given.
    void answerOnce(const std::string& part, Answer answer) {
        once.emplace_back(part, std::move(answer));
    }
    /// How many requests hold @p part.
    [[nodiscard]] int count(const std::string& part) const {
        const auto holds = [&](const auto& line) { return line.find(part) != std::string::npos; };
        return static_cast<int>(std::count_if(asked.begin(), asked.end(), holds));
    }
    /// Forgets the requests, not the answers.
    void clear() { asked.clear(); }

protected:
    /// Records the request; @p otherwise is the answer when there is no rule.
    Answer take(const std::string& line, const Answer& otherwise) {
        asked.push_back(line);
        const auto fits = [&](const auto& rule) {
            return line.find(rule.first) != std::string::npos;
        };
        if (const auto next = std::find_if(once.begin(), once.end(), fits); next != once.end()) {
            Answer found = next->second;
            once.erase(next);
            return found;
        }
        const auto rule = std::find_if(rules.rbegin(), rules.rend(), fits);
        return rule == rules.rend() ? otherwise : rule->second;
    }

    std::vector<std::string> asked;

private:
    std::vector<std::pair<std::string, Answer>> rules;
    std::vector<std::pair<std::string, Answer>> once;
};

}  // namespace pelorus::support

#endif
