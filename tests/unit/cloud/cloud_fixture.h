// A configured client in front of the fake web.
#ifndef PELORUS_UNIT_CLOUD_FIXTURE_H
#define PELORUS_UNIT_CLOUD_FIXTURE_H

#include "cloud/tavik_client.h"
#include "support/fake_files.h"
#include "support/fake_web.h"
#include "support/fixture.h"

namespace pelorus {

using support::FakeCommands;
using support::FakeWeb;
using Urls = std::vector<std::string>;

class CloudTest : public support::PelorusTest {
protected:
    const FakeWeb::Answer none = FakeWeb::noAnswer();
    FakeWeb& web = FakeWeb::get();
    TavikClient& client = givenClient();

private:
    TavikClient& givenClient() {
        givenConfig({{"SERVER_BASE_URL", "https://web.kavra.example"},
                     {"INTERNAL_HTTP_PORT", "80"},
                     {"REMOTE_TESTPORTURL", "/test?id=%s&ip=%s&port=%d&type=%s&auth=%s"},
                     {"REMOTE_SETFORWARDURL", "/set?id=%s&ip=%s&lan=%s&p=%d&ps=%d&auth=%s"},
                     {"REMOTE_SETCOMMSTATUSURL", "/status?id=%s&auth=%s&lan=%s"},
                     {"LOCAL_SETFORWARDURL", "http://127.0.0.1:%d/set?ip=%s&p=%d&s=%d&lan=%s&i=%d"},
                     {"LOCAL_DELFORWARDURL", "http://127.0.0.1:%d/del?i=%d"},
                     {"LOCAL_SETCOMMSTATUSURL", "http://127.0.0.1:%d/status?is=%s"},
                     {"LOCAL_SETLOCALIPURL", "http://127.0.0.1:%d/ip?lan=%s"}});
        return *TavikClient::getInstance();
    }
};

}  // namespace pelorus

#endif
