#include "doctor/device_files.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <filesystem>

#include "doctor/age.h"
#include "doctor/tunnel_look.h"
#include "support/fixture.h"

namespace pelorus::support {
namespace {

namespace fs = std::filesystem;
using doctor::Check;
using doctor::Evidence;
using doctor::Sign;

constexpr std::int64_t kBoot = 1'700'000'000;
constexpr std::int64_t kNow = kBoot + 20'000;

// A device whose processes are files.
class DeviceFilesTest : public PelorusTest {
protected:
    DeviceFilesTest() {
        fs::create_directories(path("proc/1"));
        fs::create_directory(path("vpn"));
        writeFile("proc/stat", "cpu 1 2 3\nbtime " + std::to_string(kBoot) + "\n");
        writeFile("minutes", "1\n");
        process(812, "pelorus", "/usr/sbin/pelorus", {"-l", "6", "-f", "120"});
        process(77, "openvpn", "/usr/sbin/openvpn");
        writeFile("pid", "812");
    }

    // Started 8000 s after the machine.
    void process(int pid,
                 const std::string& name,
                 const std::string& program,
                 const Texts& arguments = {},
                 const std::string& state = "S",
                 const std::string& pids = "") const {
        const std::string own = "proc/" + std::to_string(pid) + "/";
        fs::create_directories(path(own));
        const auto ticks = std::to_string(8000 * sysconf(_SC_CLK_TCK));
        writeFile(own + "stat", std::to_string(pid) + " (a ) b) " + state +
                                    " 1 2 3 4 5 6 7 8 9 10 11 12 13 14 15 16 17 18 " + ticks +
                                    " 20 21\n");
        writeFile(own + "comm", name + "\n");
        writeFile(own + "status",
                  "Name:\t" + name + "\nNSpid:\t" + std::to_string(pid) + pids + "\n");
        std::string line = program + '\0';
        for (const auto& argument : arguments) line += argument + '\0';
        writeFile(own + "cmdline", line);
        fs::remove(path(own + "exe"));
        fs::create_symlink(program, path(own + "exe"));
        fs::remove(path(own + "cwd"));
        fs::create_symlink(path("vpn"), path(own + "cwd"));
    }

