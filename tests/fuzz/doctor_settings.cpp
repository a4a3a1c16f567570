// The doctor's reading of settings files, and of the tunnel client's output.
#include "doctor/device_files.h"
#include "doctor/settings_report.h"
#include "doctor/tunnel_look.h"
#include "fuzz_world.h"

namespace {

using pelorus::doctor::Evidence;

void checkText(const std::string& text) {
    for (const char letter : text) assert(letter >= ' ' && letter <= '~');
    assert(text.find(pelorus::fuzz::kDeviceAuth) == std::string::npos);
}

void checkEvidence(const Evidence& evidence) {
    for (const auto& [sign, fact] : evidence.signs) checkText(fact.text);
    for (const auto& check : evidence.checks) checkText(check.text);
    checkText(evidence.statusWord);
    checkText(evidence.daemon.options);
}

}  // namespace

// The static file, the dynamic one and the client's output with a byte 1 between them; a fourth part
// is the copy of the dynamic file.
void pelorus::fuzz::tryText(const std::string& text) {
    begin("1");
    const auto part = fields(text, 3, '\1');
    const auto folder = std::filesystem::temp_directory_path() /
                        ("pelorus-fuzz-" + std::to_string(getpid()) + "-device");
    std::filesystem::create_directory(folder);
    const auto write = [&](const char* name, const std::string& content) {
        std::ofstream{folder / name, std::ios::binary} << content;
        return (folder / name).string();
    };
    const std::string output = write("output", part[2]);
    const std::string copy = folder / "copy";
    if (part.size() > 3) write("copy", part[3]);
    write("dynamicconfig.ini", part[1]);
    // The daemon writes the copy, so its path is not left to the input.
    const std::string file = write(
        "static", part[0] + "\nDYNAMIC_CONFIG=" + folder.string() + "\nSTARTCMD_OUTFILE=" + output +
                      "\nDYNAMIC_CONFIG_TMP=" + copy + "\nDEVICEAUTH=" + kDeviceAuth +
                      "\nSTATIC_ONLY_KEYS=DEVICEAUTH DYNAMIC_CONFIG DYNAMIC_CONFIG_TMP\n");
    const auto report = doctor::checkSettings(file);
    assert(report.usable && report.problems.size() <= 101 && report.remarks.size() <= 101);
    for (const auto& line : report.problems) checkText(line);
    for (const auto& line : report.remarks) checkText(line);

    Evidence evidence;
    // The output stands in for the other small files as well.
    doctor::lookAtFiles({file, output, output, folder}, evidence);
    checkEvidence(evidence);
    assert(std::filesystem::exists(copy) == (part.size() > 3));
    checkText(doctor::readTunnelOutput(part[2], part[0]).line);

    // The daemon's copying cuts lines at zero bytes.
    if (part.size() > 3 || part[1].find('\0') == std::string::npos) {
        auto& config = *GlobalConfig::getInstance();
        config.properties = {};
        config.tmpModTime = 0;
        const bool isLoaded = config.loadConfig(file);
        assert(isLoaded && config.properties.values == evidence.settings);
    }
    std::filesystem::remove(copy);
}
