#include "cloud/url_template.h"

#include "cloud_fixture.h"

namespace pelorus {
namespace {

class UrlTemplateTest : public CloudTest {};

TEST_F(UrlTemplateTest, IsFilledOrRefusedWithOneLine) {
    givenConfig();
    const auto row = [&](const std::string& urlTemplate, const std::string& request,
                         const std::string& logged) {
        log.clear();
        const MaskedUrl url = fillMaskedTemplate(
            "SOME_URL", urlTemplate, {SecretArgument{"id%s7", "*ID*"}, -1, "%d device-7350142"});
        EXPECT_EQ(url.request + "; " + url.logged, request + "; " + logged) << urlTemplate;
        EXPECT_EQ(log.countPart("SOME_URL"), request.empty() ? 1 : 0) << urlTemplate;
    };
    row("/%s/%d/%s", "/id%s7/-1/%d device-7350142", "/*ID*/-1/%d *ID_REMOVED*");
    row("/device-7350142/%s/%u", "/device-7350142/id%s7/4294967295",
        "/*ID_REMOVED*/*ID*/4294967295");
    row("/100%%/%%s%s/%i", "/100%/%sid%s7/-1", "/100%/%s*ID*/-1");
    const std::string cut(1023, 'x');
    row(cut + "x", cut, cut);
    for (const char* const refused : {"%s%d%s%s", "%d", "%s%s", "%10s", "/%s%"})
        row(refused, "", "");
}

}  // namespace
}  // namespace pelorus
