#include "doctor/line_order.h"

#include <algorithm>
#include <cstdint>
#include <functional>
#include <utility>

namespace pelorus::doctor {

void KnownLines::add(const LogLine& line) {
    for (const std::size_t place : places(line)) bits[place] = true;
}

bool KnownLines::has(const LogLine& line) const {
    const auto all = places(line);
    return std::all_of(all.begin(), all.end(), [this](std::size_t place) { return bits[place]; });
}

std::array<std::size_t, 2> KnownLines::places(const LogLine& line) {
    constexpr std::uint64_t kMix = 0x9E3779B97F4A7C15U;
    constexpr std::uint64_t kMask = (std::uint64_t{1} << kBits) - 1;
    const auto stamp = static_cast<std::uint64_t>(line.when.time_since_epoch().count());
    const std::uint64_t text = std::hash<std::string_view>{}(line.text);
    const std::uint64_t hash = (text ^ (stamp * kMix)) * kMix;
    const auto place = [hash](unsigned shift) {
        return static_cast<std::size_t>((hash >> shift) & kMask);
    };
    return {place(64 - kBits), place(64 - 2 * kBits)};
}

void LineOrder::beginFile() {
    isFirst = true;
    repeating = false;
    // A clock that once ran ahead must not hide what came later.
    newest = std::min(story.end().value_or(Time{}), now);
}

void LineOrder::endFile(std::optional<Time> stamp) {
    if (stamp) last = stamp;
}

void LineOrder::take(std::string_view text) {
    const auto line = readLogLine(text, now);
    if (!line) {
        if (lacksStamp(text, now)) ++left;
        return;
    }
    // A file that repeats lines begins with one. Old stamps alone may come from a clock set back.
    if (std::exchange(isFirst, false)) repeating = known.has(*line);
    if (line->when > newest) repeating = false;
    if (repeating && (line->when < newest || known.has(*line))) return;
    known.add(*line);
    if (line->host != lastHost) meet(line->host);
    story.take(*line);
}

void LineOrder::meet(std::string_view host) {
    constexpr std::size_t kMostHosts = 1000;
    lastHost = host;
    if (met.size() < kMostHosts) met.insert(lastHost);
}

}  // namespace pelorus::doctor
