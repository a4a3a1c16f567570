#include "config/scrub.h"

#include "support/fixture.h"

namespace pelorus::support {
namespace {

using ScrubTest = PelorusTest;

TEST_F(ScrubTest, ReplacesSecretsByMasks) {
    // clang-format off
    const char* const rows[][5]{  // id, authorisation, subdomain, text, masked text
        {"id", "", "", "any id", "any *ID_REMOVED*"},
        {"id", "", "", "id\n\nforged", "*ID_REMOVED*  forged"},
        {"77", "a77b", "x77", "a77b x77 7777", "*AUTH_REMOVED* *SUBDOMAIN_REMOVED* *ID_REMOVED**ID_REMOVED*"},
        {"device7\r", "auth9\r", "Smith\r", "DEVICE7 auth9 smith", "*ID_REMOVED* *AUTH_REMOVED* *SUBDOMAIN_REMOVED*"}};
    // clang-format on
    for (const auto& [id, auth, subdomain, text, masked] : rows) {
        setConfig("DEVICEID", id);
        setConfig("DEVICEAUTH", auth);
        setConfig("SUBDOMAIN", subdomain);
        EXPECT_EQ(scrubSecrets(text), masked);
    }
}

}  // namespace
}  // namespace pelorus::support
