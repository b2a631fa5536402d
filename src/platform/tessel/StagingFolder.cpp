#include "platform/tessel/StagingFolder.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/file.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <utility>
#include <vector>

#include "platform/foundation/Log.h"
#include "platform/foundation/SysEdits.h"
#include "platform/tessel/TreeCopy.h"
#include "platform/tessel/TreeRemoval.h"

namespace cindral {

namespace {

constexpr std::string_view kStagingPrefix = ".staging-";
constexpr std::string_view kKeptPrefix = "kept-";

std::string newName(std::string_view prefix) {
    static std::atomic<std::uint64_t> last = 0;
    return fmt::format("{}{}-{}", prefix, ::getpid(), last.fetch_add(1) + 1);
}

bool isTaken(const Result<void>& result) {
    return !result.ok() && result.error().isPosix(EEXIST);
}

/// A new folder, open and locked; none when somebody took it for an abandoned one before it was locked.
Result<UniqueFd> makeLocked(int temporary, const std::string& name) {
    Result<UniqueFd> fd = sys::openDirectoryForReading(temporary, name.c_str(), O_NOFOLLOW);
    if (!fd.ok() && fd.error().isPosix(ENOENT)) return UniqueFd();
    if (!fd.ok()) return fd;
    const Result<void> locked = sys::flock(fd->get(), LOCK_EX | LOCK_NB);
    if (!locked.ok() && locked.error().isPosix(EWOULDBLOCK)) return UniqueFd();
    // Where there are no locks nobody takes a folder for abandoned either.
    if (TRY(sys::statx(fd->get(), "")).names == 0) return UniqueFd();
    return fd;
}

Result<std::vector<std::string>> entryNames(int directory) {
    alignas(8) std::byte buffer[16'384];
    std::vector<std::string> names;
    while (true) {
        const std::size_t size = TRY(sys::getdents(directory, buffer));
        if (size == 0) return names;
        for (std::size_t at = 0; at < size;) {
            const auto* record = reinterpret_cast<const DirectoryRecord*>(buffer + at);
            at += record->length;
            if (!record->isDots()) names.emplace_back(record->name);
        }
    }
}

}  // namespace

Result<UniqueFd> openTemporaryFolder(const RootDirectory& root) {
    const std::string name(kTemporaryLocalFolderName);
    const Result<void> made = sys::mkdirat(root.fd.get(), name.c_str(), kPrivateFolder);
    // On a read-only file system one that is there will do.
    if (!made.ok() && !isTaken(made) && !sys::statx(root.fd.get(), name.c_str()).ok()) return made.error();
    return sys::openDirectoryForReading(root.fd.get(), name.c_str(), O_NOFOLLOW);
}

Result<std::unique_ptr<StagingFolder>> StagingFolder::make(std::shared_ptr<const RootDirectory> root,
                                                           Contents contents) {
    Result<UniqueFd> opened = openTemporaryFolder(*root);
    if (!opened.ok()) return opened.error().with("path", fmt::format("{}/{}", root->path, kTemporaryLocalFolderName));
    UniqueFd temporary = *std::move(opened);
    while (true) {
        std::string name = newName(contents == Contents::mayGo ? kStagingPrefix : kKeptPrefix);
        const Result<void> made = sys::mkdirat(temporary.get(), name.c_str(), kPrivateFolder);
        if (isTaken(made)) continue;  // By a process of the same number, in another machine or before.
        TRY(made);
        Result<UniqueFd> fd = makeLocked(temporary.get(), name);
        Result<FileStatus> status = fd.ok() && *fd ? sys::statx(fd->get(), "") : Result<FileStatus>(FileStatus());
        if (!fd.ok() || !status.ok() || !*fd) (void)sys::unlinkat(temporary.get(), name.c_str(), AT_REMOVEDIR);
        if (!fd.ok()) return fd.error();
        if (!status.ok()) return status.error();
        if (!*fd) continue;
        // The constructor is nobody else's to call.
        return std::unique_ptr<StagingFolder>(new StagingFolder(std::move(root), std::move(temporary), std::move(name),
                                                                contents, std::move(*fd), *status));
    }
}

StagingFolder::StagingFolder(std::shared_ptr<const RootDirectory> root, UniqueFd temporary, std::string name,
                             Contents contents, UniqueFd fd, const FileStatus& status)
    : root_(std::move(root)),
      temporary_(std::move(temporary)),
      name_(std::move(name)),
      contents_(contents),
      fd_(std::move(fd)),
      status_(status) {}

StagingFolder::~StagingFolder() {
    // Mostly there is nothing left in it.
    Result<void> removed = sys::unlinkat(temporary_.get(), name_.c_str(), AT_REMOVEDIR);
    if (!removed.ok() && contents_ == Contents::mayGo)
        removed = removeTree(temporary_.get(), name_.c_str(), path(), nullptr);
    if (!removed.ok())
        logError("can't remove temporary directory; {}", removed.error().with("path", path()).description());
}

std::string StagingFolder::path() const {
    return fmt::format("{}/{}/{}", root_->path, kTemporaryLocalFolderName, name_);
}

Result<void> StagingFolder::rename(std::string_view prefix) {
    std::string name = newName(prefix);
    TRY(sys::renameat2(temporary_.get(), name_.c_str(), temporary_.get(), name.c_str(), 0));
    name_ = std::move(name);
    return {};
}

Result<void> StagingFolder::letGo() {
    if (contents_ == Contents::mayGo) return {};
    TRY(rename(kStagingPrefix));
    contents_ = Contents::mayGo;
    return {};
}

void StagingFolder::removeAbandoned(const RootDirectory& root) {
    const std::string folder(kTemporaryLocalFolderName);
    const Result<UniqueFd> temporary = sys::openDirectoryForReading(root.fd.get(), folder.c_str(), O_NOFOLLOW);
    if (!temporary.ok()) return;  // Mostly there is none.
    const Result<std::vector<std::string>> names = entryNames(temporary->get());
    if (!names.ok()) return;
    for (const std::string& name : *names) {
        const bool isKept = name.starts_with(kKeptPrefix);
        if (!isKept && !name.starts_with(kStagingPrefix)) continue;
        const Result<UniqueFd> fd = sys::openDirectoryForReading(temporary->get(), name.c_str(), O_NOFOLLOW);
        if (!fd.ok() || !sys::flock(fd->get(), LOCK_EX | LOCK_NB).ok()) continue;
        // What is kept goes only if there is nothing.
        if (isKept) {
            (void)sys::unlinkat(temporary->get(), name.c_str(), AT_REMOVEDIR);
            continue;
        }
        const std::string path = fmt::format("{}/{}/{}", root.path, folder, name);
        const Result<void> removed = removeTree(temporary->get(), name.c_str(), path, nullptr);
        if (!removed.ok()) logError("can't remove temporary directory {}; {}", path, removed.error().description());
    }
}

}  // namespace cindral
