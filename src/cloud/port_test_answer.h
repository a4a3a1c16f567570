// Reading the server's answer to a port test.
#ifndef PELORUS_CLOUD_PORT_TEST_ANSWER_H
#define PELORUS_CLOUD_PORT_TEST_ANSWER_H

#include <cstddef>
#include <optional>
#include <string>

namespace pelorus {

/// The text between two tags, and its place in the answer.
struct TaggedText {
    std::string text;       ///< empty when the closing tag comes before @p start
    std::size_t start = 0;  ///< offset behind the opening tag
    std::size_t end = 0;    ///< offset of the closing tag
};

/// What an answer says. A part that is missing is absent or empty.
struct PortTestAnswer {
    bool passed = false;                      ///< the server reached the port
    std::optional<TaggedText> remoteAddress;  ///< the public address the server saw
    /// The address the server tested. Only its closing tag is required: without the opening one
    /// the text starts where it would if that tag stood one character before the answer.
    std::optional<TaggedText> testedAddress;
    std::string requestedDevice;   ///< identifier the request named
    std::string respondingDevice;  ///< identifier of the device that answered on the port
};

/// Reads @p text, in which tags are searched, not parsed. An empty text is a test not passed.
[[nodiscard]] PortTestAnswer readPortTestAnswer(const std::string& text);

}  // namespace pelorus

#endif
