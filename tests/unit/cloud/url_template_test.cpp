#include "cloud/url_template.h"

#include <string>

#include "cloud_fixture.h"

namespace pelorus {

namespace {

struct Row : Case {
    const char* urlTemplate;
    const char* request;
    const char* logged;
    bool refused;
};

class UrlTemplate : public CloudTest, public ::testing::WithParamInterface<Row> {};

TEST_P(UrlTemplate, IsFilledOrRefusedWithOneLine) {
    const Row& row = GetParam();
    givenConfig();
    const MaskedUrl url = fillMaskedTemplate(
        "SOME_URL", row.urlTemplate, {SecretArgument{"id%s7", "*ID*"}, -1, "%d device-7350142"});
    EXPECT_EQ(url.request, row.request);
    EXPECT_EQ(url.logged, row.logged);
    EXPECT_EQ(log.lines().size(), row.refused ? 1U : 0U) << log.dump();
    EXPECT_EQ(log.countPart("SOME_URL"), row.refused ? 1 : 0);
}

INSTANTIATE_TEST_SUITE_P(
    Rows,
    UrlTemplate,
    ::testing::Values(
        Row{{"SecretsShowTheirMasksAlsoInOtherText"},
            "/%s/%d/%s",
            "/id%s7/-1/%d device-7350142",
            "/*ID*/-1/%d *ID_REMOVED*",
            false},
        Row{{"EveryNumberKindIsKnown"}, "/%s/%i", "/id%s7/-1", "/*ID*/-1", false},
        Row{{"UnsignedNumbersWrap"}, "/%s/%u", "/id%s7/4294967295", "/*ID*/4294967295", false},
        Row{{"TwoPercentSignsAreOne"}, "/100%%/%%s", "/100%/%s", "/100%/%s", false},
        Row{{"AnEmptyTemplateIsAnEmptyUrl"}, "", "", "", false},
        Row{{"TooManyPlaceholdersAreRefused"}, "%s%d%s%s", "", "", true},
        Row{{"ATextIsNoNumber"}, "%d", "", "", true},
        Row{{"ANumberIsNoText"}, "%s%s", "", "", true},
        Row{{"AWriteThroughPlaceholderIsRefused"}, "%n", "", "", true},
        Row{{"AWidthIsRefused"}, "%10s", "", "", true},
        Row{{"ATrailingPercentSignIsRefused"}, "/%s%", "", "", true}),
    CaseName{});

class UrlTemplateTest : public CloudTest {};

TEST_F(UrlTemplateTest, LongUrlsAreCut) {
    const std::string url = fillTemplate("SOME_URL", "/%s", {std::string(2000, 'x')});
    EXPECT_EQ(url, "/" + std::string(1022, 'x'));
}

}  // namespace

}  // namespace pelorus
