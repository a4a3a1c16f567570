// Small text operations without a home of their own.
#ifndef PELORUS_COMMON_TEXT_H
#define PELORUS_COMMON_TEXT_H

#include <cstdint>
#include <string>

namespace pelorus {

/// True when @p text holds @p part anywhere (case-sensitive).
[[nodiscard]] bool contains(const std::string& text, const std::string& part);

/// Replaces every occurrence of @p search in @p subject by @p replace, from left to right;
/// replaced text is not searched again. An empty @p search does nothing.
void replaceAll(std::string& subject, const std::string& search, const std::string& replace);

/// Reads the number at the start of @p text as scanf("%d") does: leading white space is skipped,
/// what follows the digits is ignored. False, and @p value untouched, when there is no number or
/// it does not fit. The same for scanInt64 ("%jd") and scanUnsigned ("%u", which accepts a minus
/// sign and wraps).
[[nodiscard]] bool scanInt(const char* text, int& value);
[[nodiscard]] bool scanInt64(const char* text, std::int64_t& value);
[[nodiscard]] bool scanUnsigned(const char* text, unsigned& value);

/// The number at the start of @p text, or 0, as atoi gives it.
[[nodiscard]] int leadingInt(const std::string& text);

}  // namespace pelorus

#endif
