// Lines of the openvpn client's output.
#include <algorithm>

#include "fuzz_world.h"
#include "relay/client_output.h"

void pelorus::fuzz::tryText(const std::string& text) {
    const auto peer = readRelayPeer(text.c_str());
    if (!peer || !peer->address) return;
    // Numbers above 255 are passed on as they stand; other characters are not.
    assert(std::count(peer->address->begin(), peer->address->end(), '.') == 3);
    assert(peer->address->find_first_not_of("0123456789.") == std::string::npos);
}
