// The base of every test fixture. The fakes are always in place: no test reaches the shell, the
// network, the system log or the real clock. Every test fails when a configured secret is in a log
// line, and when pipes, lists from a library, descriptors or the signal mask are not as they were.
// The headers of the fakes name their own checks.
#ifndef PELORUS_SUPPORT_FIXTURE_H
#define PELORUS_SUPPORT_FIXTURE_H

#include "support/fake_commands.h"
#include "support/fake_net.h"
#include "support/log_capture.h"
#include "support/virtual_clock.h"

namespace pelorus::support {

/// Identity of the device unless a test configures another one.
inline constexpr const char* kDeviceId = "device-7350142";
inline constexpr const char* kDeviceAuth = "auth-91c2f0aa";
inline constexpr const char* kSubdomain = "homecloud-smith";

/// Puts every fake back into its first state, without records, rules and hooks.
void resetFakes();

class PelorusTest : public ::testing::Test {
protected:
    using Settings = std::map<std::string, std::string>;

    PelorusTest();
    /// The standing checks. Call it last from a TearDown of your own.
    void TearDown() override;

    /// Path of a file in the folder of this test, which goes away with it.
    [[nodiscard]] std::string path(const std::string& name) const { return folder + "/" + name; }
    std::string writeFile(const std::string& name, const std::string& content) const;
    [[nodiscard]] static std::string readFile(const std::string& file);

    /// Writes static.ini and dynamicconfig.ini, loads both and clears the log. The dynamic file is
    /// read directly, without a temporary copy; the identity above is in it unless it has its own.
    void givenConfig(const Settings& settings = {}, const Settings& dynamicSettings = {});
    /// Changes one value in memory, and the secrets with it.
    void setConfig(const std::string& key, const std::string& value);

    const std::string folder;
    LogCapture& log = LogCapture::get();
    VirtualClock& clock = VirtualClock::get();
    FakeCommands& commands = FakeCommands::get();
    FakeNet& net = FakeNet::get();

private:
    std::string asLines(const Settings& settings);

    const std::set<int> blockedAtStart = blockedSignals();
    const std::ptrdiff_t descriptorsAtStart;
};

/// Names a case of a table by the name of its row.
struct RowName {
    template <typename Row>
    std::string operator()(const ::testing::TestParamInfo<Row>& row) const {
        return row.param.name;
    }
};

}  // namespace pelorus::support

#endif
