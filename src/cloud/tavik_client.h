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

/// Receive area of one transfer. The block is allocated with the first chunk.
struct CurlRcvBuffer {
    char* data = nullptr;
    int size = 0;  ///< bytes received
};

/// libcurl's write callback; @p context is a CurlRcvBuffer. Returns the number of bytes taken; 0
/// aborts the transfer, and when an answer grew too large its block is released as well.
std::size_t curlRcvData(void* data, std::size_t elemSize, std::size_t count, void* context);

/// Status word -> state and type of an analytics event. Filled by the TavikClient constructor.
extern std::map<std::string, std::string> Status2LogState;
extern std::map<std::string, std::string> Status2LogType;
/// ConnectionType -> type of an analytics event.
extern const std::array<const char*, 5> ConnType2LogType;

/// The client of the central service and of the local web back end. Requests are synchronous: to
/// the central server at most 30 seconds each. Failures are logged here and told by the result.
class TavikClient {
public:
    /// The process-wide client. The first call reads the credentials and sets up libcurl; when the
    /// credentials are missing it reports "disabled" to the local back end, once.
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
    /// server is read once: a change takes a restart. Placeholders in @p urn are kept.
    std::string getRestUrl(const std::string& urn, HttpType type);

    /// Performs one GET. The answer, @p size bytes and not terminated, belongs to the caller, who
    /// releases it with free. Null when nothing came or the answer was larger than 10238 bytes;
    /// @p size is not touched when @p url is null or empty.
    char* httpGet(const char* url, int& size);

    /// The first address of @p hostname as text, or an empty text.
    [[nodiscard]] std::string nsLookup(const std::string& hostname) const;

    /// Replaces every occurrence of @p search; replaced text is not searched again.
    void ReplaceStringInPlace(std::string& subject,
                              const std::string& search,
                              const std::string& replace) const;

    /// True when @p address is an IPv4 address in dotted form and nothing else.
    [[nodiscard]] bool validateIpAddress(std::string address) const;

    // --- waiting when the server asks for it -------------------------------------------------

    /// Asks the server, once per cycle, whether to hold back. Returns the wait in seconds, 0 to
    /// proceed; also when the server does not answer or is not understood.
    int pollServerForSleepTime();
    /// True when the server asked for a wait in this cycle; asks it when that has not been done.
    bool serverRequestedSleep();
    /// Pause before the next cycle in seconds: the server's wait, but never below 120.
    [[nodiscard]] int getServerSleepTime() const;
    /// Opens the next cycle: the server will be asked again.
    void resetServerSleepTime();

    // --- port test and public address --------------------------------------------------------

    /// Has the server connect back to @p port at the device's public address.
    ///
    /// @param externalIp address to be tested; when empty, the server tests the one it sees, and
    ///     a passed test returns it here
    /// @param type protocol the server uses on that port
    /// @param flag not used
    /// @param checkHddSleep skip the test while the disk is in standby
    /// @param enforceRelay out: a second NAT was found, a direct path is impossible
    /// @param skipDoubleNatCheck do not look for a second NAT
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
    /// Marks the last port test as failed without running one.
    void clearPortTestSuccess() { portMapCheckSuccess = false; }

    /// Asks the server for the public address of this device. True when @p ip is a valid IPv4
    /// address. On failure @p waitSeconds is the wait the server asked for, 0 when it did not.
    bool getMyIP(std::string& ip, int& waitSeconds);

    // --- mapping records ---------------------------------------------------------------------

    /// Publishes where the device can be reached, to the server and then to the local back end.
    /// True when both answered, whatever the local back end said. @p internalHttpsPort is not
    /// sent to anyone.
    bool updateServerMapping(const std::string& externalIp,
                             int externalHttpPort,
                             int externalHttpsPort,
                             const std::string& localIp,
                             int internalHttpPort,
                             int internalHttpsPort);
    /// Withdraws that record on both sides. True only when the server answered and the local back
    /// end reported success.
    bool deleteServerMapping(int internalHttpPort, const std::string& localIp);

    // --- status --------------------------------------------------------------------------------

    /// Tells the local back end the status word ("portforwarded", "relayed", "connecting",
    /// "failed", "disabled"). The same word is not sent twice in a row, also when the first time
    /// failed. Pauses for a second after a request.
    void updateLocalCommStatus(const std::string& status);
    /// Tells the server and then the local back end the device's LAN address. True when both
    /// answered, whatever they said.
    bool updateRemoteCommStatus(const std::string& localIp);
    /// Emits one "cloudConnectivity" event.
    void sendAnalytics(const std::string& status, ConnectionType type, ConnectionSubType subType);
    /// 1 when the disk sleeps or its state is unknown, so that no port test may run; 0 when one
    /// may.
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
    int lastConnectionSubType = 0;
    CurlRcvBuffer rcvBuffer;
    bool portMapCheckSuccess = false;
};

}  // namespace pelorus

#endif
