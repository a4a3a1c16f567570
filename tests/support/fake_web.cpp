#include "support/fake_web.h"

#include <miniupnpc/miniupnpc.h>
#include <miniupnpc/miniwget.h>

#include <cstdarg>
#include <cstdlib>

namespace pelorus::support {

FakeWeb::Answer FakeWeb::ask(const std::string& url) {
    Answer answer = take(url, noAnswer());
    if (answer.action) answer.action();
    return answer;
}

FakeWeb::Transfer& FakeWeb::transferOf(CURL* handle) {
    EXPECT_TRUE(isOpen && handle == &transfer) << "not an open easy handle";
    return transfer;
}

extern "C" {
CURLcode __wrap_curl_global_init(long /*flags*/) {
    expectTerminationHeld();
    ++FakeWeb::globalInits;
    return FakeWeb::get().globalInitFails ? CURLE_FAILED_INIT : CURLE_OK;
}

void __wrap_curl_global_cleanup() {
    expectTerminationHeld();
    --FakeWeb::globalInits;
}

CURL* __wrap_curl_easy_init() {
    FakeWeb& web = FakeWeb::get();
    expectTerminationHeld();
    EXPECT_GT(web.globalInits, 0) << "libcurl is not initialised";
    EXPECT_FALSE(web.isOpen) << "another easy handle is open";
    if (web.handlesFail) return nullptr;
    web.transfer = {};
    web.isOpen = true;
    return &web.transfer;
}

void __wrap_curl_easy_cleanup(CURL* handle) {
    expectTerminationHeld();
    FakeWeb::get().transferOf(handle);
    FakeWeb::get().isOpen = false;
}

// An enum in front of the dots would be promoted, which va_start does not allow.
CURLcode __wrap_curl_easy_setopt(CURL* handle, unsigned number, ...) {
    FakeWeb::Transfer& transfer = FakeWeb::get().transferOf(handle);
    const auto option = static_cast<CURLoption>(number);
    std::string value;
    va_list argument;
    va_start(argument, number);
    // NOLINTBEGIN(clang-analyzer-valist.Uninitialized): a false alarm, see the line above
    if (option == CURLOPT_WRITEFUNCTION) {
        transfer.writer = va_arg(argument, decltype(transfer.writer));
    } else if (option == CURLOPT_WRITEDATA) {
        transfer.context = va_arg(argument, void*);
    } else if (option == CURLOPT_URL) {
        value = transfer.url = va_arg(argument, const char*);
    } else {
        value = std::to_string(va_arg(argument, long));
    }
    // NOLINTEND(clang-analyzer-valist.Uninitialized)
    va_end(argument);
    transfer.options.emplace_back(option, value);
    return CURLE_OK;
}

CURLcode __wrap_curl_easy_perform(CURL* handle) {
    expectTerminationHeld();
    FakeWeb::Transfer& now = FakeWeb::get().transferOf(handle);
    if (now.url.empty()) return CURLE_URL_MALFORMAT;
    FakeWeb::Answer answer = FakeWeb::get().ask(now.url);
    constexpr std::size_t kPieceSize = 1000;  // bytes
    for (std::size_t at = 0; at < answer.body.size(); at += kPieceSize) {
        const std::size_t piece = std::min(kPieceSize, answer.body.size() - at);
        if (now.writer(answer.body.data() + at, 1, piece, now.context) != piece) {
            return CURLE_WRITE_ERROR;
        }
    }
    return answer.result;
}

const char* __wrap_curl_easy_strerror(CURLcode code) {
    if (code == CURLE_COULDNT_CONNECT) return "Couldn't connect to server";
    return code == CURLE_OPERATION_TIMEDOUT ? "Timeout was reached" : "Another error";
}

#if MINIUPNPC_API_VERSION >= 16
void* __wrap_miniwget(const char* url, int* size, unsigned /*scopeId*/, int* /*statusCode*/) {
#else
void* __wrap_miniwget(const char* url, int* size, unsigned /*scopeId*/) {
#endif
    expectBrokenPipeHeld();
    *size = 0;
    if (*url == '\0') return nullptr;
    const FakeWeb::Answer answer = FakeWeb::get().ask(url);
    if (answer.result != CURLE_OK) return nullptr;
    // Without a terminator: the sanitizers catch whoever reads one.
    void* block = std::malloc(std::max<std::size_t>(answer.body.size(), 1));
    std::copy(answer.body.begin(), answer.body.end(), static_cast<char*>(block));
    *size = static_cast<int>(answer.body.size());
    return block;
}
}

}  // namespace pelorus::support
