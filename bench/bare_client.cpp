// A minimal libcurl program, as the baseline for the daemon's memory: it fetches each URL it is given,
// prints its process id and waits to be measured. Like the daemon it forks first, so that memory
// touched by the loader only is left with the parent and counts for neither.
#include <curl/curl.h>
#include <unistd.h>

#include <cstddef>
#include <cstdio>

namespace {

std::size_t take(char* /*data*/, std::size_t size, std::size_t count, void* /*context*/) {
    return size * count;
}

}  // namespace

int main(int argc, char** argv) {
    if (fork() != 0) return 0;
    curl_global_init(CURL_GLOBAL_ALL);
    for (int i = 1; i < argc; ++i) {
        CURL* const handle = curl_easy_init();
        curl_easy_setopt(handle, CURLOPT_URL, argv[i]);
        curl_easy_setopt(handle, CURLOPT_WRITEFUNCTION, take);
        const CURLcode result = curl_easy_perform(handle);
        curl_easy_cleanup(handle);
        if (result != CURLE_OK) return 1;
    }
    if (dprintf(STDOUT_FILENO, "%d\n", getpid()) < 0) return 1;
    pause();
}
