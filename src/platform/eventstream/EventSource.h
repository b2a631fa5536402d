#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string_view>

#include "platform/foundation/Result.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// What is read of the kernel's queue at once: a few hundred events. One is at most 272 bytes with inotify, a thousand
/// with fanotify.
inline constexpr std::size_t kEventBufferBytes = 32'768;

/// A hint that something is to be looked at. What happened is not said: the kernel merges events on one object, so
/// that a replay of them can end at the wrong name.
struct EventHint {
    enum class Kind {
        entry,     ///< `name` in `folder` came, went, or its object changed
        object,    ///< the object `fileID` itself changed: its attributes, its contents, its number of names, its place
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
/// folders and watched files themselves: not of the folders' grandchildren, not of what else is on the file system.
/// Beyond that, object hints may be of anything; look up the file ID before anything else.
///
/// What has no hint: a store into mapped memory, before the map and the file are closed. A change that is made under a
/// name outside of the watched folders, to a file that is not watched itself. The removal of a folder that somebody has
/// open, a root above all, before it is closed (its parent's entry has one). With fanotify, the unmounting of a root.
///
/// The receiver may watch and forget. A hint that is equal to the one before may be left out when both had happened
/// before the first was told.
///
/// Thread safety: one thread at a time, except pollDescriptor().
class EventSource {
public:
    virtual ~EventSource() = default;

    /// "inotify" or "fanotify".
    virtual std::string_view name() const = 0;
    /// Before anything below a root is watched. `folder` is open for reading. EXDEV or EOPNOTSUPP where the interface
    /// does not work on the file system (ENODEV where that has no number of its own), EPERM where the process may not
    /// use it. With fanotify the file system is in use, and can't be unmounted, for as long as the source lives.
    virtual Result<void> addRoot(int folder) = 0;
    /// Watches the entries of the open folder (O_PATH will do), and the folder itself. ENOSPC at the watch limit.
    /// Watching what is watched already is no error.
    virtual Result<void> watchFolder(int folder, FileID fileID) = 0;
    /// Watches a file itself, wherever it is changed from: one with several names. ENOSPC at the watch limit.
    virtual Result<void> watchFile(int file, FileID fileID) = 0;
    /// Hints of it that are under way may still come. Nothing happens when it isn't watched.
    virtual void forget(FileID fileID) = 0;

    using Receiver = std::function<void(const EventHint&)>;
    /// Calls back for every hint of what was complete before the call, without waiting for more. After an error, hints
    /// may be missing.
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
/// One mark for each file system, with file handles and names: EPERM without CAP_SYS_ADMIN. The queue has no limit.
///
/// The mark tells of everything on the file system, what this process writes included: what is not of a watched folder
/// or file is dropped at once, so that a drain may have nothing to tell though pollDescriptor() was readable. A file
/// whose number of names changed has an object hint although it is not watched, where the process may open it by its
/// handle (CAP_DAC_READ_SEARCH); so it can be watched before it is changed under its other name.
Result<std::unique_ptr<EventSource>> makeFanotifySource();

}  // namespace cindral
