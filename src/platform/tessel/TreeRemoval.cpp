#include "platform/tessel/TreeRemoval.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "platform/foundation/SysEdits.h"
#include "platform/tessel/TreeWalk.h"

namespace cindral {

namespace {

// Somebody who still fills a folder that is being removed is not waited for for ever.
constexpr int kReadingsMax = 100;

class CheckingVisitor final : public TreeVisitor {
public:
    explicit CheckingVisitor(const TesselProgress& progress) : progress_(progress) {}

    Result<Descend> willEnter(WalkedFolder& folder, const WalkedFolder* above) override {
        TRY(progress_.check());
        ++items;
        if (above != nullptr) TRY(checkMayBeRemoved(*above, folder.status));
        TRY(checkIsOfTheTree(folder, above));
        return Descend::yes;
    }

    Result<void> visit(const WalkedFolder& folder, const char* name) override {
        TRY(progress_.check());
        const Result<FileStatus> status = sys::statx(folder.fd.get(), name);
        if (!status.ok()) return status.error().isPosix(ENOENT) ? Result<void>() : Result<void>(status.error());
        ++items;
        return checkMayBeRemoved(folder, *status);
    }

    Result<Leave> didLeave(WalkedFolder& /*folder*/, const WalkedFolder* /*above*/) override { return Leave::done; }

    std::uint64_t items = 0;

private:
    static Result<void> checkIsOfTheTree(const WalkedFolder& folder, const WalkedFolder* above) {
        const bool isMount = (folder.status.attributes & STATX_ATTR_MOUNT_ROOT) != 0;
        if (isMount || (above != nullptr && above->status.device != folder.status.device)) return KsError::posix(EBUSY);
        return {};
    }

    Result<void> checkMayBeRemoved(const WalkedFolder& folder, const FileStatus& status) {
        constexpr std::uint64_t kUnchangeable = STATX_ATTR_IMMUTABLE | STATX_ATTR_APPEND;
        if ((status.attributes & kUnchangeable) != 0 || (folder.status.attributes & kUnchangeable) != 0)
            return KsError::posix(EPERM);
        // Asked once a folder, and only of those that hold something: an empty one may go whatever its mode.
        if (checkedFolder_ != folder.status.fileID) {
            if (!TRY(sys::isWritable(folder.fd.get(), ""))) return KsError::posix(EACCES);
            checkedFolder_ = folder.status.fileID;
        }
        const uid_t self = ::geteuid();
        const bool isSticky = (folder.status.mode & S_ISVTX) != 0;
        if (isSticky && self != 0 && self != folder.status.owner && self != status.owner) return KsError::posix(EPERM);
        return {};
    }

    const TesselProgress& progress_;
    std::uint64_t checkedFolder_ = 0;
};

/// Gives a folder's owner every right to it. False for somebody else's, or for what is no folder.
bool unlock(int directory, const char* name) {
    const Result<UniqueFd> handle = sys::openat(directory, name, O_PATH | O_NOFOLLOW | O_DIRECTORY);
    return handle.ok() && sys::fchmod(handle->get(), S_IRWXU).ok();
}

class RemovingVisitor final : public TreeVisitor {
public:
    RemovingVisitor(int directory, const char* name, TesselProgress* progress)
        : directory_(directory), name_(name), progress_(progress) {}

    Result<Descend> willEnter(WalkedFolder& folder, const WalkedFolder* /*above*/) override {
        // A mode forbids people to change what is in a folder, not a folder that is to go. What that doesn't help, the
        // removal tells.
        const bool isLocked = (folder.status.mode & S_IRWXU) != S_IRWXU && folder.status.owner == ::geteuid();
        if (isLocked) (void)sys::fchmod(folder.fd.get(), S_IRWXU);
        return Descend::yes;
    }

    bool hasUnlocked(const WalkedFolder& folder, const char* name) override { return unlock(folder.fd.get(), name); }

    Result<void> visit(const WalkedFolder& folder, const char* name) override {
        return remove(folder.fd.get(), name, 0);
    }

    Result<Leave> didLeave(WalkedFolder& folder, const WalkedFolder* above) override {
        const int parent = above != nullptr ? above->fd.get() : directory_;
        const Result<void> removed = remove(parent, above != nullptr ? folder.name.c_str() : name_, AT_REMOVEDIR);
        if (removed.ok()) return Leave::done;
        const bool isFilled = removed.error().isPosix(ENOTEMPTY) || removed.error().isPosix(EEXIST);
        if (!isFilled || ++readings_ > kReadingsMax) return removed.error();
        return Leave::readAgain;
    }

private:
    Result<void> remove(int directory, const char* name, int flags) {
        const Result<void> removed = sys::unlinkat(directory, name, flags);
        if (!removed.ok() && !removed.error().isPosix(ENOENT)) return removed;
        if (progress_ != nullptr) progress_->advance(0, 1);
        return {};
    }

    const int directory_;
    const char* const name_;
    TesselProgress* const progress_;
    int readings_ = 0;
};

}  // namespace

Result<void> checkTreeIsRemovable(int directory, const char* name, const std::string& path, TesselProgress& progress) {
    CheckingVisitor visitor(progress);
    TRY(walkTree(TRY(sys::openDirectoryForReading(directory, name, O_NOFOLLOW)), path, visitor));
    progress.setTotal(0, visitor.items);  // What costs time is the number of things, not their bytes.
    return {};
}

Result<void> removeTree(int directory, const char* name, const std::string& path, TesselProgress* progress) {
    const Result<void> unlinked = sys::unlinkat(directory, name);
    if (unlinked.ok() || unlinked.error().isPosix(ENOENT)) return {};
    // A folder answers EISDIR here, and EPERM where the file system takes the standard at its word.
    if (!unlinked.error().isPosix(EISDIR) && !unlinked.error().isPosix(EPERM)) return unlinked;
    RemovingVisitor visitor(directory, name, progress);
    Result<UniqueFd> top = sys::openDirectoryForReading(directory, name, O_NOFOLLOW);
    if (!top.ok() && top.error().isPosix(EACCES) && unlock(directory, name))
        top = sys::openDirectoryForReading(directory, name, O_NOFOLLOW);
    return walkTree(TRY(std::move(top)), path, visitor);
}

}  // namespace cindral
