#include "platform/tessel/TreeCopy.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "platform/foundation/Log.h"
#include "platform/foundation/SysEdits.h"

namespace cindral {

namespace {

// What is copied between two looks at whether to go on.
constexpr std::size_t kChunkBytes = std::size_t{8} << 20;
constexpr std::size_t kBufferBytes = std::size_t{256} << 10;
// Files up to this size are read and written: that costs fewer calls than asking for their holes.
constexpr std::uint64_t kSmallFileBytes = std::uint64_t{128} << 10;

constexpr std::string_view kUserNamespace = "user.";
constexpr std::string_view kAccessList = "system.posix_acl_access";
constexpr std::string_view kDefaultAccessList = "system.posix_acl_default";

/// The mode of a copy that belongs to this process: the bits that run a program as its owner stay only where the owner
/// stays.
mode_t modeOfCopy(const FileStatus& status) {
    mode_t mode = status.mode & 01777;
    if (status.owner == ::geteuid() && status.group == ::getegid()) mode |= status.mode & (S_ISUID | S_ISGID);
    return mode;
}

bool isUnsupported(const KsError& error) {
    return error.isPosix(EOPNOTSUPP) || error.isPosix(EXDEV) || error.isPosix(EINVAL) || error.isPosix(ENOTTY) ||
           error.isPosix(ENOSYS);
}

Result<UniqueFd> openForCopying(int handle) {
    constexpr int kFlags = O_RDONLY | O_NONBLOCK | O_NOCTTY;
    Result<UniqueFd> opened = sys::reopen(handle, kFlags | O_NOATIME);
    // Only an object's owner may leave its access time alone.
    if (!opened.ok() && opened.error().isPosix(EPERM)) opened = sys::reopen(handle, kFlags);
    return opened;
}

/// Calls back for each of the NUL-terminated names, until it answers an error.
template <typename Visit>
Result<void> eachName(std::string_view names, Visit visit) {
    while (!names.empty()) {
        const std::size_t end = std::min(names.find('\0'), names.size());
        TRY(visit(std::string(names.substr(0, end))));
        names.remove_prefix(std::min(end + 1, names.size()));
    }
    return {};
}

}  // namespace

class TreeCopy::Visitor final : public TreeVisitor {
public:
    Visitor(TreeCopy& copy, int target, const char* targetName)
        : copy_(copy), target_(target), targetName_(targetName) {}

    Result<Descend> willEnter(WalkedFolder& folder, const WalkedFolder* above) override {
        TRY(copy_.progress_.check());
        const FileStatus* excluded = copy_.options_.excluded;
        if (excluded != nullptr && folder.status.isSameObject(*excluded)) return Descend::no;
        const int parent = above != nullptr ? above->counterpart.get() : target_;
        const char* name = above != nullptr ? folder.name.c_str() : targetName_;
        TRY(sys::mkdirat(parent, name, kPrivateFolder));
        folder.counterpart = TRY(sys::openDirectoryForReading(parent, name, O_NOFOLLOW));
        folder.counterpartStatus = TRY(sys::statx(folder.counterpart.get(), ""));
        if (above != nullptr) {
            copy_.folderPath_.append(folder.name).push_back('/');
        } else {
            copy_.top_ = TRY(sys::openat(folder.counterpart.get(), ".", O_PATH | O_DIRECTORY));
        }
        return Descend::yes;
    }

    Result<void> visit(const WalkedFolder& folder, const char* name) override {
        return copy_.copyEntry(folder.fd.get(), name, folder.counterpart.get(), name);
    }

