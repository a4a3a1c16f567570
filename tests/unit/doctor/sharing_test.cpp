#include "doctor/sharing.h"

#include <gtest/gtest.h>

#include "doctor/history_picture.h"
#include "doctor/json_report.h"
#include "doctor/text_report.h"
#include "made_up_diagnosis.h"

namespace pelorus::doctor {
namespace {

using Settings = std::map<std::string, std::string>;

TEST(Masks, HideSecretsInEveryForm) {
    struct Row {
        const char *id, *auth, *subdomain, *text, *masked;
    };
    const Row rows[]{
        {"dev7", "a&b=", "smith", "Dev7 a&b= SMITH",
         "*ID_REMOVED* *AUTH_REMOVED* *SUBDOMAIN_REMOVED*"},
        {"dev7", "a&b=", "", "?auth=a%26b%3d", "?auth=*AUTH_REMOVED*"},
        {"dev7", "", "", "nas-devicedev7.kavra.example", "nas-device*ID_REMOVED*.kavra.example"},
        {"77", "", "", "port 7711", "port 7711"},
        {" abc\r", "xabcx", "", "abc xabcx", "*ID_REMOVED* *AUTH_REMOVED*"},
        {"dev7", "", "", "on 203.0.113.7 of nas", "on 203.0.113.7 of nas"}};
    for (const Row& row : rows) {
        const Settings settings{
            {"DEVICEID", row.id}, {"DEVICEAUTH", row.auth}, {"SUBDOMAIN", row.subdomain}};
        EXPECT_EQ((Masks{settings, false, "nas"}.hide(row.text)), row.masked);
    }
}

TEST(Masks, HidePlacesForSharing) {
    // clang-format off
    const char* const rows[][2]{
        {"203.0.113.7:9091, 203.0.113.7.", "address-1:9091, address-1."},
        {"203.0.113.7 and 203.0.113.8", "address-1 and address-2"},
        {"10.0.0.1 172.31.0.1 192.168.1.1 169.254.1.1", "private-address-1 private-address-2 private-address-3 private-address-4"},
        {"100.64.3.9 100.128.0.1", "shared-address-1 address-1"},
        {"127.0.0.1 0.0.0.0 255.255.255.0 ::1 ::", "127.0.0.1 0.0.0.0 255.255.255.0 ::1 ::"},
        {"version 1.7.0-54, 1.2.3.4.5, 1.2.3.400", "version 1.7.0-54, 1.2.3.4.5, 1.2.3.400"},
        {"2001:db8::1 [2001:DB8::1]:80 fe80::1%eth0", "address-1 [address-1]:80 private-address-1%eth0"},
        {"::ffff:1.2.3.4 Router::map 12:07:31", "address-1 Router::map 12:07:31"},
        {"52:54:00:aB:cd:ef 52-54-00-AB-CD-EF", "mac-1 mac-1"},
        {"ip=203.0.113.7&x http://203.0.113.7/", "ip=address-1&x http://address-1/"},
        {"NAS nas.local nasty", "host-1 host-2 nasty"},
        {"https://cloud.tavik.example:443/x", "https://host-1:443/x"},
        {"cloud.tavik.example. relay3.tavik.example nas-devicedev7.tavik.example", "host-1. host-2 host-3"},
        {"7.113.0.203.in-addr.arpa", "address-1.in-addr.arpa"},
        {"LOCAL_... URLs: . :", "LOCAL_... URLs: . :"},
        {"", ""}};
    // clang-format on
    const Settings settings{{"DEVICEID", "dev7"},
                            {"SERVER_BASE_URL", "https://cloud.tavik.example:443/x"}};
    for (const auto& [text, masked] : rows) {
        EXPECT_EQ((Masks{settings, true, "nas"}.hide(text)), masked);
    }
}

TEST(Masks, NothingIsLeftInAnyOutput) {
    const std::string secret = "q\"<&z";
    const std::string text = "x" + secret + " on 203.0.113.9";
    Diagnosis diagnosis = relayed();
    diagnosis.reach = Reach::DIRECT;
    diagnosis.address = diagnosis.ports = diagnosis.daemon.options = text;
    diagnosis.before = Period{Reach::DIRECT, diagnosis.now, text, text};
    diagnosis.causes.front().proofs.front().text = text;
    diagnosis.checks.front().text = diagnosis.history.front().cause = text;
    diagnosis.history.front().address = text;
    diagnosis.untold = {text};
    Masks{{{"DEVICEAUTH", secret}}, true, ""}.hideIn(diagnosis);
    for (const std::string& output :
         {textReport(diagnosis, {}), jsonReport(diagnosis), historyPicture(diagnosis)}) {
        for (const char* part : {"q\"", "q\\\"", "&z", "&amp;z", "203.0.113"}) {
            EXPECT_EQ(output.find(part), std::string::npos) << part << " in " << output;
        }
        EXPECT_NE(output.find("*AUTH_REMOVED*"), std::string::npos);
    }
}

}  // namespace
}  // namespace pelorus::doctor
