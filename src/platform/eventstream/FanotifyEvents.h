#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string_view>

#include "platform/foundation/Data.h"

namespace cindral {

/// One event as a fanotify group that reports file handles and names writes it.
///
/// Borrows from the bytes that it was read from.
struct FanotifyEvent {
    /// An object's file handle, and the file system that it belongs to (f_fsid).
    struct Object {
        std::uint64_t fileSystem = 0;
        std::int32_t handleType = 0;
        ByteView handle;

        /// A number to find it by. Unequal objects hardly ever have the same.
        std::uint64_t digest() const;
    };
    /// A name in a folder; "." or none is the folder itself.
    struct Entry {
        Object folder;
        std::string_view name;

        bool isFolderItself() const { return name.empty() || name == "."; }
    };

    std::uint64_t mask = 0;  ///< FAN_ bits
    std::array<Entry, 2> entries{};
    std::size_t entryCount = 0;    ///< two for a rename: the old name and the new one
    std::optional<Object> object;  ///< what the entry names; or what happened to an object without telling a name
};

/// Takes the first event off the bytes. None, with the bytes as they were, when they do not begin with a whole event.
std::optional<FanotifyEvent> takeFanotifyEvent(ByteView& bytes);

}  // namespace cindral