    Result<Leave> didLeave(WalkedFolder& folder, const WalkedFolder* above) override {
        // Times last: filling a folder changes them.
        TRY(copy_.copyAttributes(folder.fd.get(), folder.status, folder.counterpart.get()));
        TRY(sys::futimens(folder.counterpart.get(), folder.status.accessTime, folder.status.modificationTime));
        if (above != nullptr) copy_.folderPath_.resize(copy_.folderPath_.size() - folder.name.size() - 1);
        copy_.progress_.advance(0, 1);
        return Leave::done;
    }

private:
    TreeCopy& copy_;
    const int target_;
    const char* const targetName_;
};

Result<void> TreeCopy::copy(int source, const char* name, int target, const char* targetName) {
    const FileStatus status = TRY(sys::statx(source, name));
    if (!status.isDirectory()) return copyEntry(source, name, target, targetName);
    Visitor visitor(*this, target, targetName);
    return walkTree(TRY(sys::openDirectoryForReading(source, name, O_NOFOLLOW)), path_, visitor);
}

Result<void> TreeCopy::copyEntry(int source, const char* name, int target, const char* targetName) {
    TRY(progress_.check());
    const Result<UniqueFd> handle = sys::openat(source, name, O_PATH | O_NOFOLLOW);
    if (!handle.ok() && handle.error().isPosix(ENOENT)) {
        // What vanished since it was listed is not part of the tree any more.
        const Result<FileStatus> status = sys::statx(source, name);
        if (!status.ok() && status.error().isPosix(ENOENT)) return {};
        return handle.error();
    }
    if (!handle.ok()) return handle.error();
    const FileStatus status = TRY(sys::statx(handle->get(), ""));
    if (status.isRegular()) {
        TRY(copyRegular(handle->get(), status, target, targetName));
    } else if (S_ISLNK(status.mode)) {
        TRY(copyLink(source, name, status, target, targetName));
    } else if (status.isDirectory()) {
        return KsError::posix(ESTALE);  // A folder took the place of something else since it was listed.
    } else {
        TRY(copyNode(status, target, targetName));
    }
    progress_.advance(0, 1);
    return {};
}

Result<void> TreeCopy::copyRegular(int handle, const FileStatus& status, int target, const char* targetName) {
    if (status.names > 1 && TRY(linkToFirstName(status, target, targetName))) return {};
    const UniqueFd source = TRY(openForCopying(handle));
    const UniqueFd file = TRY(sys::openat(target, targetName, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW, kPrivateFile));
    return copyFile(source.get(), status, file.get());
}

/// True when the file was copied under another of its names, and now has this one too.
Result<bool> TreeCopy::linkToFirstName(const FileStatus& status, int target, const char* targetName) {
    if (!top_) return false;
    const ObjectKey key{status.device, status.fileID};
    const auto first = firstNames_.find(key);
    if (first == firstNames_.end()) {
        firstNames_.emplace(key, folderPath_ + targetName);
        return false;
    }
    const std::size_t slash = first->second.rfind('/');
    const std::string folder = slash == std::string::npos ? "" : first->second.substr(0, slash);
    const std::string name = first->second.substr(slash == std::string::npos ? 0 : slash + 1);
    const UniqueFd parent =
        TRY(sys::openBeneath(top_.get(), folder, O_PATH | O_DIRECTORY, RESOLVE_NO_SYMLINKS | RESOLVE_NO_XDEV));
    const Result<void> linked = sys::linkat(parent.get(), name.c_str(), target, targetName);
    // Where a file can't have so many names, or several at all, it becomes several files.
    if (!linked.ok() && (linked.error().isPosix(EMLINK) || linked.error().isPosix(EPERM))) return false;
    TRY(linked);
    progress_.advance(status.size, 0);
    return true;
}

Result<void> TreeCopy::copyLink(int source, const char* name, const FileStatus& status, int target,
                                const char* targetName) {
    TRY(sys::symlinkat(TRY(sys::readlinkat(source, name)), target, targetName));
    return sys::utimensat(target, targetName, status.accessTime, status.modificationTime);
}

Result<void> TreeCopy::copyNode(const FileStatus& status, int target, const char* targetName) {
    TRY(sys::mknodat(target, targetName, (status.mode & S_IFMT) | kPrivateFile, status.specialDevice));
    const UniqueFd handle = TRY(sys::openat(target, targetName, O_PATH | O_NOFOLLOW));
    TRY(sys::fchmod(handle.get(), modeOfCopy(status)));
    return sys::utimensat(target, targetName, status.accessTime, status.modificationTime);
}

Result<void> TreeCopy::copyFile(int source, const FileStatus& status, int target) {
    TRY(copyData(source, status, target));
    TRY(copyAttributes(source, status, target));
    return sys::futimens(target, status.accessTime, status.modificationTime);
}

Result<void> TreeCopy::copyData(int source, const FileStatus& status, int target) {
    // Files of no size may still have contents: those that the kernel makes up.
    if (status.size <= kSmallFileBytes) return copyByReading(source, status.size, target, 0, UINT64_MAX);
    if (canClone_) {
        const Result<void> cloned = sys::ficlone(target, source);
        if (cloned.ok()) {
            progress_.advance(status.size, 0);
            return {};
        }
        if (!isUnsupported(cloned.error())) return cloned;
        canClone_ = false;
    }
    return copyExtents(source, target);
}

Result<void> TreeCopy::copyExtents(int source, int target) {
    std::uint64_t at = 0;
    while (true) {
        const Result<std::uint64_t> data = sys::lseek(source, at, SEEK_DATA);
        if (!data.ok() && data.error().isPosix(ENXIO)) break;
        // Where holes can't be asked for, there are none.
        if (!data.ok() && isUnsupported(data.error())) return copyRange(source, target, at, UINT64_MAX);
        const std::uint64_t begin = TRY(data);
        const std::uint64_t end = TRY(sys::lseek(source, begin, SEEK_HOLE));
        progress_.advance(begin - at, 0);
        TRY(copyRange(source, target, begin, end));
        at = end;
    }
    // A hole at the end.
    const std::uint64_t size = TRY(sys::statx(source, "")).size;
    if (size <= at) return {};
    TRY(sys::ftruncate(target, size));
    progress_.advance(size - at, 0);
    return {};
}

/// Copies up to the end of the range or of the file.
Result<void> TreeCopy::copyRange(int source, int target, std::uint64_t begin, std::uint64_t end) {
    while (begin < end && canCopyInKernel_) {
        TRY(progress_.check());
        const std::size_t wanted = static_cast<std::size_t>(std::min<std::uint64_t>(end - begin, kChunkBytes));
        const Result<std::size_t> copied = sys::copy_file_range(source, begin, target, begin, wanted);
        if (!copied.ok() && !isUnsupported(copied.error())) return copied.error();
        // Nothing: the end of the file, or a file system that only says so. Reading tells.
        if (copied.ok() && *copied == 0) break;
        canCopyInKernel_ = copied.ok();
        if (!copied.ok()) break;
        begin += *copied;
        progress_.advance(*copied, 0);
    }
    return begin < end ? copyByReading(source, 0, target, begin, end) : Result<void>();
}

Result<void> TreeCopy::copyByReading(int source, std::uint64_t size, int target, std::uint64_t begin,
                                     std::uint64_t end) {
    buffer_.resize(kBufferBytes);
    while (begin < end) {
        TRY(progress_.check());
        const auto wanted = static_cast<std::size_t>(std::min<std::uint64_t>(end - begin, buffer_.size()));
        const std::size_t got = TRY(sys::pread(source, std::span(buffer_).first(wanted), begin));
        if (got == 0) break;
        TRY(sys::pwrite(target, ByteView(buffer_).first(got), begin));
        begin += got;
        progress_.advance(got, 0);
        // Files that the kernel makes up come in pieces; of all others, less than was asked for is the end.
        if (got < wanted && begin == size) break;
    }
    return {};
}

Result<void> TreeCopy::copyAttributes(int source, const FileStatus& status, int target) {
    const mode_t mode = modeOfCopy(status);
    std::string names;
    const bool hasAny = TRY(sys::hasXattrs(source, "", names));
    // The user's attributes first: a mode may take away the right to set them.
    if (hasAny) {
        TRY(eachName(names, [&](const std::string& name) -> Result<void> {
            return name.starts_with(kUserNamespace) ? copyAttribute(source, name.c_str(), target, mode)
                                                    : Result<void>();
        }));
    }
    TRY(sys::fchmod(target, mode));
    if (!hasAny) return {};
    return eachName(names, [&](const std::string& name) -> Result<void> {
        const bool isAccessList = name == kAccessList || name == kDefaultAccessList;
        return isAccessList ? copyAttribute(source, name.c_str(), target, mode) : Result<void>();
    });
}

Result<void> TreeCopy::copyAttribute(int source, const char* name, int target, mode_t mode) {
    const Result<std::size_t> size = sys::getxattrat(source, "", name, {});
    if (!size.ok() && size.error().isPosix(ENODATA)) return {};  // Taken away since the names were read.
    Bytes value(TRY(size));
    if (!value.empty()) value.resize(TRY(sys::getxattrat(source, "", name, value)));
    const Result<void> set = sys::fsetxattr(target, name, value);
    if (set.ok() || !set.error().isPosix(EOPNOTSUPP)) return set;
    if (options_.attributeLoss == AttributeLoss::isAnError) return set;
    if (!hasLostAttributes_) logError("can't keep the attributes of {}; {}", path_, set.error().description());
    hasLostAttributes_ = true;
    // With an access list the group's bits say what anybody on the list may do; without it the group itself would get
    // them.
    if (name == kAccessList) return sys::fchmod(target, mode & ~static_cast<mode_t>(S_IRWXG));
    return {};
}

namespace {

class MeasuringVisitor final : public TreeVisitor {
public:
    MeasuringVisitor(const FileStatus* excluded, const TesselProgress& progress)
        : excluded_(excluded), progress_(progress) {}

