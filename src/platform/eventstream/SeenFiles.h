#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <unordered_map>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/Sys.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// What was seen of files when they were looked at last, so that who tells of their changes need not ask again: plain
/// files with one name and no extended attributes.
///
/// What is handed out holds only for who knows the file's change time to be the same. A few thousand of the newest are
/// kept; while nobody asks, no more than that are taken.
///
/// Thread safety: all operations, from any thread.
class SeenFiles {
public:
    /// Kept twice over: the newer and the older half.
    static constexpr std::size_t kFilesMax = 2'048;

    /// Whether there is use in put().
    bool takesMore() const;
    void put(const FileStatus& status);
    void forget(FileID fileID);
    void clear();

    /// Null where nothing is known, or something else than an object of that birth, change (both as the index has them)
    /// and size was seen.
    std::shared_ptr<const FileStatus> find(FileID fileID, std::int64_t birthTime, std::int64_t changeTime,
                                           std::uint64_t size) const;

private:
    using Files = std::unordered_map<FileID, std::shared_ptr<const FileStatus>>;
    mutable Mutex mutex_;
    Files newer_ GUARDED_BY(mutex_);
    Files older_ GUARDED_BY(mutex_);
    mutable std::size_t takenSinceAsked_ GUARDED_BY(mutex_) = 0;
};

}  // namespace cindral
