// A device in a home network with a gateway, for the tests of this folder.
#ifndef PELORUS_UNIT_ROUTER_FIXTURE_H
#define PELORUS_UNIT_ROUTER_FIXTURE_H

#include "router/router.h"
#include "support/fake_gateway.h"
#include "support/fixture.h"

namespace pelorus {

using support::FakeGateway;
using support::RowName;
using support::Texts;
using Mapping = FakeGateway::Mapping;
using Mappings = std::vector<Mapping>;

class RouterTest : public support::PelorusTest {
protected:
    RouterTest() { givenConfig(); }

    void discovered(const std::string& protocol = "UPnP") {
        gateway.upnp = protocol == "UPnP";
        gateway.natpmp = protocol == "NAT-PMP";
        ASSERT_TRUE(router.discover()) << log.dump();
        log.clear();
        gateway.clear();
    }
    void once(const char* part) { EXPECT_EQ(log.countPart(part), 1) << part << log.dump(); }

    FakeGateway& gateway = FakeGateway::get();
    Router router;
};

}  // namespace pelorus

#endif