    Result<Descend> willEnter(WalkedFolder& folder, const WalkedFolder* /*above*/) override {
        TRY(progress_.check());
        if (excluded_ != nullptr && folder.status.isSameObject(*excluded_)) return Descend::no;
        ++items;
        return Descend::yes;
    }
    Result<void> visit(const WalkedFolder& folder, const char* name) override {
        TRY(progress_.check());
        const Result<FileStatus> status = sys::statx(folder.fd.get(), name);
        if (!status.ok()) return status.error().isPosix(ENOENT) ? Result<void>() : Result<void>(status.error());
        ++items;
        if (status->isRegular()) bytes += status->size;
        return {};
    }
    Result<Leave> didLeave(WalkedFolder& /*folder*/, const WalkedFolder* /*above*/) override { return Leave::done; }

    std::uint64_t items = 0;
    std::uint64_t bytes = 0;

private:
    const FileStatus* const excluded_;
    const TesselProgress& progress_;
};

}  // namespace

Result<void> measureTree(int directory, const char* name, const std::string& path, const FileStatus* excluded,
                         TesselProgress& progress) {
    const FileStatus status = TRY(sys::statx(directory, name));
    if (!status.isDirectory()) {
        progress.setTotal(status.isRegular() ? status.size : 0, 1);
        return {};
    }
    MeasuringVisitor visitor(excluded, progress);
    TRY(walkTree(TRY(sys::openDirectoryForReading(directory, name, O_NOFOLLOW)), path, visitor));
    progress.setTotal(visitor.bytes, visitor.items);
    return {};
}

namespace {

class ComparingVisitor final : public TreeVisitor {
public:
    ComparingVisitor(int copy, const char* copyName, Thoroughness thoroughness, const TesselProgress* progress)
        : copy_(copy), copyName_(copyName), thoroughness_(thoroughness), progress_(progress) {}

