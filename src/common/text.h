// Small text helpers.
#ifndef PELORUS_COMMON_TEXT_H
#define PELORUS_COMMON_TEXT_H

#include <cstdint>
#include <optional>
#include <string>

namespace pelorus {

/// True when @p part occurs anywhere in @p text (case-sensitive).
[[nodiscard]] bool contains(const std::string& text, const std::string& part);

/// Replaces every occurrence of @p search in @p subject by @p replace, from left to right;
/// replaced text is not searched again. An empty @p search does nothing.
void replaceAll(std::string& subject, const std::string& search, const std::string& replace);

/// The number at the start of @p text as scanf("%d") reads it: leading white space is skipped, what
/// follows the digits is ignored. Nothing when @p text is null, holds no number, or one that does
/// not fit. The same for scanInt64 ("%jd") and scanUnsigned ("%u", which accepts a minus sign and
/// wraps).
[[nodiscard]] std::optional<int> scanInt(const char* text);
[[nodiscard]] std::optional<std::int64_t> scanInt64(const char* text);
[[nodiscard]] std::optional<unsigned> scanUnsigned(const char* text);

/// The number at the start of @p text, or 0, as atoi gives it.
[[nodiscard]] int leadingInt(const std::string& text);

}  // namespace pelorus

#endif
