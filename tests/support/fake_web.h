// The web of a test: libcurl's easy interface (the central server) and miniwget (the local web
// back end) end here and nothing is sent.
//
// Standing checks: no transfer before curl_global_init, calls for the open easy handle only, no
// miniwget while SIGPIPE could end the process.
#ifndef PELORUS_SUPPORT_FAKE_WEB_H
#define PELORUS_SUPPORT_FAKE_WEB_H

#include <curl/curl.h>

#include <functional>

#include "support/fake.h"

namespace pelorus::support {

struct WebAnswer {
    WebAnswer(const char* text) : body{text} {}            // NOLINT(google-explicit-constructor)
    WebAnswer(std::string text, CURLcode code = CURLE_OK)  // NOLINT(google-explicit-constructor)
        : body{std::move(text)}, result{code} {}

    std::string body;  ///< delivered in pieces of 1000 bytes
    /// What curl_easy_perform returns after the body; any error is no answer of miniwget.
    CURLcode result = CURLE_OK;
    std::function<void()> action{};  ///< runs before the body is delivered; may throw
};

/// What nobody answers cannot be reached.
class FakeWeb : public Single<FakeWeb>, public Script<WebAnswer> {
public:
    using Answer = WebAnswer;
    /// Numbers in decimal, texts as they are, empty for pointers.
    using Options = std::vector<std::pair<CURLoption, std::string>>;

    /// A server that cannot be reached.
    static Answer noAnswer() { return {"", CURLE_COULDNT_CONNECT}; }

    /// All URLs asked for, central and local, in order, but for empty ones.
    [[nodiscard]] const std::vector<std::string>& urls() const { return asked; }
    /// The options of the last transfer in the order in which they were set.
    [[nodiscard]] const Options& options() const { return transfer.options; }
    /// Fails the test when the easy handle was not cleaned up.
    void checkBalance() const;

    bool handlesFail = false;
    bool globalInitFails = false;
    static inline int globalInits = 0;  ///< minus the clean-ups

    struct Transfer {
        Options options;
        std::string url;
        curl_write_callback writer = nullptr;
        void* context = nullptr;
    };
    Transfer& transferOf(CURL* handle);
    Answer ask(const std::string& url);

    Transfer transfer;
    bool isOpen = false;
};

}  // namespace pelorus::support

#endif
