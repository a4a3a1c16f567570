#include "support/fake_web.h"

#include <gtest/gtest.h>
#include <miniupnpc/miniupnpc.h>
#include <miniupnpc/miniwget.h>

#include <algorithm>
#include <csignal>
#include <cstdarg>
#include <cstdlib>
#include <memory>

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
extern "C" {
CURLcode __wrap_curl_global_init(long flags);
void __wrap_curl_global_cleanup();
CURL* __wrap_curl_easy_init();
void __wrap_curl_easy_cleanup(CURL* handle);
CURLcode __wrap_curl_easy_setopt(CURL* handle, unsigned number, ...);
CURLcode __wrap_curl_easy_perform(CURL* handle);
#if MINIUPNPC_API_VERSION >= 16
void* __wrap_miniwget(const char* url, int* size, unsigned scopeId, int* statusCode);
#else
void* __wrap_miniwget(const char* url, int* size, unsigned scopeId);
#endif
}
// NOLINTEND(bugprone-reserved-identifier)

namespace pelorus::support {

namespace {

bool holds(const std::string& url, const std::string& part) {
    return url.find(part) != std::string::npos;
}

FakeWeb::Answer plain(const std::string& body) {
    FakeWeb::Answer answer;
    answer.body = body;
    return answer;
}

}  // namespace

// Never destroyed: the client under test says goodbye to libcurl at the end of the process.
FakeWeb& FakeWeb::get() {
    static auto* const instance = new FakeWeb;
    return *instance;
}

FakeWeb::Answer FakeWeb::noAnswer(CURLcode result) {
    Answer answer;
    answer.result = result;
    return answer;
}

void FakeWeb::answer(const std::string& part, Answer answer) {
    rules.emplace_back(part, std::move(answer));
}

void FakeWeb::answer(const std::string& part, const std::string& body) {
    answer(part, plain(body));
}

void FakeWeb::answerOnce(const std::string& part, Answer answer) {
    once.emplace_back(part, std::move(answer));
}

void FakeWeb::answerOnce(const std::string& part, const std::string& body) {
    answerOnce(part, plain(body));
}

std::vector<std::string> FakeWeb::urls() const {
    std::vector<std::string> all;
    for (const Request& request : asked) all.push_back(request.url);
    return all;
}

std::vector<std::string> FakeWeb::urls(Side side) const {
    std::vector<std::string> some;
    for (const Request& request : asked) {
        if (request.side == side) some.push_back(request.url);
    }
    return some;
}

int FakeWeb::count(const std::string& part) const {
    return static_cast<int>(std::count_if(asked.begin(), asked.end(), [&](const Request& request) {
        return holds(request.url, part);
    }));
}

void FakeWeb::checkBalance() const {
    EXPECT_TRUE(handles.empty()) << "easy handles not cleaned up: " << handles.size();
}

void FakeWeb::reset() {
    rules.clear();
    once.clear();
    asked.clear();
    transfer = {};
    handlesFail = false;
    globalInitFails = false;
}

FakeWeb::Answer FakeWeb::take(const Request& request) {
    asked.push_back(request);
    const auto fits = [&](const auto& rule) { return holds(request.url, rule.first); };
    const auto next = std::find_if(once.begin(), once.end(), fits);
    if (next != once.end()) {
        Answer found = std::move(next->second);
        once.erase(next);
        return found;
    }
    const auto rule = std::find_if(rules.rbegin(), rules.rend(), fits);
    return rule == rules.rend() ? noAnswer() : rule->second;
}

CURLcode FakeWeb::globalInit() {
    ++globalInitCount;
    return globalInitFails ? CURLE_FAILED_INIT : CURLE_OK;
}

CURL* FakeWeb::openHandle() {
    EXPECT_GT(globalInitCount, globalCleanupCount) << "libcurl is not initialised";
    if (handlesFail) return nullptr;
    transfer = {};
    auto handle = std::make_unique<char>();
    CURL* address = handle.get();
    handles.emplace(address, std::move(handle));
    return address;
}

void FakeWeb::checkHandle(CURL* handle) const {
    EXPECT_EQ(handles.count(handle), 1U) << "not an open easy handle";
}

void FakeWeb::closeHandle(CURL* handle) {
    checkHandle(handle);
    handles.erase(handle);
}

CURLcode FakeWeb::setNumber(CURL* handle, CURLoption option, long value) {
    checkHandle(handle);
    transfer.options.emplace_back(option, std::to_string(value));
    return CURLE_OK;
}

CURLcode FakeWeb::setPointer(CURL* handle, CURLoption option, void* value) {
    checkHandle(handle);
    transfer.options.emplace_back(option, "");
    if (option == CURLOPT_URL) {
        transfer.url = static_cast<const char*>(value);
        transfer.options.back().second = transfer.url;
    }
    if (option == CURLOPT_WRITEDATA) transfer.context = value;
    return CURLE_OK;
}

CURLcode FakeWeb::setWriter(CURL* handle, CURLoption option, curl_write_callback writer) {
    checkHandle(handle);
    transfer.options.emplace_back(option, "");
    if (option == CURLOPT_WRITEFUNCTION) transfer.writer = writer;
    return CURLE_OK;
}

CURLcode FakeWeb::perform(CURL* handle) {
    checkHandle(handle);
    if (transfer.url.empty()) return CURLE_URL_MALFORMAT;
    Answer answer = take({Side::CENTRAL, transfer.url});
    if (answer.action) answer.action(transfer.url);
    return deliver(answer);
}

CURLcode FakeWeb::deliver(Answer& answer) const {
    const std::size_t total = answer.body.size();
    for (std::size_t at = 0; at < total;) {
        const std::size_t piece = answer.chunk == 0 ? total : std::min(answer.chunk, total - at);
        if (transfer.writer(answer.body.data() + at, 1, piece, transfer.context) != piece) {
            return CURLE_WRITE_ERROR;
        }
        at += piece;
    }
    return answer.result;
}

void* FakeWeb::wget(const char* url, int* size) {
    sigset_t mask;
    pthread_sigmask(SIG_SETMASK, nullptr, &mask);
    EXPECT_EQ(sigismember(&mask, SIGPIPE), 1) << "a closed connection would end the process";
    *size = 0;
    const std::string address = url;
    if (address.empty()) return nullptr;
    const Answer answer = take({Side::LOCAL, address});
    if (answer.action) answer.action(address);
    if (answer.result != CURLE_OK) return nullptr;
    // Exactly the body: whoever reads a terminator behind it is caught by the sanitizers.
    void* block = std::malloc(std::max<std::size_t>(answer.body.size(), 1));
    std::copy(answer.body.begin(), answer.body.end(), static_cast<char*>(block));
    *size = static_cast<int>(answer.body.size());
    return block;
}

}  // namespace pelorus::support

