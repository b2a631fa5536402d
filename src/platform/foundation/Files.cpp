#include "platform/foundation/Files.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>

#include "platform/foundation/Sys.h"

namespace cindral::files {
namespace {

Result<void> writeAll(int fd, ByteView bytes) {
    while (!bytes.empty()) {
        const ssize_t written = ::write(fd, bytes.data(), bytes.size());
        if (written < 0 && errno == EINTR) continue;
        if (written < 0) return KsError::posix(errno);
        bytes = bytes.subspan(static_cast<std::size_t>(written));
    }
    return {};
}

Result<void> fill(int fd, ByteView bytes) {
    TRY(writeAll(fd, bytes));
    // Before the rename: a file system may write the new name down before the new contents.
    if (::fsync(fd) != 0) return KsError::posix(errno);
    return {};
}

}  // namespace

Result<void> makeFolders(const std::string& path) {
    for (std::size_t end = 1; end != std::string::npos;) {
        end = path.find('/', end + 1);
        const std::string folder = path.substr(0, end);
        if (::mkdir(folder.c_str(), 0700) == 0) continue;
        const int failure = errno;
        struct stat status;
        // Some file systems answer for what may not be written before they look whether it is there.
        if (::stat(folder.c_str(), &status) == 0 && S_ISDIR(status.st_mode)) continue;
        return KsError::posix(failure == EEXIST ? ENOTDIR : failure, folder);
    }
    return {};
}

Result<Bytes> readAll(const std::string& path, std::size_t max) {
    // A handle first: what a name leads to is looked at before it is opened, so that no device ever is.
    const UniqueFd handle = TRY(sys::open(path.c_str(), O_PATH));
    return readAll(handle.get(), max);
}

Result<Bytes> readAll(int handle, std::size_t max) {
    const FileStatus status = TRY(sys::statx(handle, ""));
    if (!status.isRegular()) return KsError::posix(EINVAL);
    if (status.size > max) return KsError::posix(EFBIG);
    const UniqueFd file = TRY(sys::open(fmt::format("/proc/self/fd/{}", handle).c_str(), O_RDONLY | O_NONBLOCK));
    // One byte more than there should be, to see that the file has not grown meanwhile.
    Bytes bytes(status.size + 1);
    std::size_t filled = 0;
    while (true) {
        const ssize_t got = ::read(file.get(), bytes.data() + filled, bytes.size() - filled);
        if (got < 0 && errno == EINTR) continue;
        if (got < 0) return KsError::posix(errno);
        if (got == 0) break;
        filled += static_cast<std::size_t>(got);
        if (filled > max) return KsError::posix(EFBIG);
        if (filled == bytes.size()) bytes.resize(filled * 2);
    }
    bytes.resize(filled);
    return bytes;
}

Result<void> replace(const std::string& path, ByteView bytes) {
    std::string temporary = path + ".XXXXXX";
    UniqueFd file(::mkostemp(temporary.data(), O_CLOEXEC));
    if (!file) return KsError::posix(errno, path);
    Result<void> done = fill(file.get(), bytes);
    if (done.ok() && ::rename(temporary.c_str(), path.c_str()) != 0) done = KsError::posix(errno);
    if (!done.ok()) {
        (void)::unlink(temporary.c_str());
        return done.error().with("path", path);
    }
    return {};
}

}  // namespace cindral::files
