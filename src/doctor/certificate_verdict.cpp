#include "doctor/certificate_verdict.h"

#include <array>
#include <cstdlib>

#include "common/text.h"

namespace pelorus::doctor {

namespace {

constexpr std::time_t kOneDay = 24L * 3600;

struct Row {
    const char* part;  // of the message
    const char* words;
};

constexpr const char* kExpired = "has expired";
constexpr const char* kNotYetValid = "is not valid yet";

// The messages of OpenSSL, GnuTLS, mbedTLS, wolfSSL and libcurl itself.
constexpr std::array<Row, 14> kRows{{
    {"not yet valid", kNotYetValid},
    {"not activated yet", kNotYetValid},
    {"starts in the future", kNotYetValid},
    {"before date", kNotYetValid},
    {"has expired", kExpired},
    {"expiration date has passed", kExpired},
    {"validity has expired", kExpired},
    {"after date", kExpired},
    {"does not match", "is for another name"},
    {"no alternative certificate subject name", "is for another name"},
    {"self", "is self-signed"},
    {"issuer", "is from an unknown authority"},
    {"CAfile", "is from an unknown authority"},
    {"revoked", "has been revoked"},
}};

std::string day(std::time_t when, bool withTime = false) {
    std::tm parts{};
    if (gmtime_r(&when, &parts) == nullptr) return "?";
    std::array<char, 32> text{};
    const std::size_t size = std::strftime(text.data(), text.size(),
                                           withTime ? "%Y-%m-%d %H:%M UTC" : "%Y-%m-%d", &parts);
    return {text.data(), size};
}

bool isValidAt(std::time_t when, const ServiceTimes& times) {
    return (!times.notBefore || when >= *times.notBefore) &&
           (!times.notAfter || when <= *times.notAfter);
}

}  // namespace

std::string certificateFault(const std::string& message) {
    for (const Row& row : kRows) {
        if (contains(message, row.part)) return row.words;
    }
    return "cannot be verified";
}

bool mayBeTheClock(const std::string& fault) {
    return fault == kExpired || fault == kNotYetValid;
}

std::optional<std::string> clockFault(std::time_t now, const ServiceTimes& times) {
    if (times.date) {
        const bool isNear = now - *times.date <= kOneDay && *times.date - now <= kOneDay;
        const bool isDecisive = !isValidAt(now, times) && isValidAt(*times.date, times);
        if (isNear && !isDecisive) return std::nullopt;
        return "this device says " + day(now, isNear) + ", the service says " +
               day(*times.date, isNear);
    }
    const std::string here = "this device says " + day(now) + ", the service";
    if (!times.notBefore || now >= *times.notBefore) return std::nullopt;
    return here + "'s certificate is of " + day(*times.notBefore);
}

}  // namespace pelorus::doctor
