// Buffers for the texts of a gateway's answer.
#ifndef PELORUS_ROUTER_REPLY_TEXT_H
#define PELORUS_ROUTER_REPLY_TEXT_H

#include <array>
#include <cstddef>

namespace pelorus {

/// A cleared buffer that the UPnP library fills with one text. It has one byte more than the
/// @p Size the library documents, so the text always ends, even when the library fills all of its
/// share.
template <std::size_t Size>
class ReplyText {
public:
    [[nodiscard]] char* buffer() { return bytes.data(); }
    /// What the library may use, in bytes.
    [[nodiscard]] static constexpr int documented() { return static_cast<int>(Size); }

    [[nodiscard]] const char* text() const { return bytes.data(); }
    [[nodiscard]] bool empty() const { return bytes.front() == '\0'; }

private:
    std::array<char, Size + 1> bytes{};
};

}  // namespace pelorus

#endif
