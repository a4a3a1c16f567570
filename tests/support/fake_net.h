// Names and interfaces of a test: getifaddrs, getaddrinfo, gethostname and the release of their
// lists end here.
#ifndef PELORUS_SUPPORT_FAKE_NET_H
#define PELORUS_SUPPORT_FAKE_NET_H

#include <net/if.h>

#include <map>
#include <memory>

#include "support/fake.h"

namespace pelorus::support {

struct FakeNet : Single<FakeNet> {
    struct Interface {
        std::string name;
        /// IPv4 or IPv6; "link" for a hardware address; empty for none at all (null).
        std::string address;
        unsigned flags = IFF_UP | IFF_RUNNING;
    };

    /// Fails the test when a list was not released.
    void checkReleased() const { EXPECT_TRUE(lists.empty()); }

    std::vector<Interface> interfaces{{"lo", "127.0.0.1", IFF_UP | IFF_RUNNING | IFF_LOOPBACK},
                                      {"eth0", "192.168.77.10"}};
    bool interfacesFail = false;
    std::string hostname = "nas";
    bool hostnameFails = false;
    std::map<std::string, Texts> names;                  ///< their addresses; others are not known
    std::function<void(const std::string&)> onLookup{};  ///< runs before a name is looked up
    Texts lookups;                                       ///< the names that were looked up
    std::map<void*, std::shared_ptr<void>> lists;        ///< not yet released, by their first entry
};

}  // namespace pelorus::support

#endif
