#include "platform/revisions/StoreFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "platform/foundation/Sys.h"

namespace cindral {

namespace {

/// Calls until the answer is another than "interrupted".
template <typename Call>
auto retried(Call call) {
    while (true) {
        const auto answer = call();
        if (answer >= 0 || errno != EINTR) return answer;
    }
}

Result<void> checked(long answer) {
    if (answer < 0) return KsError::errorWithPOSIXCode();
    return {};
}

}  // namespace

Result<StoreFile> StoreFile::open(int folder, const char* name) {
    return StoreFile(TRY(sys::openat(folder, name, O_RDWR | O_CREAT | O_NOFOLLOW, 0600)));
}

Result<std::uint64_t> StoreFile::size() const {
    struct stat status {};
    TRY(checked(::fstat(fd_.get(), &status)));
    return static_cast<std::uint64_t>(status.st_size);
}

Result<Bytes> StoreFile::readAll() const {
    Bytes bytes(TRY(size()));
    std::size_t got = 0;
    while (got < bytes.size()) {
        const ssize_t count = retried(
            [&] { return ::pread(fd_.get(), bytes.data() + got, bytes.size() - got, static_cast<off_t>(got)); });
        if (count < 0) return KsError::errorWithPOSIXCode();
        if (count == 0) break;
        got += static_cast<std::size_t>(count);
    }
    bytes.resize(got);
    return bytes;
}

Result<void> StoreFile::writeAt(std::uint64_t offset, ByteView bytes) {
    while (!bytes.empty()) {
        const ssize_t count =
            retried([&] { return ::pwrite(fd_.get(), bytes.data(), bytes.size(), static_cast<off_t>(offset)); });
        if (count < 0) return KsError::errorWithPOSIXCode();
        offset += static_cast<std::uint64_t>(count);
        bytes = bytes.subspan(static_cast<std::size_t>(count));
    }
    return {};
}

Result<void> StoreFile::truncate(std::uint64_t size) {
    return checked(retried([&] { return ::ftruncate(fd_.get(), static_cast<off_t>(size)); }));
}

Result<void> StoreFile::sync() {
    return checked(retried([&] { return ::fdatasync(fd_.get()); }));
}

Result<void> syncFolder(int folder) {
    return checked(retried([&] { return ::fsync(folder); }));
}

Result<void> makeFolders(const std::string& path) {
    for (std::size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
        const std::string part = path.substr(0, end);
        if (::mkdir(part.c_str(), 0700) == 0) {
            TRY(syncFolderOf(part));
        } else if (errno != EEXIST) {
            return KsError::posix(errno, part);
        }
        if (end == std::string::npos) return {};
    }
}

Result<void> syncFolderOf(const std::string& path) {
    const std::size_t slash = path.rfind('/');
    const std::string above = slash == std::string::npos ? "." : path.substr(0, slash + 1);
    const UniqueFd folder = TRY(sys::open(above.c_str(), O_RDONLY | O_DIRECTORY));
    return syncFolder(folder.get());
}

}  // namespace cindral
