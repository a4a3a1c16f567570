// Names and interfaces of a test: getifaddrs, getaddrinfo, gethostname and the calls that release
// their lists end here.
#ifndef PELORUS_SUPPORT_FAKE_NET_H
#define PELORUS_SUPPORT_FAKE_NET_H

#include <ifaddrs.h>
#include <net/if.h>
#include <netdb.h>

#include <map>
#include <memory>

#include "support/fake.h"

namespace pelorus::support {

class FakeNet : public Single<FakeNet> {
public:
    struct Interface {
        std::string name;
        /// Dotted IPv4 or IPv6; "link" for a hardware address; empty for none at all (null).
        std::string address;
        unsigned flags = IFF_UP | IFF_RUNNING;
    };

    /// The entries of getifaddrs, in order.
    void setInterfaces(std::vector<Interface> list) { interfaces = std::move(list); }
    void failInterfaces(bool fail = true) { interfacesFail = fail; }
    /// The answer of gethostname.
    void setHostname(const std::string& name) { hostname = name; }
    void failHostname() { hostnameFails = true; }
    /// The addresses of a name, in the order of the answer. A name nobody set is not known. As in
    /// libc a lookup without a socket type lists each address three times.
    void setName(const std::string& name, const std::vector<std::string>& addresses) {
        names[name] = addresses;
    }
    /// The names that were looked up so far.
    [[nodiscard]] const std::vector<std::string>& lookups() const { return asked; }
    /// Fails the test when a list was not released.
    void checkReleased() const;

    std::vector<Interface> interfaces{{"lo", "127.0.0.1", IFF_UP | IFF_RUNNING | IFF_LOOPBACK},
                                      {"eth0", "192.168.77.10"}};
    bool interfacesFail = false;
    std::string hostname = "nas";
    bool hostnameFails = false;
    std::map<std::string, std::vector<std::string>> names;
    std::vector<std::string> asked;
    std::map<void*, std::shared_ptr<void>> lists;  ///< not yet released, by their first entry
};

}  // namespace pelorus::support

#endif
