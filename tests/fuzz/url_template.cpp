// URL templates: whatever they hold, the result fits and only the request shows secrets.
#include "cloud/url_template.h"

#include "fuzz_world.h"

// The first byte cuts the rest in two: a template and a text argument.
void pelorus::fuzz::tryText(const std::string& text) {
    begin("3");
    if (text.empty()) return;
    const std::size_t cut = static_cast<unsigned char>(text[0]) % text.size();
    const std::string urlTemplate = text.substr(1, cut);
    const MaskedUrl url =
        fillMaskedTemplate("KEY", urlTemplate,
                           {SecretArgument{kDeviceId, "*ID_REMOVED*"}, -5, text.substr(1 + cut),
                            SecretArgument{kDeviceAuth, "*AUTH_REMOVED*"}});
    assert(url.request.size() < kUrlBufferSize && url.logged.size() < kUrlBufferSize);
    const bool refused = support::LogCapture::get().countPart("KEY") != 0;
    assert(!refused || (url.request + url.logged).empty());
    assert(refused || urlTemplate.empty() || !url.request.empty() || urlTemplate[0] == '%');
    for (const std::string secret : {kDeviceId, kDeviceAuth}) {
        const bool mayComeFromTemplate = urlTemplate.find_first_of(secret) != std::string::npos;
        assert(mayComeFromTemplate || url.logged.find(secret) == std::string::npos);
    }
}
