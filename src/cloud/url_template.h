// Filling the configured request URLs.
#ifndef PELORUS_CLOUD_URL_TEMPLATE_H
#define PELORUS_CLOUD_URL_TEMPLATE_H

#include <cstddef>
#include <initializer_list>
#include <string>
#include <variant>

namespace pelorus {

/// Longest formatted URL plus one; the rest is cut off.
inline constexpr std::size_t kUrlBufferSize = 1024;

/// A text that must not be logged, and what stands in its place.
struct SecretArgument {
    std::string value;
    const char* mask;
};

/// One argument of a URL template.
using TemplateArgument = std::variant<int, std::string, SecretArgument>;

/// Fills a printf template that comes from configuration: %s takes a text, %d, %i and %u a
/// number, %% is a percent sign. Fewer placeholders than arguments are fine. A template that asks
/// for more, for another kind or for anything else gives an empty URL and one error line that
/// names @p key, the setting the template came from. Secrets appear with their real values.
[[nodiscard]] std::string fillTemplate(const std::string& key,
                                       const std::string& urlTemplate,
                                       std::initializer_list<TemplateArgument> arguments);

/// A request as it goes over the wire and as it may be logged.
struct MaskedUrl {
    std::string request;  ///< with the real credentials: never log it
    std::string logged;   ///< with masks in their place
};

/// As fillTemplate, for a request that carries secrets or text from outside, which could hold one
/// and is scrubbed. A bad template is reported once and leaves both texts empty.
[[nodiscard]] MaskedUrl fillMaskedTemplate(const std::string& key,
                                           const std::string& urlTemplate,
                                           std::initializer_list<TemplateArgument> arguments);

}  // namespace pelorus

#endif