using pelorus::support::FakeWeb;

// NOLINTBEGIN(bugprone-reserved-identifier): names the linker gives
CURLcode __wrap_curl_global_init(long /*flags*/) {
    return FakeWeb::get().globalInit();
}

void __wrap_curl_global_cleanup() {
    FakeWeb::get().globalCleanup();
}

CURL* __wrap_curl_easy_init() {
    return FakeWeb::get().openHandle();
}

void __wrap_curl_easy_cleanup(CURL* handle) {
    FakeWeb::get().closeHandle(handle);
}

// An enum in front of the dots would be promoted, which va_start does not allow.
CURLcode __wrap_curl_easy_setopt(CURL* handle, unsigned number, ...) {
    const auto option = static_cast<CURLoption>(number);
    va_list argument;
    va_start(argument, number);
    // NOLINTBEGIN(clang-analyzer-valist.Uninitialized): a false alarm, see the line above
    CURLcode result = CURLE_UNKNOWN_OPTION;
    if (option < CURLOPTTYPE_OBJECTPOINT) {
        result = FakeWeb::get().setNumber(handle, option, va_arg(argument, long));
    } else if (option < CURLOPTTYPE_FUNCTIONPOINT) {
        result = FakeWeb::get().setPointer(handle, option, va_arg(argument, void*));
    } else if (option < CURLOPTTYPE_OFF_T) {
        result = FakeWeb::get().setWriter(handle, option, va_arg(argument, curl_write_callback));
    }
    // NOLINTEND(clang-analyzer-valist.Uninitialized)
    va_end(argument);
    return result;
}

CURLcode __wrap_curl_easy_perform(CURL* handle) {
    return FakeWeb::get().perform(handle);
}

#if MINIUPNPC_API_VERSION >= 16
void* __wrap_miniwget(const char* url, int* size, unsigned /*scopeId*/, int* statusCode) {
    if (statusCode != nullptr) *statusCode = 200;
    return FakeWeb::get().wget(url, size);
}
#else
void* __wrap_miniwget(const char* url, int* size, unsigned /*scopeId*/) {
    return FakeWeb::get().wget(url, size);
}
#endif
// NOLINTEND(bugprone-reserved-identifier)
