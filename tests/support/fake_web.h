// The web of a test: libcurl's easy interface (the central server) and miniwget (the local web back
// end) end here and nothing is sent. Fails the test on a transfer before curl_global_init, a call
// with a handle other than the open one, and miniwget while SIGPIPE could end the process.
#ifndef PELORUS_SUPPORT_FAKE_WEB_H
#define PELORUS_SUPPORT_FAKE_WEB_H

#include <curl/curl.h>

#include "support/fake.h"

namespace pelorus::support {

struct WebAnswer {
    WebAnswer(const char* text) : body{text} {}            // NOLINT(google-explicit-constructor)
    WebAnswer(std::string text, CURLcode code = CURLE_OK)  // NOLINT(google-explicit-constructor)
        : body{std::move(text)}, result{code} {}

    std::string body;                ///< delivered in pieces of 1000 bytes
    CURLcode result = CURLE_OK;      ///< returned after the body; miniwget: null on any error
    std::function<void()> action{};  ///< runs before the body is delivered; may throw
};

/// A URL without a rule cannot be reached.
class FakeWeb : public Single<FakeWeb>, public Script<WebAnswer> {
public:
    using Answer = WebAnswer;
    /// Numbers in decimal, texts as they are, empty for pointers.
    using Options = std::vector<std::pair<CURLoption, std::string>>;

    /// A server that cannot be reached.
    static Answer noAnswer() { return {"", CURLE_COULDNT_CONNECT}; }
    /// All URLs asked for, central and local, in order, but for empty ones.
    [[nodiscard]] const Texts& urls() const { return calls(); }
    /// The options of the last transfer in the order in which they were set.
    [[nodiscard]] const Options& options() const { return transfer.options; }
    /// Fails the test when the easy handle was not cleaned up.
    void checkBalance() const { EXPECT_FALSE(isOpen); }

    bool handlesFail = false;
    bool globalInitFails = false;
    static inline int globalInits = 0;  ///< minus the clean-ups

    struct Transfer {
        Options options;
        std::string url;
        std::size_t (*writer)(void*, std::size_t, std::size_t, void*) = nullptr;
        void* context = nullptr;
    };
    Transfer& transferOf(CURL* handle);
    Answer ask(const std::string& url);

    Transfer transfer;
    bool isOpen = false;
};

}  // namespace pelorus::support

#endif
