#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/foundation/Data.h"

namespace cindral {

/// Names an item, lastingly. Bytes, valid UTF-8 unless a client sent something else.
using TesselItemIdentifier = std::string;

inline const TesselItemIdentifier kTesselRootContainerItemIdentifier = "TesselRootContainerItemIdentifier";
inline const TesselItemIdentifier kTesselWorkingSetContainerItemIdentifier = "TesselWorkingSetContainerItemIdentifier";
inline const TesselItemIdentifier kTesselAllDirectoriesContainerItemIdentifier =
    "TesselAllDirectoriesContainerItemIdentifier";
inline const TesselItemIdentifier kTesselTemporaryLocalFolderItemIdentifier =
    "TesselTemporaryLocalFolderItemIdentifier";

/// Positions in an enumeration: opaque to the host, which only hands them back.
using TesselPage = Bytes;
using TesselSyncAnchor = Bytes;

/// The two pages that any listing may begin with. They can't be mistaken for an encoded position.
const TesselPage& tesselInitialPageSortedByName();
const TesselPage& tesselInitialPageSortedByDate();
/// The page that a listing may begin with where the client took an anchor before, and applies the changes since then
/// afterwards. Where it can, such a listing goes on also after something was deleted, and may then repeat items; it
/// never leaves out what there is from its beginning to its end.
const TesselPage& tesselInitialPageForFollowers();

/// What the host may do with an item. Part of the host interface: add bits, never change one.
enum class TesselItemCapabilities : std::uint32_t {
    none = 0,
    allowsReading = 1,  ///< or enumerating content
    allowsWriting = 2,  ///< or adding sub-items
    allowsReparenting = 4,
    allowsRenaming = 8,
    allowsTrashing = 16,
    allowsDeleting = 32,
};
constexpr TesselItemCapabilities operator|(TesselItemCapabilities a, TesselItemCapabilities b) {
    return static_cast<TesselItemCapabilities>(static_cast<std::uint32_t>(a) | static_cast<std::uint32_t>(b));
}
constexpr bool operator&(TesselItemCapabilities a, TesselItemCapabilities b) {
    return (static_cast<std::uint32_t>(a) & static_cast<std::uint32_t>(b)) != 0;
}

}  // namespace cindral