    Result<Descend> willEnter(WalkedFolder& folder, const WalkedFolder* above) override {
        const int parent = above != nullptr ? above->counterpart.get() : copy_;
        const char* name = above != nullptr ? folder.name.c_str() : copyName_;
        folder.counterpart = TRY(sys::openDirectoryForReading(parent, name, O_NOFOLLOW));
        folder.counterpartStatus = TRY(sys::statx(folder.counterpart.get(), ""));
        // The same number of entries, each of which is looked for by name: then none is left over.
        const std::uint64_t count = TRY(sys::countEntries(folder.fd.get(), ".", UINT64_MAX));
        if (count != TRY(sys::countEntries(folder.counterpart.get(), ".", UINT64_MAX))) return KsError::posix(EIO);
        return Descend::yes;
    }

    Result<void> visit(const WalkedFolder& folder, const char* name) override {
        return compare(folder.fd.get(), name, folder.counterpart.get(), name);
    }

    Result<Leave> didLeave(WalkedFolder& /*folder*/, const WalkedFolder* /*above*/) override { return Leave::done; }

    Result<void> compare(int source, const char* name, int copy, const char* copyName) {
        if (progress_ != nullptr) TRY(progress_->check());
        const FileStatus ours = TRY(sys::statx(source, name));
        const FileStatus theirs = TRY(sys::statx(copy, copyName));
        if ((ours.mode & S_IFMT) != (theirs.mode & S_IFMT) ||
            !isSameTime(ours.modificationTime, theirs.modificationTime)) {
            return KsError::posix(EIO);
        }
        if (S_ISLNK(ours.mode) && TRY(sys::readlinkat(source, name)) != TRY(sys::readlinkat(copy, copyName)))
            return KsError::posix(EIO);
        if (!ours.isRegular()) return {};
        if (ours.size != theirs.size) return KsError::posix(EIO);
        if (thoroughness_ == Thoroughness::stamps) return {};
        return compareContents(TRY(openRegular(source, name)), TRY(openRegular(copy, copyName)));
    }

private:
    /// Some file systems keep whole seconds, or every other one.
    static bool isSameTime(const KsDate& source, const KsDate& copy) {
        if (copy.nanoseconds != 0) return source == copy;
        return source.seconds - copy.seconds <= 1 && copy.seconds - source.seconds <= 1;
    }

