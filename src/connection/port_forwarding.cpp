#include "connection/port_forwarding.h"

#include "cloud/tavik_client.h"
#include "common/text.h"
#include "config/global_config.h"

namespace pelorus {

int readPort(const char* key, int defaultPort) {
    int port = defaultPort;
    return scanInt(setting(key).c_str(), port) ? port : defaultPort;
}

void reportAnalytics(const char* status, ConnectionSubType subType) {
    TavikClient::getInstance()->sendAnalytics(status, PORTFORWARDED, subType);
}

}  // namespace pelorus
