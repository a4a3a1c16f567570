#include "cloud/answer.h"

#include <cstring>

#include "common/handles.h"
#include "common/miniupnpc_api.h"

namespace pelorus {

namespace {

constexpr unsigned kScopeId = 2;  // of IPv6 link-local addresses

}  // namespace

Answer::Answer(const char* data, int bytes) : size(bytes) {
    if (data != nullptr && bytes > 0) text.assign(data, strnlen(data, static_cast<size_t>(bytes)));
}

std::optional<Answer> fetchLocal(const std::string& url) {
    int size = 0;
    const MallocHandle<void> data{miniupnpc::wget(url.c_str(), size, kScopeId)};
    if (!data) return std::nullopt;
    return Answer{static_cast<const char*>(data.get()), size};
}

}  // namespace pelorus
