#include "platform/foundation/Sys.h"

#include <fmt/format.h>
#include <linux/magic.h>
#include <linux/openat2.h>
#include <sys/fanotify.h>
#include <sys/inotify.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <sys/utsname.h>
#include <sys/vfs.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iterator>

#include "platform/foundation/SysFaults.h"

namespace cindral {

namespace {

// The *xattrat calls of Linux 6.13; the C library has no names for them yet. The numbers are those of every
// architecture but alpha.
constexpr long kGetxattratCall = 464;
constexpr long kListxattratCall = 465;

struct XattrArguments {
    std::uint64_t value;
    std::uint32_t size;
    std::uint32_t flags;
};

bool hasXattratCalls() {
    // A kernel that knows the call refuses the descriptor; one that doesn't, or a filter that forbids it, answers
    // something else.
    static const bool known =
        ::syscall(kListxattratCall, -1, "", AT_EMPTY_PATH, nullptr, std::size_t{0}) < 0 && errno == EBADF;
    return known;
}

/// "/proc/self/fd/N" or "/proc/self/fd/N/name": the way to an entry of an open directory for calls that take no
/// descriptor.
std::string pathThroughDescriptor(int directory, const char* name) {
    return *name == '\0' ? fmt::format("/proc/self/fd/{}", directory)
                         : fmt::format("/proc/self/fd/{}/{}", directory, name);
}

// With an empty name and a descriptor opened with O_PATH the path through /proc is the only way: that is no open file to
// the other calls.
ssize_t listxattrOnce(int directory, const char* name, char* buffer, std::size_t size) {
    if (*name != '\0' && hasXattratCalls()) {
        return ::syscall(kListxattratCall, directory, name, AT_SYMLINK_NOFOLLOW, buffer, size);
    }
    if (*name == '\0') {
        const ssize_t got = ::flistxattr(directory, buffer, size);
        if (got >= 0 || errno != EBADF) return got;
    }
    const std::string path = pathThroughDescriptor(directory, name);
    return *name == '\0' ? ::listxattr(path.c_str(), buffer, size) : ::llistxattr(path.c_str(), buffer, size);
}

ssize_t getxattrOnce(int directory, const char* name, const char* attribute, void* buffer, std::size_t size) {
    if (*name != '\0' && hasXattratCalls()) {
        XattrArguments arguments{reinterpret_cast<std::uint64_t>(buffer), static_cast<std::uint32_t>(size), 0};
        return ::syscall(kGetxattratCall, directory, name, AT_SYMLINK_NOFOLLOW, attribute, &arguments,
                         sizeof arguments);
    }
    if (*name == '\0') {
        const ssize_t got = ::fgetxattr(directory, attribute, buffer, size);
        if (got >= 0 || errno != EBADF) return got;
    }
    const std::string path = pathThroughDescriptor(directory, name);
    return *name == '\0' ? ::getxattr(path.c_str(), attribute, buffer, size)
                         : ::lgetxattr(path.c_str(), attribute, buffer, size);
}

KsDate dateOf(const statx_timestamp& time) {
    return {time.tv_sec, time.tv_nsec};
}

}  // namespace

std::int64_t FileStatus::birthStamp() const {
    if (!birthTime) return 0;
    const std::int64_t stamp = birthTime->seconds * 1'000'000'000 + birthTime->nanoseconds;
    return stamp == 0 ? 1 : stamp;  // 0 says that there is none.
}

std::uint32_t FileStatus::deviceID() const {
    // Twelve bits of major and twenty of minor number: the kernel's own packing.
    const auto packed = static_cast<std::uint32_t>(((device >> 32) << 20) | (device & 0xFFFFF));
    return packed == 0 ? 1 : packed;
}

namespace sys {

Result<UniqueFd> open(const char* path, int flags, mode_t mode) {
    return openat(AT_FDCWD, path, flags, mode);
}

Result<UniqueFd> openat(int directory, const char* name, int flags, mode_t mode) {
    while (true) {
        const int fd = isToFail("openat") ? -1 : ::openat(directory, name, flags | O_CLOEXEC, mode);
        if (fd >= 0) return UniqueFd(fd);
        if (errno != EINTR) return KsError::posix(errno);
    }
}

namespace {

Result<UniqueFd> openat2(int directory, const char* path, int flags, std::uint64_t resolve) {
    open_how how{};
    how.flags = static_cast<std::uint64_t>(flags) | O_CLOEXEC;
    how.resolve = resolve | RESOLVE_BENEATH | RESOLVE_NO_MAGICLINKS;
    while (true) {
        const long fd = isToFail("openat2") ? -1 : ::syscall(SYS_openat2, directory, path, &how, sizeof how);
        if (fd >= 0) return UniqueFd(static_cast<int>(fd));
        // EAGAIN: a rename elsewhere raced with the walk, which then can't prove that it stayed beneath.
        if (errno != EINTR && errno != EAGAIN) return KsError::posix(errno);
    }
}

}  // namespace

Result<UniqueFd> openBeneath(int directory, std::string_view relativePath, int flags, std::uint64_t resolve) {
    UniqueFd holder;
    while (relativePath.size() >= PATH_MAX) {
        const std::size_t cut = relativePath.rfind('/', PATH_MAX - 1);
        if (cut == std::string_view::npos || cut == 0) return KsError::posix(ENAMETOOLONG);
        const std::string piece(relativePath.substr(0, cut));
        holder = TRY(openat2(directory, piece.c_str(), O_PATH | O_DIRECTORY, resolve));
        directory = holder.get();
        relativePath.remove_prefix(cut + 1);
    }
    if (relativePath.empty()) relativePath = ".";
    return openat2(directory, std::string(relativePath).c_str(), flags, resolve);
}

Result<FileStatus> statx(int directory, const char* name) {
    struct ::statx raw;
    const int flags = AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | (*name == '\0' ? AT_EMPTY_PATH : 0);
    while (isToFail("statx") || ::statx(directory, name, flags, STATX_BASIC_STATS | STATX_BTIME, &raw) != 0) {
        if (errno != EINTR) return KsError::posix(errno);
    }
    FileStatus status;
    status.fileID = raw.stx_ino;
    status.device = (std::uint64_t{raw.stx_dev_major} << 32) | raw.stx_dev_minor;
    if ((raw.stx_mask & STATX_MNT_ID) != 0) status.mount = raw.stx_mnt_id;
    status.size = raw.stx_size;
    status.attributes = raw.stx_attributes;
    status.modificationTime = dateOf(raw.stx_mtime);
    status.changeTime = dateOf(raw.stx_ctime);
    if ((raw.stx_mask & STATX_BTIME) != 0) status.birthTime = dateOf(raw.stx_btime);
    status.mode = raw.stx_mode;
    status.owner = raw.stx_uid;
    status.group = raw.stx_gid;
    status.names = raw.stx_nlink;
    status.accessTime = dateOf(raw.stx_atime);
    status.specialDevice = makedev(raw.stx_rdev_major, raw.stx_rdev_minor);
    return status;
}

Result<bool> hasXattrs(int directory, const char* name, std::string& names) {
    char buffer[512];
    const ssize_t size = isToFail("listxattr") ? -1 : listxattrOnce(directory, name, buffer, sizeof buffer);
    if (size >= 0) {
        names.assign(buffer, static_cast<std::size_t>(size));
        return size > 0;
    }
    if (errno == ENOTSUP) return false;
    if (errno != ERANGE && errno != EINTR) return KsError::posix(errno);
    names = TRY(listxattrat(directory, name));
    return !names.empty();
}

Result<std::string> listxattrat(int directory, const char* name) {
    std::string names;
    while (true) {
        const ssize_t size = isToFail("listxattr") ? -1 : listxattrOnce(directory, name, nullptr, 0);
        if (size < 0 && errno == EINTR) continue;
        if (size < 0) return errno == ENOTSUP ? Result<std::string>(std::string()) : KsError::posix(errno);
        names.resize(static_cast<std::size_t>(size));
        if (size == 0) return names;
        const ssize_t read = listxattrOnce(directory, name, names.data(), names.size());
        if (read >= 0) {
            names.resize(static_cast<std::size_t>(read));
            return names;
        }
        if (errno != ERANGE) return KsError::posix(errno);  // ERANGE: the list grew between the two calls.
    }
}

Result<std::size_t> getxattrat(int directory, const char* name, const char* attribute, std::span<std::byte> buffer) {
    while (true) {
        const ssize_t size =
            isToFail("getxattr") ? -1 : getxattrOnce(directory, name, attribute, buffer.data(), buffer.size());
        if (size >= 0) return static_cast<std::size_t>(size);
        if (errno != EINTR) return KsError::posix(errno);
    }
}

Result<bool> isWritable(int directory, const char* name) {
    const int flags = AT_EACCESS | (*name == '\0' ? AT_EMPTY_PATH : AT_SYMLINK_NOFOLLOW);
    while (isToFail("faccessat") || ::faccessat(directory, name, W_OK, flags) != 0) {
        if (errno == EINTR) continue;
        if (errno == EACCES || errno == EROFS || errno == EPERM || errno == ETXTBSY) return false;
        return KsError::posix(errno);
    }
    return true;
}

bool isClosedDirectory(int directory, const char* name) {
    return ::faccessat(directory, name, R_OK | X_OK, AT_EACCESS | AT_SYMLINK_NOFOLLOW) != 0 && errno != ENOENT;
}

namespace {

/// Labels can refuse what the mode allows. Where the kernel has them, every file is asked for.
bool kernelHasMandatoryLabels() {
    static const bool has = [] {
        std::ifstream fileSystems("/proc/filesystems");
        const std::string text(std::istreambuf_iterator<char>(fileSystems), {});
        return text.empty() || text.find("selinuxfs") != std::string::npos || text.find("smackfs") != std::string::npos;
    }();
    return has;
}

bool kernelStampsAreDistinct() {
    static const bool distinct = [] {
        utsname name{};
        int major = 0;
        int minor = 0;
        if (::uname(&name) != 0 || std::sscanf(name.release, "%d.%d", &major, &minor) != 2) return false;
        return major > 6 || (major == 6 && minor >= 13);
    }();
    return distinct;
}

// An owner or group that has no number here: the kernel then refuses writes whatever the mode says.
constexpr unsigned kOverflowID = 65'534;
constexpr long kXfsMagic = 0x58465342;
constexpr long kF2fsMagic = 0xF2F52010;

}  // namespace

FileSystemTraits fileSystemTraits(int directory) {
    struct statfs fileSystem;
    if (::fstatfs(directory, &fileSystem) != 0) return {};
    FileSystemTraits traits;
    switch (fileSystem.f_type) {
        case EXT4_SUPER_MAGIC:
        case BTRFS_SUPER_MAGIC:
        case TMPFS_MAGIC:
        case kXfsMagic: traits.stampsAreDistinct = kernelStampsAreDistinct(); [[fallthrough]];
        case kF2fsMagic: {
            const bool readOnly = (fileSystem.f_flags & ST_RDONLY) != 0;
            if (!readOnly && !kernelHasMandatoryLabels()) traits.ownerWhoseModeDecides = ::geteuid();
            return traits;
        }
        default: return {};
    }
}

std::optional<bool> isWritableByStatus(const FileStatus& status, std::optional<uid_t> owner) {
    if (owner != status.owner || status.owner == kOverflowID || status.group == kOverflowID) return std::nullopt;
    // Not granted by the mode may still be granted by privilege; never changing, and what is mounted here, have rules
    // of their own.
    if ((status.mode & S_IWUSR) == 0 || (status.attributes & (STATX_ATTR_IMMUTABLE | STATX_ATTR_MOUNT_ROOT)) != 0)
        return std::nullopt;
    return true;
}

Result<int> DirectoryWatch::add(int directory) {
    if (!fd_) {
        fd_ = UniqueFd(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
        if (!fd_) return KsError::errorWithPOSIXCode();
    }
    constexpr std::uint32_t kEntryChanges =
        IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
    const int watch = ::inotify_add_watch(fd_.get(), pathThroughDescriptor(directory, "").c_str(), kEntryChanges);
    if (watch < 0) return KsError::errorWithPOSIXCode();
    return watch;
}

void DirectoryWatch::remove(int watch) {
    // Fails when the directory is gone, and its watch with it.
    (void)::inotify_rm_watch(fd_.get(), watch);
}

Result<void> DirectoryWatch::drain(const Change& change) {
    if (!fd_) return {};
    alignas(inotify_event) char buffer[4096];
    while (true) {
        const ssize_t size = ::read(fd_.get(), buffer, sizeof buffer);
        if (size < 0 && errno == EINTR) continue;
        if (size < 0 && errno == EAGAIN) return {};
        if (size <= 0) return KsError::errorWithPOSIXCode();
        for (const char* at = buffer; at < buffer + size;) {
            const auto* event = reinterpret_cast<const inotify_event*>(at);
            change((event->mask & IN_Q_OVERFLOW) != 0 ? 0 : event->wd);
            at += sizeof *event + event->len;
        }
    }
}

Result<std::size_t> read(int fd, std::span<std::byte> buffer) {
    while (true) {
        const ssize_t size = ::read(fd, buffer.data(), buffer.size());
        if (size >= 0) return static_cast<std::size_t>(size);
        if (errno != EINTR) return KsError::posix(errno);
    }
}

Result<std::uint64_t> readableBytes(int fd) {
    int bytes = 0;
    if (::ioctl(fd, FIONREAD, &bytes) != 0) return KsError::posix(errno);
    return static_cast<unsigned>(bytes);
}

Result<UniqueFd> inotify_init1(int flags) {
    const int fd = ::inotify_init1(flags | IN_CLOEXEC);
    if (fd < 0) return KsError::posix(errno);
    return UniqueFd(fd);
}

Result<int> inotify_add_watch(int instance, int object, std::uint32_t mask) {
    const int watch = ::inotify_add_watch(instance, pathThroughDescriptor(object, "").c_str(), mask);
    if (watch < 0) return KsError::posix(errno);
    return watch;
}

Result<void> inotify_rm_watch(int instance, int watch) {
    if (::inotify_rm_watch(instance, watch) != 0) return KsError::posix(errno);
    return {};
}

Result<UniqueFd> fanotify_init(unsigned flags, unsigned eventFlags) {
    const int fd = ::fanotify_init(flags | FAN_CLOEXEC, eventFlags | O_CLOEXEC);
    if (fd < 0) return KsError::posix(errno);
    return UniqueFd(fd);
}

Result<void> fanotify_mark(int group, unsigned flags, std::uint64_t mask, int object) {
    // By way of /proc, because a descriptor opened with O_PATH is no open file to the call itself.
    const std::string path = pathThroughDescriptor(object, "");
    if (::fanotify_mark(group, flags, mask, AT_FDCWD, path.c_str()) != 0) return KsError::posix(errno);
    return {};
}

namespace {

/// Room for the kernel's own form of a handle, whose bytes follow its two numbers.
struct KernelHandle {
    alignas(file_handle) std::byte bytes[sizeof(file_handle) + FileHandle::kBytesMax];
    file_handle* get() { return reinterpret_cast<file_handle*>(bytes); }
};

}  // namespace

Result<FileHandle> name_to_handle_at(int directory, const char* name, int flags) {
    KernelHandle raw;
    raw.get()->handle_bytes = FileHandle::kBytesMax;
    int mount = 0;
    while (::name_to_handle_at(directory, name, raw.get(), &mount, flags) != 0) {
        if (errno != EINTR) return KsError::posix(errno);
    }
    FileHandle handle;
    handle.type = raw.get()->handle_type;
    handle.size = raw.get()->handle_bytes;
    std::memcpy(handle.bytes, raw.get()->f_handle, handle.size);
    return handle;
}

Result<UniqueFd> open_by_handle_at(int mount, const FileHandle& handle, int flags) {
    KernelHandle raw;
    raw.get()->handle_type = handle.type;
    raw.get()->handle_bytes = handle.size;
    std::memcpy(raw.get()->f_handle, handle.bytes, handle.size);
    while (true) {
        const int fd = ::open_by_handle_at(mount, raw.get(), flags | O_CLOEXEC);
        if (fd >= 0) return UniqueFd(fd);
        if (errno != EINTR) return KsError::posix(errno);
    }
}

Result<std::uint64_t> fileSystemID(int fd) {
    struct statfs fileSystem;
    while (::fstatfs(fd, &fileSystem) != 0) {
        if (errno != EINTR) return KsError::posix(errno);
    }
    std::uint64_t identifier = 0;
    static_assert(sizeof fileSystem.f_fsid == sizeof identifier);
    std::memcpy(&identifier, &fileSystem.f_fsid, sizeof identifier);
    return identifier;
}

Result<UniqueFd> duplicate(int fd) {
    const int copy = ::fcntl(fd, F_DUPFD_CLOEXEC, 0);
    if (copy < 0) return KsError::posix(errno);
    return UniqueFd(copy);
}

Result<Bytes> readBeginning(int directory, const char* name, std::size_t count) {
    // O_PATH: a handle to the file itself; what it is can be told before anything is opened.
    UniqueFd own;
    if (*name != '\0') own = TRY(openat(directory, name, O_PATH | O_NOFOLLOW));
    const int handle = own ? own.get() : directory;
    if (!TRY(statx(handle, "")).isRegular()) return KsError::posix(ENXIO);
    const std::string path = pathThroughDescriptor(handle, "");
    const UniqueFd file = TRY(open(path.c_str(), O_RDONLY | O_NOATIME | O_NONBLOCK));
    Bytes bytes(count);
    std::size_t filled = 0;
    while (filled < count) {
        const ssize_t got = ::pread(file.get(), bytes.data() + filled, count - filled, static_cast<off_t>(filled));
        if (got < 0 && errno == EINTR) continue;
        if (got < 0) return KsError::posix(errno);
        if (got == 0) break;
        filled += static_cast<std::size_t>(got);
    }
    bytes.resize(filled);
    return bytes;
}

Result<UniqueFd> openDirectoryForReading(int directory, const char* name, int extraFlags) {
    const int flags = O_RDONLY | O_DIRECTORY | O_NONBLOCK | extraFlags;
    Result<UniqueFd> opened = openat(directory, name, flags | O_NOATIME);
    // Only an object's owner may leave its access time alone.
    if (!opened.ok() && opened.error().isPosix(EPERM)) opened = openat(directory, name, flags);
    return opened;
}

Result<UniqueFd> openDirectoryBeneath(int directory, std::string_view relativePath, std::uint64_t resolve) {
    constexpr int kFlags = O_RDONLY | O_DIRECTORY | O_NONBLOCK | O_NOFOLLOW;
    Result<UniqueFd> opened = openBeneath(directory, relativePath, kFlags | O_NOATIME, resolve);
    if (!opened.ok() && opened.error().isPosix(EPERM)) opened = openBeneath(directory, relativePath, kFlags, resolve);
    return opened;
}

Result<std::string> pathOfDescriptor(int fd) {
    const std::string link = pathThroughDescriptor(fd, "");
    std::string path(PATH_MAX, '\0');
    const ssize_t size = ::readlink(link.c_str(), path.data(), path.size());
    if (size < 0) return KsError::posix(errno);
    if (static_cast<std::size_t>(size) == path.size()) return KsError::posix(ENAMETOOLONG);
    path.resize(static_cast<std::size_t>(size));
    return path;
}

Result<std::size_t> getdents(int directory, std::span<std::byte> buffer) {
    while (true) {
        const long size =
            isToFail("getdents64") ? -1 : ::syscall(SYS_getdents64, directory, buffer.data(), buffer.size());
        if (size >= 0) return static_cast<std::size_t>(size);
        if (errno != EINTR) return KsError::posix(errno);
    }
}

Result<std::uint64_t> countEntries(int directory, const char* name, std::uint64_t max) {
    const UniqueFd fd = TRY(openDirectoryForReading(directory, *name == '\0' ? "." : name, O_NOFOLLOW));
    alignas(8) std::byte buffer[8192];
    std::uint64_t count = 0;
    while (count < max) {
        const std::size_t size = TRY(getdents(fd.get(), buffer));
        if (size == 0) break;
        for (std::size_t at = 0; at < size;) {
            const auto* record = reinterpret_cast<const DirectoryRecord*>(buffer + at);
            if (!record->isDots()) ++count;
            at += record->length;
        }
    }
    return std::min(count, max);
}

}  // namespace sys

}  // namespace cindral
