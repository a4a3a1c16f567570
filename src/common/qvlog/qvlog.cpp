#include "qvlog.h"

#include <syslog.h>

#include <cstdarg>
#include <string>

namespace {
constexpr int kTextValue = 3;
}

void __qvlog_kvp(int /*level*/, const char* event, ...) {
    std::string line = event;
    va_list pairs;
    va_start(pairs, event);
    for (const char* key = va_arg(pairs, const char*); key != nullptr;
         key = va_arg(pairs, const char*)) {
        if (va_arg(pairs, int) != kTextValue) break;
        line.append(" ").append(key).append("=").append(va_arg(pairs, const char*));
    }
    va_end(pairs);
    syslog(LOG_INFO, "%s", line.c_str());
}
