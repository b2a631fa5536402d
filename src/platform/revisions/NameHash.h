#pragma once

#include <array>
#include <cstdint>
#include <string_view>

#include "platform/foundation/Data.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// The key under which a store hashes names. Drawn for each store: names come from whoever writes to the storage, and
/// who knew the key could choose a million that look alike.
using NameHashKey = std::array<std::uint8_t, 16>;

NameHashKey randomNameHashKey();

/// SipHash-2-4.
std::uint64_t sipHash(const NameHashKey& key, ByteView bytes);

/// As the tables have it: the lower half of the name's SipHash.
inline std::uint32_t nameHash(const NameHashKey& key, std::string_view name) {
    return static_cast<std::uint32_t>(sipHash(key, bytesOf(name)));
}

/// One name of an object beside its recorded one, as a key. Names of one object in one folder with one hash are told
/// apart by `index`.
///
/// Thread safety: a value.
struct NameKey {
    FileID fileID{};
    FileID parent{};
    std::uint32_t hash = 0;
    std::uint16_t index = 0;

    friend auto operator<=>(const NameKey&, const NameKey&) = default;
};

}  // namespace cindral
