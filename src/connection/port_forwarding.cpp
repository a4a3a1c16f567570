#include "connection/port_forwarding.h"

#include "cloud/tavik_client.h"
#include "common/text.h"
#include "config/global_config.h"

namespace pelorus {

int readPort(const char* key, int defaultPort) {
    return scanInt(setting(key).c_str()).value_or(defaultPort);
}

void reportAnalytics(const char* status, ConnectionSubType subType) {
    TavikClient::getInstance()->sendAnalytics(status, PORTFORWARDED, subType);
}

}  // namespace pelorus
