// The web of a test: libcurl's easy interface (the central server) and miniwget (the local web
// back end) end here and nothing is sent.
//
// Fails the test by itself: a transfer before curl_global_init, a handle that is not an open one,
// miniwget while SIGPIPE could end the process.
#ifndef PELORUS_SUPPORT_FAKE_WEB_H
#define PELORUS_SUPPORT_FAKE_WEB_H

#include <curl/curl.h>

#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace pelorus::support {

class FakeWeb {
public:
    struct Answer {
        std::string body{};
        /// What curl_easy_perform returns after the body was taken; miniwget takes any error for
        /// no answer.
        CURLcode result = CURLE_OK;
        std::size_t chunk = 0;  ///< bytes per call of the write function; 0: all at once
        /// Runs before the body is delivered; gets the URL. May throw or move the clock.
        std::function<void(const std::string&)> action{};
    };
    enum class Side { CENTRAL, LOCAL };
    struct Request {
        Side side;
        std::string url;  ///< as it goes over the wire
    };
    /// Numbers in decimal, texts as they are, empty for pointers.
    using Options = std::vector<std::pair<CURLoption, std::string>>;

    static FakeWeb& get();
    /// A server that cannot be reached.
    static Answer noAnswer(CURLcode result = CURLE_COULDNT_CONNECT);

    /// Answers every URL that holds @p part, on both sides. A later rule goes before an earlier
    /// one. What nobody answers is not reachable.
    void answer(const std::string& part, Answer answer);
    void answer(const std::string& part, const std::string& body);
    /// Answers the next request for a URL that holds @p part, once, before any standing rule.
    /// Several for one part are used in the order in which they were given.
    void answerOnce(const std::string& part, Answer answer);
    void answerOnce(const std::string& part, const std::string& body);

    /// Everything that was asked, central and local, in order. Empty URLs, which both libraries
    /// refuse, are not among them.
    [[nodiscard]] std::vector<std::string> urls() const;
    [[nodiscard]] std::vector<std::string> urls(Side side) const;
    /// How many of them hold @p part.
    [[nodiscard]] int count(const std::string& part) const;
    /// Forgets the requests, not the answers.
    void clear() { asked.clear(); }

    /// The options of the last transfer, in the order in which they were set.
    [[nodiscard]] const Options& options() const { return transfer.options; }
    /// Lets curl_easy_init or curl_global_init fail from now on.
    void failHandles() { handlesFail = true; }
    void failGlobalInit() { globalInitFails = true; }
    [[nodiscard]] int globalInits() const { return globalInitCount; }

    /// Fails the test when an easy handle was not cleaned up.
    void checkBalance() const;
    /// Forgets everything but that libcurl was initialised.
    void reset();

    CURLcode globalInit();
    void globalCleanup() { ++globalCleanupCount; }
    CURL* openHandle();
    void closeHandle(CURL* handle);
    CURLcode setNumber(CURL* handle, CURLoption option, long value);
    CURLcode setPointer(CURL* handle, CURLoption option, void* value);
    CURLcode setWriter(CURL* handle, CURLoption option, curl_write_callback writer);
    CURLcode perform(CURL* handle);
    void* wget(const char* url, int* size);

private:
    struct Transfer {
        Options options;
        std::string url;
        curl_write_callback writer = nullptr;
        void* context = nullptr;
    };

    FakeWeb() = default;
    Answer take(const Request& request);
    CURLcode deliver(Answer& answer) const;
    void checkHandle(CURL* handle) const;

    std::vector<std::pair<std::string, Answer>> rules;
    std::vector<std::pair<std::string, Answer>> once;
    std::vector<Request> asked;
    Transfer transfer;
    std::map<CURL*, std::unique_ptr<char>> handles;
    bool handlesFail = false;
    bool globalInitFails = false;
    int globalInitCount = 0;
    int globalCleanupCount = 0;
};

}  // namespace pelorus::support

#endif
