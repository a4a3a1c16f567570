// Lines of the openvpn client's output.
#include <algorithm>

#include "fuzz_world.h"
#include "relay/client_output.h"

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    using namespace pelorus;
    const auto peer = readRelayPeer(fuzz::asText(data, size).c_str());
    if (!peer || !peer->address) return 0;
    const std::string& address = *peer->address;
    // Numbers above 255 are passed on as they stand; other characters are not.
    fuzz::require(std::count(address.begin(), address.end(), '.') == 3, "four numbers");
    fuzz::require(address.find_first_not_of("0123456789.") == std::string::npos, "digits");
    return 0;
}
