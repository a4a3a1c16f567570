// Names and interfaces of a test: getifaddrs, getaddrinfo, gethostname and the calls that release
// their lists end here.
#ifndef PELORUS_SUPPORT_FAKE_NET_H
#define PELORUS_SUPPORT_FAKE_NET_H

#include <ifaddrs.h>
#include <net/if.h>
#include <netdb.h>

#include <map>
#include <memory>
#include <string>
#include <vector>

namespace pelorus::support {

class FakeNet {
public:
    struct Interface {
        std::string name;
        /// Dotted IPv4 or IPv6; "link" for a hardware address; empty for none at all (null).
        std::string address;
        unsigned flags = IFF_UP | IFF_RUNNING;
    };

    static FakeNet& get();

    /// The entries of getifaddrs, in order. At first: lo and eth0 with 192.168.77.10.
    void setInterfaces(std::vector<Interface> list) { interfaces = std::move(list); }
    void failInterfaces(bool fail = true) { interfacesFail = fail; }

    /// The answer of gethostname. At first "nas".
    void setHostname(const std::string& name) { hostname = name; }
    void failHostname(bool fail = true) { hostnameFails = fail; }

    /// The addresses of a name, IPv4 and IPv6, in the order of the answer. A name nobody set is
    /// not known (EAI_NONAME). As in libc a lookup without a socket type lists each address three
    /// times.
    void setName(const std::string& name, const std::vector<std::string>& addresses);
    /// The names that were looked up so far.
    [[nodiscard]] const std::vector<std::string>& lookups() const { return asked; }

    /// Fails the test when a list was not released.
    void checkReleased() const;
    void reset();

    int takeInterfaces(ifaddrs** list);
    void releaseInterfaces(ifaddrs* list);
    int lookUp(const char* name, const char* service, const addrinfo* hints, addrinfo** list);
    void releaseAddresses(addrinfo* list);
    int takeHostname(char* name, std::size_t size) const;

private:
    struct InterfaceList;
    struct AddressList;

    FakeNet();
    ~FakeNet();

    std::vector<Interface> interfaces;
    bool interfacesFail = false;
    std::string hostname;
    bool hostnameFails = false;
    std::map<std::string, std::vector<std::string>> names;
    std::vector<std::string> asked;
    std::map<ifaddrs*, std::unique_ptr<InterfaceList>> interfaceLists;
    std::map<addrinfo*, std::unique_ptr<AddressList>> addressLists;
};

}  // namespace pelorus::support

#endif
