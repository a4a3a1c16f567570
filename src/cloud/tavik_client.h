// Everything said to the central server and to the device's local web back end.
#ifndef PELORUS_CLOUD_TAVIK_CLIENT_H
#define PELORUS_CLOUD_TAVIK_CLIENT_H

#include <array>
#include <cstddef>
#include <map>
#include <optional>
#include <string>

#include "cloud/answer.h"
#include "cloud/url_template.h"
#include "common/connection_types.h"

namespace pelorus {

struct SleepAnswer;

/// Receive area of one transfer.
struct CurlRcvBuffer {
    char* data = nullptr;  ///< malloc'd with the first chunk
    int size = 0;          ///< bytes received
};

/// libcurl's write callback; @p context is a CurlRcvBuffer. Returns the number of bytes taken; 0
/// aborts the transfer. The block of an answer that grew too large is released.
std::size_t curlRcvData(void* data, std::size_t elemSize, std::size_t count, void* context);

/// Status word to state and to type of an analytics event. Empty until the client exists.
extern std::map<std::string, std::string> Status2LogState;
extern std::map<std::string, std::string> Status2LogType;
/// ConnectionType to type of an analytics event.
extern const std::array<const char*, 5> ConnType2LogType;

/// The client of the central service and of the local web back end. Requests are synchronous; one
/// to the central server takes at most 30 seconds. Failures are logged here and shown by the
/// result.
class TavikClient {
public:
    /// The process-wide client. The first call reads the credentials and sets up libcurl; when one
    /// is missing it reports "disabled" to the local back end. The client works without them, too.
    static TavikClient* getInstance();
    TavikClient(const TavikClient&) = delete;
    TavikClient& operator=(const TavikClient&) = delete;

    // --- HTTP ------------------------------------------------------------------------------

    /// Called once by getInstance(). False when a credential is missing.
    bool initialize();
    void cleanup();

    /// Credentials as configured now; empty when absent.
    [[nodiscard]] std::string getDeviceID() const;
    [[nodiscard]] std::string getDeviceAuth() const;

    /// The full URL of the REST path @p urn, or @p urn itself when no server is configured. The
    /// server is read once: a change needs a restart. Placeholders in @p urn are kept.
    std::string getRestUrl(const std::string& urn, HttpType type);

    /// Performs one GET. Returns @p size bytes, not terminated, which the caller releases with
    /// free; after a failure, those that arrived until then. Null when nothing arrived or the
    /// answer was larger than 10238 bytes. @p size is not touched when @p url is null or empty.
    char* httpGet(const char* url, int& size);

    /// The first address of @p hostname as text, IPv4 or IPv6; empty when the lookup fails.
    [[nodiscard]] std::string nsLookup(const std::string& hostname) const;

    /// Replaces every occurrence of @p search; replaced text is not searched again.
    void ReplaceStringInPlace(std::string& subject,
                              const std::string& search,
                              const std::string& replace) const;

    /// True when @p address is an IPv4 address in dotted form and nothing else.
    [[nodiscard]] bool validateIpAddress(std::string address) const;

    // --- waiting when the server asks for it -------------------------------------------------

    /// Asks the server whether to hold back, at most once per cycle. Returns the wait in seconds;
    /// 0, to proceed, also when the server does not answer or is not understood.
    int pollServerForSleepTime();
    /// True when the server wants a wait in this cycle; polls it first when necessary.
    bool serverRequestedSleep();
    /// Pause before the next cycle in seconds: the server's wait, but never below 120.
    [[nodiscard]] int getServerSleepTime() const;
    /// Begins the next cycle: the server will be asked again.
    void resetServerSleepTime();

    // --- port test and public address --------------------------------------------------------

    /// Has the server connect back to @p port at the device's public address.
    ///
    /// @param externalIp the address to test; when empty, the server tests the one it sees, which a
    ///     passed test returns here
    /// @param type protocol the server uses on that port
    /// @param flag not used
    /// @param checkHddSleep skip the test while the disk is in standby
    /// @param enforceRelay out: the router stands behind another NAT, no direct path is possible
    /// @param skipDoubleNatCheck do not look for another NAT
    /// @param remoteExternalIp out: the address the server saw, when the test passed; else empty
    /// @return a PortTestResult. Blocks for up to three requests and three pauses of 5 seconds.
    int testPort(std::string& externalIp,
                 int port,
                 HttpType type,
                 bool flag,
                 bool checkHddSleep,
                 bool* enforceRelay,
                 bool skipDoubleNatCheck,
                 std::string& remoteExternalIp);

    /// Whether the last port test passed; true before the first one.
    [[nodiscard]] bool lastPortTestPassed() const { return portMapCheckSuccess; }
    /// Marks the last port test as failed.
    void clearPortTestSuccess() { portMapCheckSuccess = false; }

    /// Asks the server for the public address of this device. True when @p ip now is an IPv4
    /// address; any other answer is stored in @p ip as well. @p waitSeconds is the wait the server
    /// asked for instead of answering, else 0.
    bool getMyIP(std::string& ip, int& waitSeconds);

    // --- mapping records ---------------------------------------------------------------------

    /// Publishes where the device can be reached, to the server and then to the local back end.
    /// True when both answered, whatever they said. @p internalHttpsPort is not used.
    bool updateServerMapping(const std::string& externalIp,
                             int externalHttpPort,
                             int externalHttpsPort,
                             const std::string& localIp,
                             int internalHttpPort,
                             int internalHttpsPort);
    /// Withdraws that record on both sides. True only when the server answered and the local back
    /// end reported success, unlike above.
    bool deleteServerMapping(int internalHttpPort, const std::string& localIp);

    // --- status --------------------------------------------------------------------------------

    /// Tells the local back end the status word ("portforwarded", "relayed", "connecting",
    /// "failed", "disabled"). The same word is not sent twice in a row, not even after a failure.
    /// Pauses for a second after a request.
    void updateLocalCommStatus(const std::string& status);
    /// Tells the server and then the local back end the LAN address of the device. True when both
    /// answered, whatever they said.
    bool updateRemoteCommStatus(const std::string& localIp);
    /// Emits one "cloudConnectivity" event.
    void sendAnalytics(const std::string& status, ConnectionType type, ConnectionSubType subType);
    /// 1 when the disk sleeps or its state is unknown: a port test would wake it. 0 otherwise.
    int checkHddStandByMode();

private:
    friend class PortTest;  // one call of testPort

    TavikClient();
    ~TavikClient();

    bool deriveServerUrls();
    std::optional<Answer> fetchCentral(const MaskedUrl& url);

    void applySleepAnswer(const SleepAnswer& answer);
    MaskedUrl forwardingUrl(const std::string& externalIp,
                            const std::string& localIp,
                            int externalHttpPort,
                            int externalHttpsPort);

    bool tellServerLocalIp(const std::string& localIp);

    bool serverPolled = false;
    int serverSleepTime = 0;  // seconds
    std::string serverHost;
    std::string baseServerUrl;
    std::string baseSSLServerUrl;
    std::string lastLocalCommStatus;
    int lastConnectionSubType = 0;  // of the last analytics event; not read yet
    CurlRcvBuffer rcvBuffer;
    bool portMapCheckSuccess = false;
};

}  // namespace pelorus

#endif
