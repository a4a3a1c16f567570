#include "config/scrub.h"

#include "support/fixture.h"

namespace pelorus::support {
namespace {

using ScrubTest = PelorusTest;

TEST_F(ScrubTest, MasksStandInPlaceOfSecrets) {
    struct Row {
        const char* id;
        const char* auth;
        const char* subdomain;
        const char* text;
        const char* wanted;
    };
    for (const auto& [id, auth, subdomain, text, wanted] :
         std::initializer_list<Row>{{"", "", "", "any text", "any text"},
                                    {"77", "a77b", "x77", "a77b x77 7777",
                                     "*AUTH_REMOVED* *SUBDOMAIN_REMOVED* *ID_REMOVED**ID_REMOVED*"},
                                    {"device7\r", "auth9\r", "smith\r", "device7 auth9 smith",
                                     "*ID_REMOVED* *AUTH_REMOVED* *SUBDOMAIN_REMOVED*"},
                                    {"Device7", "auth9", "Smith", "smith.DEVICE7.kavra.example",
                                     "*SUBDOMAIN_REMOVED*.*ID_REMOVED*.kavra.example"}}) {
        setConfig("DEVICEID", id);
        setConfig("DEVICEAUTH", auth);
        setConfig("SUBDOMAIN", subdomain);
        EXPECT_EQ(scrubSecrets(text), wanted);
    }
}

}  // namespace
}  // namespace pelorus::support
