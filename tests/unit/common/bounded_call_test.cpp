#include "common/bounded_call.h"

#include <arpa/inet.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include "common/stop_budget.h"
#include "common/termination.h"
#include "support/fixture.h"

namespace pelorus::support {
namespace {

// A server on loopback that accepts connections and says nothing.
class BoundedCallTest : public PelorusTest {
protected:
    BoundedCallTest() {
        bindToLoopback(server);
        listen(server, 1);
    }
    void TearDown() override {
        close(server);
        PelorusTest::TearDown();
    }

    // Binds to any port, which is the address to send to from then on.
    void bindToLoopback(int socket) {
        address = {AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}};
        EXPECT_EQ(bind(socket, target, size), 0);
        getsockname(socket, target, &size);
    }
    // Connects and waits for an answer; 0 when the connection was ended.
    ssize_t ask(int type) {
        const int client = socket(AF_INET, type, 0);
        if (type == SOCK_STREAM) static_cast<void>(connect(client, target, size));
        char letter = 0;
        const ssize_t received = recv(client, &letter, 1, 0);
        close(client);
        return received;
    }

    const int server = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address{};
    sockaddr* const target = reinterpret_cast<sockaddr*>(&address);
    socklen_t size = sizeof address;
};

TEST_F(BoundedCallTest, AWaitEndsWithTheTimeOfTheCall) {
    const BoundedCall bounds{Peer::ANYBODY, 0};
    for (const int type : {SOCK_STREAM, SOCK_STREAM, SOCK_DGRAM}) EXPECT_EQ(ask(type), 0);
}

TEST_F(BoundedCallTest, OnlyCallsSpendTheStopBudget) {
    sigConnKilled = SIGTERM;
    renewStopBudget(std::chrono::milliseconds{30});
    EXPECT_EQ(poll(nullptr, 0, 40), 0);
    EXPECT_FALSE(stopBudgetSpent());
    {
        const BoundedCall bounds{Peer::GATEWAY, 3600};
        EXPECT_EQ(ask(SOCK_DGRAM), 0);
    }
    EXPECT_TRUE(stopBudgetSpent());
}

TEST_F(BoundedCallTest, WithNothingLeftAnAnswerAtOnceStillCounts) {
    const int receiver = socket(AF_INET, SOCK_DGRAM, 0);
    bindToLoopback(receiver);
    bool received = false;
    for (int i = 0; i < 5 && !received; ++i) {  // a busy machine may be too late once
        sigConnKilled = SIGTERM;
        renewStopBudget({});
        const BoundedCall bounds{Peer::GATEWAY, 3600};
        poll(nullptr, 0, 5);
        sendto(receiver, "x", 1, 0, target, size);
        char letter = 0;
        received = recvfrom(receiver, &letter, 1, 0, nullptr, nullptr) == 1;
    }
    EXPECT_TRUE(received);
    close(receiver);
}

TEST_F(BoundedCallTest, AWaitWithinTheBoundsGoesOn) {
    const BoundedCall bounds{Peer::ANYBODY, 3600};
    const int client = socket(AF_INET, SOCK_DGRAM, 0);
    pollfd waiting{client, POLLIN, 0};
    EXPECT_EQ(poll(&waiting, 1, 60), 0);
    close(client);
}

TEST_F(BoundedCallTest, EachHasATimeOfItsOwn) {
    for (int pass = 0; pass < 2; ++pass) {
        {
            const BoundedCall bounds{Peer::ANYBODY, 3600};
            const int client = socket(AF_INET, SOCK_DGRAM, 0);
            pollfd waiting{client, POLLIN, 0};
            EXPECT_EQ(poll(&waiting, 1, 60), 0);
            close(client);
        }
        const BoundedCall bounds{Peer::ANYBODY, 0};
        EXPECT_EQ(ask(SOCK_STREAM), 0);
    }
}

TEST_F(BoundedCallTest, WithoutAThreadToWatchItNothingIsReceived) {
    pthread_attr_t usual;
    pthread_getattr_default_np(&usual);
    pthread_attr_t impossible;
    pthread_attr_init(&impossible);
    pthread_attr_setstacksize(&impossible, SIZE_MAX / 4 * 3);
    pthread_setattr_default_np(&impossible);
    const int receiver = socket(AF_INET, SOCK_DGRAM, 0);
    bindToLoopback(receiver);
    sendto(receiver, "x", 1, 0, target, size);
    {
        const BoundedCall bounds{Peer::ANYBODY, 3600};
        char letter = 0;
        EXPECT_EQ(recvfrom(receiver, &letter, 1, 0, nullptr, nullptr), 0);
    }
    close(receiver);
    pthread_setattr_default_np(&usual);
}

TEST_F(BoundedCallTest, AGatewayIsNeverThisDevice) {
    const int client = socket(AF_INET, SOCK_STREAM, 0);
    {
        net.interfaces = {{"eth0", "192.0.2.1"}, {"eth0:1", "192.0.2.2"}};
        const BoundedCall bounds{Peer::GATEWAY, 3600};
        for (const char* own :
             {"192.0.2.1", "192.0.2.2", "127.0.0.1", "127.3.2.1", "0.0.0.0", "0.1.2.3"}) {
            inet_pton(AF_INET, own, &address.sin_addr);
            EXPECT_EQ(connect(client, target, size), -1) << own;
            EXPECT_EQ(errno, EACCES) << own;
        }
        sockaddr_in6 local{AF_INET6, address.sin_port, 0, in6addr_loopback, 0};
        EXPECT_EQ(connect(client, reinterpret_cast<sockaddr*>(&local), sizeof local), -1);
        EXPECT_EQ(errno, EACCES);
    }
    inet_pton(AF_INET, "127.0.0.1", &address.sin_addr);
    EXPECT_EQ(connect(client, target, size), 0);
    close(client);
}

}  // namespace
}  // namespace pelorus::support
