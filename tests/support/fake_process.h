// The process of a test: fork, setsid, chdir, open and kill pass through here. They do what they
// say, but some can be told to fail, and a test does not end itself.
#ifndef PELORUS_SUPPORT_FAKE_PROCESS_H
#define PELORUS_SUPPORT_FAKE_PROCESS_H

#include <map>
#include <set>
#include <string>
#include <vector>

namespace pelorus::support {

struct FakeProcess {
    static FakeProcess& get();

    std::set<std::string> failing;               ///< of "fork", "setsid", "chdir"
    std::map<std::string, std::string> targets;  ///< what open opens in place of a path
    std::vector<int> selfKills;                  ///< signals this process sent to itself
    bool killForReal = false;                    ///< also sends those
};

}  // namespace pelorus::support

#endif
