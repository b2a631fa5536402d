#include "platform/eventstream/SeenFiles.h"

#include <utility>

#include "platform/eventstream/IndexKeeperTypes.h"

namespace cindral {

bool SeenFiles::takesMore() const {
    const MutexLock lock(mutex_);
    return takenSinceAsked_ < 2 * kFilesMax;
}

void SeenFiles::put(const FileStatus& status) {
    const FileID fileID{status.fileID};
    auto seen = std::make_shared<const FileStatus>(status);
    const MutexLock lock(mutex_);
    ++takenSinceAsked_;
    if (newer_.size() >= kFilesMax) older_ = std::exchange(newer_, {});
    older_.erase(fileID);
    newer_.insert_or_assign(fileID, std::move(seen));
}

void SeenFiles::forget(FileID fileID) {
    const MutexLock lock(mutex_);
    newer_.erase(fileID);
    older_.erase(fileID);
}

void SeenFiles::clear() {
    const MutexLock lock(mutex_);
    newer_.clear();
    older_.clear();
}

std::shared_ptr<const FileStatus> SeenFiles::find(FileID fileID, std::int64_t birthTime, std::int64_t changeTime,
                                                  std::uint64_t size) const {
    std::shared_ptr<const FileStatus> seen;
    {
        const MutexLock lock(mutex_);
        takenSinceAsked_ = 0;
        for (const Files* files : {&newer_, &older_}) {
            if (const auto found = files->find(fileID); found != files->end()) seen = found->second;
            if (seen) break;
        }
    }
    const bool isSame = seen && seen->birthStamp() == birthTime &&
                        index_keeper::stampOf(seen->changeTime) == changeTime && seen->size == size;
    return isSame ? seen : nullptr;
}

}  // namespace cindral
