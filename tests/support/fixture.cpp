#include "support/fixture.h"

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <stdexcept>

#include "config/global_config.h"
#include "support/fake_files.h"
#include "support/fake_gateway.h"
#include "support/fake_web.h"

namespace pelorus::support {

namespace fs = std::filesystem;

namespace {

std::string makeFolder() {
    std::string name = (fs::temp_directory_path() / "pelorus-test-XXXXXX").string();
    if (mkdtemp(name.data()) == nullptr) throw std::runtime_error{"no temporary folder"};
    return name;
}

std::ptrdiff_t openDescriptors() {
    return std::distance(fs::directory_iterator{"/proc/self/fd"}, fs::directory_iterator{});
}

}  // namespace

void resetFakes() {
    FakeGateway::get().reset();
    FakeWeb::get().reset();
    FakeCommands::get().reset();
    VirtualClock::get().reset();
    FakeNet::get().reset();
    FakeFiles::get().reset();
    FakeProcess::get().reset();
    LogCapture::get().reset();
}

PelorusTest::PelorusTest() : folder{makeFolder()}, descriptorsAtStart{openDescriptors()} {
    FakeGateway::get().reset();
}

void PelorusTest::TearDown() {
    commands.checkClosed();
    net.checkReleased();
    FakeWeb::get().checkBalance();
    FakeGateway::get().checkReleased();
    EXPECT_EQ(openDescriptors(), descriptorsAtStart) << "descriptors now and at the start";
    EXPECT_EQ(blockedSignals(), blockedAtStart) << "blocked signals now and at the start";
    fs::remove_all(folder);
}

std::string PelorusTest::writeFile(const std::string& name, const std::string& content) const {
    std::ofstream{path(name), std::ios::binary} << content;
    return path(name);
}

std::string PelorusTest::readFile(const std::string& file) {
    std::ifstream content{file, std::ios::binary};
    return {std::istreambuf_iterator<char>{content}, {}};
}

// Registers the secrets among them.
std::string PelorusTest::asLines(const Settings& settings) {
    std::string lines;
    for (const auto& [key, value] : settings) {
        lines.append(key).append("=").append(value).append("\n");
        if (key == "DEVICEID" || key == "DEVICEAUTH" || key == "SUBDOMAIN") log.addSecret(value);
    }
    return lines;
}

void PelorusTest::givenConfig(const Settings& settings, const Settings& dynamicSettings) {
    Settings fixed = settings;
    fixed.insert({{"DYNAMIC_CONFIG", folder}, {"DYNAMIC_CONFIG_TMP", "empty"}});
    Settings changing = dynamicSettings;
    changing.insert(
        {{"DEVICEID", kDeviceId}, {"DEVICEAUTH", kDeviceAuth}, {"SUBDOMAIN", kSubdomain}});
    writeFile("dynamicconfig.ini", asLines(changing));
    ASSERT_TRUE(GlobalConfig::getInstance()->loadConfig(writeFile("static.ini", asLines(fixed))))
        << log.dump();
    log.clear();
}

void PelorusTest::setConfig(const std::string& key, const std::string& value) {
    static_cast<void>(asLines({{key, value}}));
    GlobalConfig::getInstance()->setProperty(key, value, false);
}

}  // namespace pelorus::support
