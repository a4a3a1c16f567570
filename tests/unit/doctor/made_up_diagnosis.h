// Diagnoses of no device in particular.
#ifndef PELORUS_UNIT_DOCTOR_MADE_UP_DIAGNOSIS_H
#define PELORUS_UNIT_DOCTOR_MADE_UP_DIAGNOSIS_H

#include <cstdlib>
#include <ctime>

#include "doctor/diagnosis.h"

namespace pelorus::doctor {

using std::chrono::hours;
using std::chrono::minutes;
using std::chrono::seconds;

/// 22 November 2026, 15:27 in UTC, which becomes the local time.
inline Time noonish() {
    setenv("TZ", "UTC", 1);
    tzset();
    return Time{seconds{1795361220}};
}

inline const Cause kSecondNat{"second-nat",
                              {Reach::RELAYED},
                              {},
                              {},
                              "A second router stands in front of your gateway.",
                              "Put the provider's box into bridge mode."};

/// Relayed since 12:07, direct for twelve days before.
inline Diagnosis relayed() {
    const Time now = noonish();
    const Time since = now - minutes{200};
    Diagnosis diagnosis;
    diagnosis.now = now;
    diagnosis.reach = Reach::RELAYED;
    diagnosis.since = since;
    diagnosis.history = {{Reach::DIRECT, since - hours{12 * 24}, "203.0.113.7", "ports forwarded"},
                         {Reach::RELAYED, since, "", "second router found by the port test"}};
    diagnosis.before = diagnosis.history.front();
    diagnosis.causes = {{&kSecondNat,
                         {{Source::NOW, "the gateway says 100.64.3.9", {}},
                          {Source::LOG, "the service sees 203.0.113.7", since}}}};
    diagnosis.checks = {{Check::Verdict::OK, Source::NOW, "daemon up 12 days (pid 812)"},
                        {Check::Verdict::OK, Source::NOW, "web server answers on 80 and 443"},
                        {Check::Verdict::PROBLEM, Source::NOW, "gateway has a shared address"},
                        {Check::Verdict::NOT_SEEN, Source::SETTINGS, "copy: not root"}};
    diagnosis.daemon = {812, now - hours{12 * 24}, "-l 6 -f 120", now + seconds{40}};
    return diagnosis;
}

}  // namespace pelorus::doctor

#endif
