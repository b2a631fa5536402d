#include "provider/fs/FSEntryFinder.h"

#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/foundation/Sys.h"
#include "provider/Utilities.h"
#include "provider/fs/FSDirectoryEnumerator.h"

namespace cindral {

namespace {

using Standing = FSFoundEntry::Standing;

// Each is an open descriptor.
constexpr std::size_t kFoldersMax = 64;
// Of a deep path, the directories next to its end: what is looked for together mostly lies close together.
constexpr std::ptrdiff_t kLevelsKeptMax = 16;

bool isGone(const KsError& error) {
    // A link or a file where the directory was: what is looked for is no longer below it.
    return error.isPosix(ENOENT) || error.isPosix(ENOTDIR) || error.isPosix(ELOOP);
}

/// What is refused to a listing, too.
bool isRefused(const KsError& error) {
    return error.isPosix(EACCES) || error.isPosix(EPERM) || error.isPosix(EXDEV);
}

/// Where the standing does not follow from the error, it can't be told.
Result<Standing> standingAfter(const KsError& error) {
    if (isGone(error)) return Standing::missing;
    if (isRefused(error)) return Standing::outside;
    return error;
}

}  // namespace

bool isAtOrBelow(std::string_view path, std::string_view folder) {
    std::string rewrittenPath;
    std::string rewrittenFolder;
    path = properPath(path, rewrittenPath);
    folder = properPath(folder, rewrittenFolder);
    return path.starts_with(folder) && (path.size() == folder.size() || path[folder.size()] == '/' || folder == "/");
}

const KsURL* directoryHolding(const std::vector<KsURL>& urls, std::string_view path) {
    const KsURL* innermost = nullptr;
    for (const KsURL& url : urls) {
        if (!isAtOrBelow(path, url.path()) || isAtOrBelow(url.path(), path)) continue;
        if (innermost == nullptr || url.path().size() > innermost->path().size()) innermost = &url;
    }
    return innermost;
}

FSEntryFinder::FSEntryFinder(std::vector<KsURL> urls) : urls_(std::move(urls)) {}

void FSEntryFinder::forget() {
    folders_.clear();
    unopened_.clear();
}

Result<FSEntryFinder::Folder> FSEntryFinder::openTop(const KsURL& top) {
    Result<UniqueFd> fd = RootDirectories::openForReading(top.path());
    if (!fd.ok()) return Folder{TRY(standingAfter(fd.error())), nullptr};
    return Folder{Standing::reached, TRY(describedDirectory(*std::move(fd), top.path(), nullptr))};
}

Result<FSEntryFinder::Folder> FSEntryFinder::openChild(const std::shared_ptr<const DirectoryReference>& parent,
                                                       std::string_view name, std::string path) {
    const KsURL child = KsURL::child(parent, name);
    const Result<FileStatus> status = child.status();
    if (!status.ok()) return Folder{TRY(standingAfter(status.error())), nullptr};
    if (!status->isDirectory()) return Folder{Standing::missing, nullptr};
    if (status->device != parent->status.device || child.isPackage().valueOr(true))
        return Folder{Standing::outside, nullptr};
    Result<UniqueFd> fd = sys::openDirectoryForReading(parent->fd.get(), std::string(name).c_str(), O_NOFOLLOW);
    if (!fd.ok()) return Folder{TRY(standingAfter(fd.error())), nullptr};
    return Folder{Standing::reached, TRY(describedDirectory(*std::move(fd), std::move(path), parent.get()))};
}

/// The directory at the path, which is that of `top` or below it.
Result<FSEntryFinder::Folder> FSEntryFinder::folder(const KsURL& top, std::string_view path) {
    if (const auto known = folders_.find(std::string(path)); known != folders_.end()) return known->second;
    if (folders_.size() >= kFoldersMax) forget();
    Folder folder;
    // Only up to the last one that is known: what is gone or out of reach at one level is so below it.
    std::size_t end = path.size();
    while (true) {
        const auto known = folders_.find(std::string(path.substr(0, end)));
        if (known != folders_.end()) {
            folder = known->second;
            break;
        }
        if (end <= top.path().size()) {
            folder = TRY(openTop(top));
            folders_.emplace(top.path(), folder);
            break;
        }
        end = path.rfind('/', end - 1);
    }
    while (end < path.size() && folder.standing == Standing::reached) {
        const std::size_t begin = end + (path[end] == '/' ? 1 : 0);
        end = std::min(path.find('/', begin), path.size());
        std::string childPath(path.substr(0, end));
        folder = TRY(openChild(folder.directory, path.substr(begin, end - begin), childPath));
        if (std::ranges::count(path.substr(end), '/') < kLevelsKeptMax) folders_.emplace(std::move(childPath), folder);
    }
    return folder;
}

Result<FSFoundEntry> FSEntryFinder::find(std::string_view path) {
    const KsURL* top = directoryHolding(urls_, path);
    if (top == nullptr) return FSFoundEntry{};
    // In the words of the directory, should the path be in others.
    std::string reworded;
    if (!path.starts_with(top->path())) {
        std::string properTop;
        const std::size_t length = properPath(top->path(), properTop).size();
        std::string proper;
        reworded = top->path() + std::string(properPath(path, proper).substr(length));
        path = reworded;
    }
    const std::size_t slash = path.rfind('/');
    const std::string_view folderPath = path.substr(0, std::max<std::size_t>(slash, 1));
    const Folder folder = TRY(this->folder(*top, folderPath));
    if (folder.standing != Standing::reached) return FSFoundEntry{folder.standing, std::nullopt};

    KsURL url = KsURL::child(folder.directory, path.substr(slash + 1));
    const Result<FileStatus> status = url.status();
    if (!status.ok()) return FSFoundEntry{TRY(standingAfter(status.error())), std::nullopt};
    if (status->device != folder.directory->status.device) return FSFoundEntry{Standing::outside, std::nullopt};
    return FSFoundEntry{Standing::reached, std::move(url)};
}

std::optional<KsURL> FSEntryFinder::foundAlready(std::string_view path, FileID folder, const FileStatus& status) {
    const KsURL* top = directoryHolding(urls_, path);
    if (top == nullptr || !path.starts_with(top->path())) return std::nullopt;
    const Result<Folder> open = this->folder(*top, top->path());
    if (!open.ok() || open->standing != Standing::reached) return std::nullopt;
    const DirectoryReference& opened = *open->directory;
    if (opened.status.device != status.device) return std::nullopt;
    const std::size_t slash = path.rfind('/');
    const std::string_view name = path.substr(slash + 1);
    if (slash == top->path().size()) {
        if (FileID{opened.status.fileID} != folder) return std::nullopt;
        return KsURL::seenChild(open->directory, name, status);
    }
    auto& known = unopened_[std::string(path.substr(0, slash))];
    if (!known || FileID{known->status.fileID} != folder) {
        auto directory = std::make_shared<DirectoryReference>();
        directory->path = path.substr(0, slash);
        directory->status.fileID = static_cast<std::uint64_t>(folder);
        directory->status.device = status.device;
        directory->status.mode = S_IFDIR;
        directory->traits = opened.traits;
        known = std::move(directory);
    }
    return KsURL::seenChild(known, name, status);
}

}  // namespace cindral
