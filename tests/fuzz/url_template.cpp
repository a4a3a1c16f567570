// URL templates: whatever they hold, the result fits and only the request shows secrets.
#include "cloud/url_template.h"

#include <algorithm>

#include "fuzz_world.h"

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace pelorus;
    fuzz::begin("3");
    // The first byte cuts the rest in two: a template and a text argument.
    const std::string input = fuzz::asText(data, size);
    const std::size_t cut = size == 0 ? 0 : data[0] % size;
    const std::string urlTemplate = size == 0 ? "" : input.substr(1, cut);
    const std::string text = size == 0 ? "" : input.substr(1 + cut);
    const MaskedUrl url =
        fillMaskedTemplate("KEY", urlTemplate,
                           {SecretArgument{fuzz::kDeviceId, "*ID_REMOVED*"}, -5, text,
                            SecretArgument{fuzz::kDeviceAuth, "*AUTH_REMOVED*"}});
    fuzz::require(std::max(url.request.size(), url.logged.size()) < kUrlBufferSize, "it fits");
    const bool refused = support::LogCapture::get().countPart("KEY") != 0;
    fuzz::require(!refused || (url.request.empty() && url.logged.empty()), "refused is empty");
    fuzz::require(refused || urlTemplate.empty() || !url.request.empty() || urlTemplate[0] == '%',
                  "a template gives a URL");
    for (const std::string secret : {fuzz::kDeviceId, fuzz::kDeviceAuth}) {
        const bool mayComeFromTemplate = urlTemplate.find_first_of(secret) != std::string::npos;
        fuzz::require(mayComeFromTemplate || url.logged.find(secret) == std::string::npos,
                      "no secret in the logged URL");
    }
    return 0;
}
