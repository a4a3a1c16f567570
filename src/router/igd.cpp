#include "router/igd.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <ctime>

#include "common/miniupnpc_api.h"
#include "common/stop_budget.h"

namespace pelorus {

namespace {

constexpr std::size_t kPortDigits = 5;

// A mapping's index is a 16-bit number. A gateway that answers for a higher index would never stop.
constexpr int kLastMappingIndex = 65535;
// A gateway that lies or stalls must not block the daemon, least of all during shutdown.
constexpr std::int64_t kLongestEnumeration = 60;  // seconds

// A cleared buffer for one text of the library. It has one byte more than the @p Size the library
// documents, so the text always ends, even when the library fills all of its share.
template <std::size_t Size>
class ReplyText {
public:
    [[nodiscard]] char* buffer() { return bytes.data(); }
    [[nodiscard]] std::string text() const { return std::string{bytes.data()}; }

private:
    std::array<char, Size + 1> bytes{};
};

// One mapping in the library's sizes.
struct EntryTexts {
    ReplyText<6> externalPort;
    ReplyText<16> internalClient;
    ReplyText<6> internalPort;
    ReplyText<4> protocol;
    ReplyText<80> description;
    ReplyText<4> enabled;
    ReplyText<64> remoteHost;
    ReplyText<16> lease;

    [[nodiscard]] IgdEntry entry(int status) const {
        return {status,          externalPort.text(), internalClient.text(), internalPort.text(),
                protocol.text(), description.text(),  enabled.text(),        lease.text()};
    }
};

// A number as the library's six-byte port buffers hold it: a longer one, as a negative port may be,
// loses what is beyond the fifth character.
std::string portText(int port) {
    return std::to_string(port).substr(0, kPortDigits);
}

}  // namespace

IgdAddress Igd::externalAddress() const {
    ReplyText<16> address;
    const int status = miniupnpc::call(UPNP_GetExternalIPAddress, controlUrl.c_str(),
                                       serviceType.c_str(), address.buffer());
    return {status, address.text()};
}

IgdEntry Igd::entry(int externalPort, const std::string& protocol) const {
    EntryTexts texts;
    const int status = miniupnpc::getSpecificPortMappingEntry(
        controlUrl.c_str(), serviceType.c_str(), portText(externalPort).c_str(), protocol.c_str(),
        texts.internalClient.buffer(), texts.internalPort.buffer(), texts.description.buffer(),
        texts.enabled.buffer(), texts.lease.buffer());
    return texts.entry(status);
}

int Igd::add(int externalPort,
             int internalPort,
             const std::string& client,
             const std::string& description,
             const std::string& protocol) const {
    return miniupnpc::call(UPNP_AddPortMapping, controlUrl.c_str(), serviceType.c_str(),
                           portText(externalPort).c_str(), portText(internalPort).c_str(),
                           client.c_str(), description.c_str(), protocol.c_str(), nullptr, nullptr);
}

int Igd::remove(int externalPort, const std::string& protocol) const {
    return miniupnpc::call(UPNP_DeletePortMapping, controlUrl.c_str(), serviceType.c_str(),
                           portText(externalPort).c_str(), protocol.c_str(), nullptr);
}

bool Igd::forEach(const std::function<bool(const IgdEntry&)>& visit) const {
    const std::int64_t end = std::time(nullptr) + kLongestEnumeration;
    for (int index = 0; index <= kLastMappingIndex && std::time(nullptr) <= end; ++index) {
        if (stopBudgetSpent()) break;
        EntryTexts texts;
        const int status = miniupnpc::call(
            UPNP_GetGenericPortMappingEntry, controlUrl.c_str(), serviceType.c_str(),
            portText(index).c_str(), texts.externalPort.buffer(), texts.internalClient.buffer(),
            texts.internalPort.buffer(), texts.protocol.buffer(), texts.description.buffer(),
            texts.enabled.buffer(), texts.remoteHost.buffer(), texts.lease.buffer());
        if (status != 0 || !visit(texts.entry(status))) return false;
    }
    return true;
}

}  // namespace pelorus
