#include "cloud/url_template.h"

#include <string>

#include "cloud_fixture.h"

namespace pelorus {
namespace {

class UrlTemplateTest : public CloudTest {};

TEST_F(UrlTemplateTest, IsFilledOrRefusedWithOneLine) {
    givenConfig();
    const auto row = [&](const char* name, const std::string& urlTemplate,
                         const std::string& request, const std::string& logged) {
        SCOPED_TRACE(name);
        log.clear();
        const MaskedUrl url = fillMaskedTemplate(
            "SOME_URL", urlTemplate, {SecretArgument{"id%s7", "*ID*"}, -1, "%d device-7350142"});
        EXPECT_EQ(url.request, request);
        EXPECT_EQ(url.logged, logged);
        EXPECT_EQ(log.countPart("SOME_URL"), request.empty() ? 1 : 0) << log.dump();
    };
    const std::string cut(1023, 'x');
    // clang-format off
    row("secrets show their masks, also in other text", "/%s/%d/%s", "/id%s7/-1/%d device-7350142", "/*ID*/-1/%d *ID_REMOVED*");
    row("unsigned numbers wrap", "/%s/%u", "/id%s7/4294967295", "/*ID*/4294967295");
    row("a secret in the template is masked", "/device-7350142/%s/%i", "/device-7350142/id%s7/-1", "/*ID_REMOVED*/*ID*/-1");
    row("two percent signs are one", "/100%%/%%s", "/100%/%s", "/100%/%s");
    row("long URLs are cut", cut + "x", cut, cut);
    row("too many placeholders are refused", "%s%d%s%s", "", "");
    row("a text is no number", "%d", "", "");
    row("a number is no text", "%s%s", "", "");
    row("a width is refused", "%10s", "", "");
    row("a trailing percent sign is refused", "/%s%", "", "");
    // clang-format on
}

}  // namespace
}  // namespace pelorus