    [[nodiscard]] Evidence look(const Settings& changed = {}, const Settings& dynamic = {}) const {
        Settings settings{{"DYNAMIC_CONFIG", folder},        {"ENABLEREMOTEACCESS", "1"},
                          {"STARTCMD", "openvpn"},           {"OPENVPN_CONFIG_PATH", path("vpn")},
                          {"OPENVPN_AUTH_FILE", "auth.txt"}, {"OPENVPN_PID_FILE", path("vpn/pid")},
                          {"STARTCMD_OUTFILE", "out"},       {"LOG_SUCCESS_TEXT", "Completed"}};
        for (const auto& [key, value] : changed) settings[key] = value;
        Settings others{{"DEVICEID", kDeviceId}, {"DEVICEAUTH", kDeviceAuth}};
        for (const auto& [key, value] : dynamic) others[key] = value;
        writeFile("static.ini", lines(settings));
        writeFile("dynamicconfig.ini", lines(others));
        return lookAtAll();
    }
    [[nodiscard]] Evidence lookAtAll() const {
        Evidence evidence;
        evidence.now = doctor::Time{std::chrono::seconds{kNow}};
        doctor::lookAtFiles({path("static.ini"), path("pid"), path("minutes"), path("proc")},
                            evidence);
        const std::string all = shown(evidence);
        EXPECT_FALSE(holds(all, kDeviceId) || holds(all, kDeviceAuth)) << all;
        return evidence;
    }
    static std::string lines(const Settings& settings) {
        std::string text;
        for (const auto& [key, value] : settings) text += key + "=" + value + "\n";
        return text;
    }
    static std::string shown(const Evidence& evidence) {
        std::string text;
        for (const auto& [sign, fact] : evidence.signs) text += fact.text + "\n";
        for (const Check& check : evidence.checks) text += check.text + "\n";
        return text;
    }
    static std::string problems(const Evidence& evidence) {
        std::string text;
        for (const Check& check : evidence.checks) {
            if (check.verdict != Check::Verdict::OK) text += check.text + "\n";
        }
        return text;
    }
};

TEST_F(DeviceFilesTest, AHealthyDeviceHasNoProblem) {
    const Evidence evidence =
        look({}, {{"COMMUNICATION_STATUS", "portforwarded"}, {"#SUBDOMAIN", "x"}});
    EXPECT_EQ(problems(evidence), "");
    EXPECT_GT(evidence.secrets.count("SUBDOMAIN"), 0U) << "known, so that it is masked";
    EXPECT_EQ(evidence.signs.size(), 3U) << shown(evidence);
    EXPECT_TRUE(evidence.has(Sign::HAS_CREDENTIALS));
    EXPECT_TRUE(evidence.has(Sign::DISK_IN_USE));
    EXPECT_EQ(evidence.signs.at(Sign::DAEMON_RUNS).text,
              "daemon up 3 h 20 min (pid 812, -l 6 -f 120)");
    EXPECT_EQ(evidence.statusWord, "portforwarded");
    EXPECT_EQ(evidence.daemon.pid, 812);
    EXPECT_EQ(evidence.daemon.since, doctor::Time{std::chrono::seconds{kBoot + 8000}});
    EXPECT_EQ(evidence.daemon.options, "-l 6 -f 120");
}

TEST_F(DeviceFilesTest, SettingsAreSignsByTheDaemonsRules) {
    const struct {
        Settings dynamic;
        Sign sign;
        bool isSeen;
    } rows[]{
        {{{"DEVICEID", ""}}, Sign::CREDENTIALS_MISSING, true},
        {{{"ENABLEREMOTEACCESS", "TRUE"}}, Sign::REMOTE_ACCESS_OFF, true},
        {{{"MANUAL_PORT_FORWARD", "true"}}, Sign::MANUAL_MODE, false},
        {{{"MANUAL_PORT_FORWARD", "TRUE"}}, Sign::MANUAL_MODE, true},
        {{{"MANUAL_PORT_FORWARD", "TRUE"}}, Sign::MANUAL_PORT_INVALID, true},
        {{{"MANUAL_PORT_FORWARD", "TRUE"},
          {"MANUAL_EXTERNAL_HTTP_PORT", " 65535"},
          {"MANUAL_EXTERNAL_HTTPS_PORT", "1x"}},
         Sign::MANUAL_PORT_INVALID,
         false},
        {{{"MANUAL_EXTERNAL_HTTP_PORT", "0"}}, Sign::MANUAL_PORT_INVALID, false},
        {{{"DEFAULT_PORTS_ONLY", "TRUE"}}, Sign::DEFAULT_PORTS_ONLY, true},
        {{{"DEVICETYPE", "5"}}, Sign::OWN_ROUTER, true},
    };
    for (const auto& [dynamic, sign, isSeen] : rows) {
        EXPECT_EQ(look({}, dynamic).has(sign), isSeen) << lines(dynamic);
    }
    EXPECT_FALSE(look({{"STATIC_ONLY_KEYS", "ENABLEREMOTEACCESS"}}, {{"ENABLEREMOTEACCESS", "0"}})
                     .has(Sign::REMOTE_ACCESS_OFF));
}

TEST_F(DeviceFilesTest, TheCopyCountsAndIsNotMade) {
    const Settings withCopy{{"DYNAMIC_CONFIG_TMP", path("copy.ini")}};
    EXPECT_EQ(look(withCopy, {{"SUBDOMAIN", "file"}}).setting("SUBDOMAIN"), "file");
    EXPECT_FALSE(fs::exists(path("copy.ini")));
    writeFile("copy.ini", "SUBDOMAIN=copy\n");
    EXPECT_EQ(look(withCopy, {{"SUBDOMAIN", "file"}}).setting("SUBDOMAIN"), "copy");
    fs::remove(path("dynamicconfig.ini"));
    EXPECT_FALSE(lookAtAll().has(Sign::DYNAMIC_FILE_UNREADABLE));
    fs::remove(path("copy.ini"));
    EXPECT_TRUE(lookAtAll().has(Sign::DYNAMIC_FILE_UNREADABLE));
    EXPECT_EQ(lookAtAll().setting("STARTCMD"), "") << "the other file may change it";
    mkfifo(path("dynamicconfig.ini").c_str(), 0600);
    EXPECT_TRUE(lookAtAll().has(Sign::DYNAMIC_FILE_UNREADABLE));
    fs::remove(path("static.ini"));
    const Evidence evidence = lookAtAll();
    EXPECT_TRUE(evidence.has(Sign::STATIC_FILE_UNREADABLE));
    EXPECT_FALSE(evidence.has(Sign::CREDENTIALS_MISSING));
    EXPECT_EQ(evidence.unreadSettings,
              path("static.ini") + " cannot be read: No such file or directory");
}

TEST_F(DeviceFilesTest, TheDaemonIsFoundWithoutItsPidFileButNoOtherProcess) {
    fs::remove(path("pid"));
    EXPECT_TRUE(look().has(Sign::DAEMON_RUNS));
    process(812, "pelorus", "/usr/sbin/pelorus (deleted)");
    EXPECT_TRUE(look().has(Sign::DAEMON_RUNS)) << "updated while it runs";
    process(812, "pelorus", "/usr/sbin/pelorus", {}, "Z");
    EXPECT_TRUE(look().has(Sign::DAEMON_GONE));
    process(812, "pelorus", "/usr/sbin/pelorus", {}, "S", "\t9");
    EXPECT_TRUE(look().has(Sign::DAEMON_GONE)) << "in a container";
    process(812, "pelorus-doctor", "/usr/sbin/pelorus-doctor");
    writeFile("pid", "812\n");
    const Evidence evidence = look();
    EXPECT_TRUE(evidence.has(Sign::DAEMON_GONE));
    EXPECT_TRUE(holds(evidence.signs.at(Sign::DAEMON_GONE).text, "pid 812 is gone"));
    process(90, "pelorus", "/usr/sbin/pelorus");
    EXPECT_EQ(look().daemon.pid, 90) << "the pid was used again";
}

TEST_F(DeviceFilesTest, TheTunnelIsJudgedByItsProcessAndItsFiles) {
    const Settings relayed{{"COMMUNICATION_STATUS", "relayed"}};
    EXPECT_TRUE(look({}, relayed).has(Sign::TUNNEL_GONE));
    EXPECT_TRUE(look({}, relayed).has(Sign::TUNNEL_FILES_UNWRITABLE)) << "no credentials";
    EXPECT_FALSE(look({}, {{"COMMUNICATION_STATUS", "connecting"}}).has(Sign::TUNNEL_GONE));
    writeFile("vpn/auth.txt", std::string{kDeviceId} + "\n");
    writeFile("vpn/pid", "77\n");
    writeFile("vpn/out", "Sequence Completed\n");
    const Evidence up = look({}, relayed);
    EXPECT_EQ(problems(up), "");
    EXPECT_TRUE(up.has(Sign::TUNNEL_SAYS_UP));
    EXPECT_EQ(up.signs.at(Sign::TUNNEL_RUNS).text, "tunnel client up 3 h 20 min (pid 77)");
    EXPECT_TRUE(up.has(Sign::TUNNEL_CLIENT_ALONE));
    process(78, "openvpn", "/usr/sbin/openvpn");
    EXPECT_TRUE(look({}, relayed).has(Sign::SECOND_TUNNEL_CLIENT));
    process(77, "relayd", "/opt/openvpn/bin/relayd");
    EXPECT_TRUE(look({}, relayed).has(Sign::TUNNEL_RUNS)) << "the whole path counts";
    process(77, "bash", "/bin/bash");
    EXPECT_TRUE(look({}, relayed).has(Sign::TUNNEL_GONE));
    const Evidence starting = look({}, {{"COMMUNICATION_STATUS", "connecting"}});
    EXPECT_FALSE(starting.has(Sign::TUNNEL_GONE)) << "a pid file from before";
    writeFile("vpn/out", "AUTH: Received control message: AUTH_FAILED\nprocess exiting\n");
    EXPECT_TRUE(look({}, relayed).has(Sign::TUNNEL_REFUSED));
    const struct {
        const char* status;
        int age;  // seconds
        bool counts;
    } refusals[]{{"failed", 11'999, true},
                 {"failed", 12'001, false},  // older than the daemon
                 {"connecting", 601, false},
                 {"connecting", 599, true}};
    for (const auto& [status, age, counts] : refusals) {
        const auto seconds = static_cast<time_t>(kNow - age);
        const timespec written[2]{{seconds, 0}, {seconds, 0}};
        utimensat(AT_FDCWD, path("vpn/out").c_str(), written, 0);
        const Evidence evidence = look({}, {{"COMMUNICATION_STATUS", status}});
        EXPECT_EQ(evidence.has(Sign::TUNNEL_REFUSED), counts) << status << " " << age;
    }
    writeFile("vpn/auth.txt", "");
    EXPECT_TRUE(holds(problems(look({}, relayed)), "vpn/auth.txt is empty\n"));
    EXPECT_EQ(doctor::tunnelFile(up, "STARTCMD_OUTFILE"), path("vpn/out"));
    EXPECT_EQ(doctor::tunnelFile(up, "UNKNOWN"), "");
    const Evidence noFolder = look({{"OPENVPN_CONFIG_PATH", "/gone"}});
    EXPECT_TRUE(holds(problems(noFolder), "tunnel's files: /gone does not exist\n"));
}

TEST(TunnelOutput, TheLastWordCounts) {
    const std::string up = "2026-11-22 03:08:04 Initialization Sequence Completed\n";
    const std::string ended =
        "2026-11-22 03:08:04 SIGTERM[soft,auth-failure] received, process exiting\n";
    const std::string restarted = "SIGUSR1[soft,ping-restart] received, process restarting\n";
    const std::string refused = "2026-11-22 03:08:04 AUTH: Received control message: AUTH_FAILED\n";
    const std::string closed =
        "2026-11-22 03:14:08 read UDPv4 [ECONNREFUSED]: Connection refused (fd=3,code=111)\n";
    const std::string asks = "UDPv4 link remote: [AF_INET]44.128.0.2:1194\n";
    const std::string unnamed = "RESOLVE: Cannot resolve host address: relay:1194\n";
    const std::string untrusted = "VERIFY ERROR: depth=1, error=certificate is not yet valid\n";
    const std::string failed = "TLS Error: TLS handshake failed\x1b\n";
    const struct {
        std::string output;
        bool isUp;
        std::optional<Sign> trouble;
        std::string line;
    } rows[]{
        {"", false, {}, ""},
        {asks, false, {}, ""},
        {asks + ended, false, Sign::TUNNEL_UNANSWERED, "no answer at all"},
        {asks + "TLS: Initial packet from x\n" + refused + ended, false, Sign::TUNNEL_REFUSED,
         "AUTH: Received control message: AUTH_FAILED"},
        {asks + closed + ended, false, Sign::TUNNEL_UNANSWERED,
         "read UDPv4 [ECONNREFUSED]: Connection refused (fd=3,code=111)"},
        {refused + ended + up, true, {}, ""},
        {up + refused, false, Sign::TUNNEL_REFUSED, "AUTH: Received control message: AUTH_FAILED"},
        {up + ended, false, {}, ""},
        {up + failed, true, Sign::TUNNEL_UNANSWERED, "TLS Error: TLS handshake failed?"},
        {untrusted + restarted + failed, false, Sign::TUNNEL_UNANSWERED,
         "TLS Error: TLS handshake failed?"},
        {up + restarted + untrusted + failed + restarted, false, Sign::RELAY_CERTIFICATE_BAD,
         "VERIFY ERROR: depth=1, error=certificate is not yet valid"},
        {"VERIFY KU ERROR\n" + restarted, false, Sign::RELAY_CERTIFICATE_BAD, "VERIFY KU ERROR"},
        {"VERIFY EKU ERROR\n" + restarted, false, Sign::RELAY_CERTIFICATE_BAD, "VERIFY EKU ERROR"},
        {closed + unnamed + restarted, false, Sign::RELAY_UNRESOLVED,
         "RESOLVE: Cannot resolve host address: relay:1194"},
    };
    for (const auto& [output, isUp, trouble, line] : rows) {
        const auto said = doctor::readTunnelOutput(output, "Sequence Completed");
        EXPECT_EQ(said.isUp, isUp) << output;
        EXPECT_EQ(said.trouble, trouble) << output;
        EXPECT_EQ(said.line, line) << output;
    }
    EXPECT_TRUE(doctor::readTunnelOutput(asks, "").isUp);
}

TEST_F(DeviceFilesTest, ADiskIsUnusedByTheDaemonsRule) {
    for (const char* minutes : {"2\n", "300", "", "\n", "x"}) {
        writeFile("minutes", minutes);
        const Evidence evidence = look();
        EXPECT_FALSE(evidence.has(Sign::DISK_IN_USE)) << minutes;
        EXPECT_EQ(holds(shown(evidence), "disk unused for"), std::isdigit(*minutes) != 0);
    }
    fs::remove(path("minutes"));
    EXPECT_TRUE(holds(problems(look()), "no port test once published"));
    EXPECT_EQ(problems(look({{"DEVICETYPE", "5"}})), "");
}

TEST(Age, IsRoundedDown) {
    const std::pair<int, const char*> rows[]{{-5, "0 s"},
                                             {59, "59 s"},
                                             {60, "1 min"},
                                             {3599, "59 min"},
                                             {3600, "1 h"},
                                             {12'000, "3 h 20 min"},
                                             {86'399, "23 h 59 min"},
                                             {86'400, "1 day"},
                                             {212'400, "2 days 11 h"},
                                             {1'100'000, "12 days"}};
    for (const auto& [seconds, words] : rows) {
        EXPECT_EQ(doctor::ageInWords(std::chrono::seconds{seconds}), words);
    }
}

}  // namespace
}  // namespace pelorus::support
