// A device in a home network with a gateway, for the tests of this folder.
#ifndef PELORUS_UNIT_ROUTER_FIXTURE_H
#define PELORUS_UNIT_ROUTER_FIXTURE_H

#include "router/router.h"
#include "support/fake_gateway.h"
#include "support/fixture.h"

namespace pelorus {

class RouterTest : public support::PelorusTest {
protected:
    using Mapping = support::FakeGateway::Mapping;
    using Mappings = std::vector<Mapping>;
    using Texts = support::Texts;

    RouterTest() { gateway.reset(); }

    void SetUp() override { givenConfig(); }
    void TearDown() override {
        gateway.checkReleased();
        PelorusTest::TearDown();
    }

    /// Discovers through the protocol that is on; the log and the calls start afresh.
    void discovered() {
        ASSERT_TRUE(router.discover()) << log.dump();
        log.clear();
        gateway.clear();
    }
    void discoveredThroughNatpmp() {
        gateway.speakUpnp(false);
        gateway.speakNatpmp(true);
        discovered();
    }

    support::FakeGateway& gateway = support::FakeGateway::get();
    Router router;
};

}  // namespace pelorus

#endif