    static Result<UniqueFd> openRegular(int directory, const char* name) {
        const UniqueFd handle = TRY(sys::openat(directory, name, O_PATH | O_NOFOLLOW));
        if (!TRY(sys::statx(handle.get(), "")).isRegular()) return KsError::posix(EIO);
        return openForCopying(handle.get());
    }

    Result<void> compareContents(const UniqueFd& a, const UniqueFd& b) {
        ours_.resize(kBufferBytes);
        theirs_.resize(kBufferBytes);
        for (std::uint64_t at = 0;;) {
            if (progress_ != nullptr) TRY(progress_->check());
            const std::size_t got = TRY(sys::pread(a.get(), ours_, at));
            std::size_t filled = 0;
            while (filled < got) {
                const std::size_t more =
                    TRY(sys::pread(b.get(), std::span(theirs_).subspan(filled, got - filled), at + filled));
                if (more == 0) return KsError::posix(EIO);
                filled += more;
            }
            if (got == 0) return {};
            if (std::memcmp(ours_.data(), theirs_.data(), got) != 0) return KsError::posix(EIO);
            at += got;
        }
    }

    const int copy_;
    const char* const copyName_;
    const Thoroughness thoroughness_;
    const TesselProgress* const progress_;
    std::vector<std::byte> ours_;
    std::vector<std::byte> theirs_;
};

}  // namespace

Result<void> compareTrees(int source, const char* name, int copy, const char* copyName, const std::string& path,
                          Thoroughness thoroughness, const TesselProgress* progress) {
    ComparingVisitor visitor(copy, copyName, thoroughness, progress);
    if (!TRY(sys::statx(source, name)).isDirectory()) return visitor.compare(source, name, copy, copyName);
    return walkTree(TRY(sys::openDirectoryForReading(source, name, O_NOFOLLOW)), path, visitor);
}

}  // namespace cindral
