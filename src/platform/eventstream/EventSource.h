#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string_view>

#include "platform/foundation/Result.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// A hint that something is to be looked at. What happened is not said: the kernel merges events on one object, so
/// that a replay of them can end at the wrong name.
struct EventHint {
    enum class Kind {
        entry,     ///< `name` in `folder` came, went, or its object changed
        object,    ///< the object `fileID` itself changed: its attributes, its number of names, a folder's entries
        overflow,  ///< hints were lost: look at everything
        lost,      ///< the watch on `fileID` ended by itself: the object was deleted, or its file system unmounted
    };
    Kind kind = Kind::entry;
    FileID folder{};
    std::string_view name{};  ///< borrowed for the call
    FileID fileID{};
};

/// Where the recorder's hints come from: one of the kernel's two interfaces.
///
/// A watch holds from the moment on at which watchFolder() returned. Hints are of watched folders' entries, of watched
/// folders and watched files themselves, and of nothing else: not of the folders' grandchildren, not of what else is on
/// the file system.
///
/// Thread safety: one thread at a time, except pollDescriptor().
class EventSource {
public:
    virtual ~EventSource() = default;

    /// "inotify" or "fanotify".
    virtual std::string_view name() const = 0;
    /// Before anything below a root is watched. `folder` is open for reading. EXDEV or EOPNOTSUPP where the interface
    /// does not work on the file system, EPERM where the process may not use it.
    virtual Result<void> addRoot(int folder) = 0;
    /// Watches the entries of the open folder (O_PATH will do), and the folder itself. ENOSPC at the watch limit.
    /// Watching what is watched already is no error.
    virtual Result<void> watchFolder(int folder, FileID fileID) = 0;
    /// Watches a file itself, wherever it is changed from: one with several names. ENOSPC at the watch limit.
    virtual Result<void> watchFile(int file, FileID fileID) = 0;
    /// Hints of it that are under way may still come. Nothing happens when it isn't watched.
    virtual void forget(FileID fileID) = 0;

    using Receiver = std::function<void(const EventHint&)>;
    /// Calls back for every hint up to now, without waiting for more.
    virtual Result<void> drain(const Receiver& receive) = 0;
    /// Readable when there are hints.
    virtual int pollDescriptor() const = 0;

    /// Watches in use, and how many there may be (0: no limit). For the log and the status.
    struct Usage {
        std::uint64_t used = 0;
        std::uint64_t limit = 0;
    };
    virtual Usage usage() const = 0;
};

/// Needs no privilege. One watch, and some kernel memory, for each folder.
Result<std::unique_ptr<EventSource>> makeInotifySource();
/// One mark for each file system, with file handles and names: CAP_SYS_ADMIN.
Result<std::unique_ptr<EventSource>> makeFanotifySource();

}  // namespace cindral
