// What the fakes share.
#ifndef PELORUS_SUPPORT_FAKE_H
#define PELORUS_SUPPORT_FAKE_H

#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <functional>
#include <iterator>
#include <set>
#include <string>
#include <utility>
#include <vector>

namespace pelorus::support {

using Texts = std::vector<std::string>;

inline bool holds(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

inline std::set<int> blockedSignals() {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    std::set<int> blocked;
    for (int signal = 1; signal < SIGRTMIN; ++signal) {
        if (sigismember(&mask, signal) == 1) blocked.insert(signal);
    }
    return blocked;
}

/// Takes no memory: a signal handler may ask.
inline bool areBlocked(std::initializer_list<int> signals) {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    return std::all_of(signals.begin(), signals.end(),
                       [&](int signal) { return sigismember(&mask, signal) == 1; });
}

/// For a library that may hold a lock which the handler's log line needs.
inline void expectTerminationHeld() {
    EXPECT_TRUE(areBlocked({SIGINT, SIGTERM, SIGQUIT})) << "the handler could wait forever";
}

/// For miniupnpc, which writes to its sockets without protection.
inline void expectBrokenPipeHeld() {
    expectTerminationHeld();
    EXPECT_TRUE(areBlocked({SIGPIPE})) << "a closed connection would end the process";
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

/// The calls that reached a fake, a line each.
template <class Line = std::string>
class Calls {
public:
    using Lines = std::vector<Line>;
    [[nodiscard]] const Lines& calls() const { return asked; }
    /// Those that hold @p part.
    [[nodiscard]] Lines calls(const std::string& part) const {
        Lines found;
        std::copy_if(asked.begin(), asked.end(), std::back_inserter(found),
                     [&](const auto& line) { return holds(line, part); });
        return found;
    }
    [[nodiscard]] int count(const std::string& part) const {
        return static_cast<int>(calls(part).size());
    }
    /// Forgets the calls, not the answers.
    void clear() { asked.clear(); }
    /// Runs @p action at each following call, before it is answered.
    void onCall(std::function<void(const Line&)> action) { hook = std::move(action); }
    void note(const Line& line) {
        asked.push_back(line);
        if (hook) hook(line);
    }

private:
    Lines asked;
    std::function<void(const Line&)> hook;
};

/// Answers calls by a part of their text.
template <class Answer>
class Script : public Calls<> {
public:
    /// Answers every call that holds @p part. A later rule goes before an earlier one.
    void answer(const std::string& part, Answer answer) {
        rules.emplace_back(part, std::move(answer));
    }
    /// Answers the next call that holds @p part, before any standing rule; several in order.
    void answerOnce(const std::string& part, Answer answer) {
        once.emplace_back(part, std::move(answer));
    }

protected:
    /// Notes the call; @p otherwise is the answer when there is no rule.
    Answer take(const std::string& line, const Answer& otherwise) {
        this->note(line);
        const auto fits = [&](const auto& rule) { return holds(line, rule.first); };
        if (const auto next = std::find_if(once.begin(), once.end(), fits); next != once.end()) {
            Answer found = next->second;
            once.erase(next);
            return found;
        }
        const auto rule = std::find_if(rules.rbegin(), rules.rend(), fits);
        return rule == rules.rend() ? otherwise : rule->second;
    }

private:
    std::vector<std::pair<std::string, Answer>> rules, once;
};

}  // namespace pelorus::support

#endif
