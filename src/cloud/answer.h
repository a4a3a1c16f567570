// The answer of a web server, and the request to the local one.
#ifndef PELORUS_CLOUD_ANSWER_H
#define PELORUS_CLOUD_ANSWER_H

#include <optional>
#include <string>

namespace pelorus {

/// The body of an answer. It is read as a C string: what follows a NUL byte is ignored.
struct Answer {
    /// Copies @p bytes received; null @p data or a count that is not positive is an empty body.
    Answer(const char* data, int bytes);

    std::string text;
    int size;  ///< bytes received, including those behind a NUL
};

/// Asks the device's own web back end, in plain HTTP. Nothing when there was no answer, nor for an
/// empty URL.
[[nodiscard]] std::optional<Answer> fetchLocal(const std::string& url);

}  // namespace pelorus

#endif
