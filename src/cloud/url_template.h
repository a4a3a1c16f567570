// Filling the configured request URLs.
#ifndef PELORUS_CLOUD_URL_TEMPLATE_H
#define PELORUS_CLOUD_URL_TEMPLATE_H

#include <cstddef>
#include <initializer_list>
#include <string>
#include <variant>

namespace pelorus {

/// Size of a formatted URL in bytes, terminator included; the rest is cut off.
inline constexpr std::size_t kUrlBufferSize = 1024;

/// A text that must not be logged, and what is logged in its place.
struct SecretArgument {
    std::string value;
    const char* mask;
};

/// One argument of a URL template.
using TemplateArgument = std::variant<int, std::string, SecretArgument>;

/// Fills a printf template from the configuration: %s takes a text, %d, %i and %u a number, %% is a
/// percent sign. Arguments may be left over. Too many placeholders, or one of the wrong kind, give
/// an empty URL and one error line that names @p key, the setting the template came from. Secrets
/// appear with their real values.
[[nodiscard]] std::string fillTemplate(const std::string& key,
                                       const std::string& urlTemplate,
                                       std::initializer_list<TemplateArgument> arguments);

/// A request as it is sent and as it may be logged.
struct MaskedUrl {
    std::string request;  ///< with the real credentials: never log it
    std::string logged;   ///< with masks in their place
};

/// As fillTemplate, for a request with secrets. The logged text is scrubbed as well: the template
/// and the other arguments may hold a secret, too. A bad template is reported once and leaves both
/// texts empty.
[[nodiscard]] MaskedUrl fillMaskedTemplate(const std::string& key,
                                           const std::string& urlTemplate,
                                           std::initializer_list<TemplateArgument> arguments);

}  // namespace pelorus

#endif
