#include "platform/foundation/SysEdits.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <linux/fs.h>
#include <sys/file.h>
#include <sys/ioctl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>

#include "platform/foundation/SysFaults.h"

namespace cindral::sys {

namespace {

/// Makes a call that answers -1 and errno, again after EINTR.
template <typename Call>
auto retried(const char* name, Call call) -> Result<decltype(call())> {
    while (true) {
        const auto answer = isToFail(name) ? -1 : call();
        if (answer >= 0) return answer;
        if (errno != EINTR) return KsError::posix(errno);
    }
}

template <typename Call>
Result<void> done(const char* name, Call call) {
    (void)TRY(retried(name, call));
    return {};
}

/// The way to an object through its descriptor, for calls that take no O_PATH descriptor.
std::string pathThrough(int fd) {
    return fmt::format("/proc/self/fd/{}", fd);
}

timespec timespecOf(const KsDate& date) {
    return {static_cast<time_t>(date.seconds), static_cast<long>(date.nanoseconds)};
}

}  // namespace

Result<void> renameat2(int directory, const char* name, int newDirectory, const char* newName, unsigned flags) {
    return done("renameat2", [&] { return ::renameat2(directory, name, newDirectory, newName, flags); });
}

Result<void> linkat(int directory, const char* name, int newDirectory, const char* newName, int flags) {
    return done("linkat", [&] { return ::linkat(directory, name, newDirectory, newName, flags); });
}

Result<void> linkDescriptor(int fd, int directory, const char* name) {
    // By way of /proc: AT_EMPTY_PATH takes a privilege.
    return linkat(AT_FDCWD, pathThrough(fd).c_str(), directory, name, AT_SYMLINK_FOLLOW);
}

Result<void> unlinkat(int directory, const char* name, int flags) {
    return done("unlinkat", [&] { return ::unlinkat(directory, name, flags); });
}

Result<void> mkdirat(int directory, const char* name, mode_t mode) {
    return done("mkdirat", [&] { return ::mkdirat(directory, name, mode); });
}

Result<void> mknodat(int directory, const char* name, mode_t mode, dev_t device) {
    return done("mknodat", [&] { return ::mknodat(directory, name, mode, device); });
}

Result<void> symlinkat(const std::string& target, int directory, const char* name) {
    return done("symlinkat", [&] { return ::symlinkat(target.c_str(), directory, name); });
}

Result<std::string> readlinkat(int directory, const char* name) {
    std::string target(PATH_MAX, '\0');
    const ssize_t size =
        TRY(retried("readlinkat", [&] { return ::readlinkat(directory, name, target.data(), target.size()); }));
    target.resize(static_cast<std::size_t>(size));
    return target;
}

Result<void> fchmod(int fd, mode_t mode) {
    const Result<void> changed = done("fchmod", [&] { return ::fchmod(fd, mode); });
    if (changed.ok() || !changed.error().isPosix(EBADF)) return changed;
    return done("chmod", [&, path = pathThrough(fd)] { return ::chmod(path.c_str(), mode); });
}

Result<void> utimensat(int directory, const char* name, const KsDate& accessTime, const KsDate& modificationTime) {
    const timespec times[2] = {timespecOf(accessTime), timespecOf(modificationTime)};
    return done("utimensat", [&] { return ::utimensat(directory, name, times, AT_SYMLINK_NOFOLLOW); });
}

Result<void> futimens(int fd, const KsDate& accessTime, const KsDate& modificationTime) {
    const timespec times[2] = {timespecOf(accessTime), timespecOf(modificationTime)};
    return done("futimens", [&] { return ::futimens(fd, times); });
}

Result<void> fsetxattr(int fd, const char* name, ByteView value) {
    const Result<void> set = done("fsetxattr", [&] { return ::fsetxattr(fd, name, value.data(), value.size(), 0); });
    if (set.ok() || !set.error().isPosix(EBADF)) return set;
    return done("setxattr",
                [&, path = pathThrough(fd)] { return ::setxattr(path.c_str(), name, value.data(), value.size(), 0); });
}

Result<void> fremovexattr(int fd, const char* name) {
    const Result<void> removed = done("fremovexattr", [&] { return ::fremovexattr(fd, name); });
    if (removed.ok() || !removed.error().isPosix(EBADF)) return removed;
    return done("removexattr", [&, path = pathThrough(fd)] { return ::removexattr(path.c_str(), name); });
}

Result<void> ficlone(int target, int source) {
    return done("ficlone", [&] { return ::ioctl(target, FICLONE, source); });
}

Result<std::size_t> copy_file_range(int source, std::uint64_t sourceOffset, int target, std::uint64_t targetOffset,
                                    std::size_t size) {
    auto from = static_cast<off64_t>(sourceOffset);
    auto to = static_cast<off64_t>(targetOffset);
    const ssize_t copied =
        TRY(retried("copy_file_range", [&] { return ::copy_file_range(source, &from, target, &to, size, 0); }));
    return static_cast<std::size_t>(copied);
}

Result<std::size_t> pread(int fd, std::span<std::byte> buffer, std::uint64_t offset) {
    const ssize_t got =
        TRY(retried("pread", [&] { return ::pread(fd, buffer.data(), buffer.size(), static_cast<off_t>(offset)); }));
    return static_cast<std::size_t>(got);
}

Result<void> pwrite(int fd, ByteView bytes, std::uint64_t offset) {
    while (!bytes.empty()) {
        const ssize_t put = TRY(
            retried("pwrite", [&] { return ::pwrite(fd, bytes.data(), bytes.size(), static_cast<off_t>(offset)); }));
        bytes = bytes.subspan(static_cast<std::size_t>(put));
        offset += static_cast<std::uint64_t>(put);
    }
    return {};
}

Result<std::uint64_t> lseek(int fd, std::uint64_t offset, int whence) {
    const off_t place = TRY(retried("lseek", [&] { return ::lseek(fd, static_cast<off_t>(offset), whence); }));
    return static_cast<std::uint64_t>(place);
}

Result<void> ftruncate(int fd, std::uint64_t size) {
    return done("ftruncate", [&] { return ::ftruncate(fd, static_cast<off_t>(size)); });
}

Result<void> syncfs(int fd) {
    return done("syncfs", [&] { return ::syncfs(fd); });
}

Result<void> flock(int fd, int operation) {
    return done("flock", [&] { return ::flock(fd, operation); });
}

Result<UniqueFd> reopen(int fd, int flags) {
    return open(pathThrough(fd).c_str(), flags);
}

}  // namespace cindral::sys
