// What a web server answered, and how the local one is asked.
#ifndef PELORUS_CLOUD_ANSWER_H
#define PELORUS_CLOUD_ANSWER_H

#include <optional>
#include <string>

namespace pelorus {

/// The body of an answer. Answers are read as C strings: what follows a NUL byte is not seen.
struct Answer {
    /// Copies what was received; a null @p data or a negative count is an empty body.
    Answer(const char* data, int bytes);

    std::string text;
    int size;  ///< bytes received, those behind a NUL included
};

/// Asks the device's own web back end, in plain HTTP. Nothing when it did not answer, which holds
/// for an empty URL too.
[[nodiscard]] std::optional<Answer> fetchLocal(const std::string& url);

}  // namespace pelorus

#endif
