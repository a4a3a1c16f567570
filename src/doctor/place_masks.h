// Keeping addresses and names out of what the doctor says in public.
#ifndef PELORUS_DOCTOR_PLACE_MASKS_H
#define PELORUS_DOCTOR_PLACE_MASKS_H

#include <cstddef>
#include <map>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace pelorus::doctor {

/// Replaces every IP and MAC address, host name, name of a user in a path, what others call their
/// ports at the gateway, and the owner, unit and town in a certificate; of the paths of logs only
/// the file's own name is left. An address or name has the same replacement wherever this object
/// finds it, in whatever case: "address-1", "private-address-1", "shared-address-1", "mac-1",
/// "host-1", "user-1" or "name-1". Addresses that tell nothing stay: those of the device to itself,
/// and netmasks.
///
/// A host name is a known one or a part of it, also within a longer word, one that a URL, a message
/// of libcurl or of the tunnel's client or the gateway's table names, and every word with a dot
/// that may be one and does not look like the name of a file.
class PlaceMasks {
public:
    /// With the names of hosts that are known, and the paths of logs as they were given.
    explicit PlaceMasks(const std::vector<std::string>& hosts, std::vector<std::string> logs = {});

    /// @p text without any of it.
    [[nodiscard]] std::string hide(std::string text);

    /// True when hide() leaves nothing of the @p length characters at @p at because they are part
    /// of a longer name or address.
    [[nodiscard]] bool hidesAround(std::string_view text, std::size_t at, std::size_t length) const;

private:
    // What stands at a place of a word; without a kind it tells nothing.
    struct Part {
        std::size_t length = 0;
        std::string kind, place;
    };

    void learn(const std::string& host);
    std::string hideWordAt(std::string_view text, std::size_t at, std::size_t length);
    std::string hideWord(std::string_view word);
    std::string hideCut(std::string_view left);
    std::string hideParts(std::string_view word);
    [[nodiscard]] Part partAt(std::string_view word, std::size_t at) const;
    std::string hideNamed(const std::string& kind, std::string_view name);
    std::string replacement(const std::string& kind, const std::string& place);

    std::set<std::string> known;  // in small letters
    std::vector<std::string> logPaths;
    std::map<std::string, std::string> replacements;
    std::map<std::string, int> counts;
};

}  // namespace pelorus::doctor

#endif
