#include "config/scrub.h"

#include "support/fixture.h"

namespace pelorus::support {
namespace {

struct Row {
    const char* name;
    const char* id;
    const char* auth;
    const char* subdomain;
    const char* text;
    const char* wanted;
};

class Scrub : public PelorusTest, public ::testing::WithParamInterface<Row> {};

TEST_P(Scrub, PutsMasksInPlaceOfSecrets) {
    const Row& row = GetParam();
    givenConfig({}, {{"DEVICEID", row.id}, {"DEVICEAUTH", row.auth}, {"SUBDOMAIN", row.subdomain}});
    EXPECT_EQ(scrubSecrets(row.text), row.wanted);
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    Scrub,
    ::testing::Values(Row{"EmptySecretsReplaceNothing", "", "", "", "any text", "any text"},
                      Row{"ASecretWithinAnotherLeavesNoRest", "77", "a77b", "x77", "a77b x77 7777",
                          "*AUTH_REMOVED* *SUBDOMAIN_REMOVED* *ID_REMOVED**ID_REMOVED*"},
                      Row{"ACarriageReturnOfTheFileDoesNotHideASecret", "device7\r", "auth9\r",
                          "smith\r", "device7 auth9 smith",
                          "*ID_REMOVED* *AUTH_REMOVED* *SUBDOMAIN_REMOVED*"},
                      Row{"NamesHaveNoCase", "Device7", "auth9", "Smith",
                          "smith.DEVICE7.kavra.example",
                          "*SUBDOMAIN_REMOVED*.*ID_REMOVED*.kavra.example"}),
    RowName{});

}  // namespace
}  // namespace pelorus::support
