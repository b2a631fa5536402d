#include "platform/tessel/FileOperations.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>
#include <vector>

#include "platform/foundation/Log.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/foundation/Sys.h"
#include "platform/foundation/SysEdits.h"
#include "platform/foundation/ThreadPool.h"
#include "platform/tessel/FreeName.h"
#include "platform/tessel/StagingFolder.h"
#include "platform/tessel/TesselManager.h"
#include "platform/tessel/TreeCopy.h"
#include "platform/tessel/TreeRemoval.h"

namespace cindral {

namespace {

using Root = std::shared_ptr<const RootDirectory>;

constexpr mode_t kAsTheUmaskSays = 0777;

/// An open folder in a root, and its path as presented.
struct Folder {
    Root root;
    UniqueFd fd;
    FileStatus status;
    std::string path;

    std::string pathOf(std::string_view name) const { return path + "/" + std::string(name); }
};

/// An entry of an open folder.
struct Place {
    Folder folder;
    std::string name;
    /// The entry itself, without its contents: for as long as it is held, no other object is given its number.
    UniqueFd handle;
    FileStatus status;  ///< of the entry itself

    std::string path() const { return folder.pathOf(name); }
};

/// The interface's word for an error of the file system, with the path that it is about.
KsError failure(const KsError& error, const std::string& path) {
    const auto known = error.userInfo().find("path");
    const std::string& where = known != error.userInfo().end() ? known->second : path;
    if (error.isPosix(ENOENT)) return {kKsGeneralErrorDomain, kKsFileNoSuchFileError, {{"path", where}}};
    return known != error.userInfo().end() ? error : error.with("path", where);
}

KsError refusal(const std::string& path) {
    return KsError::errorFileWriteNoPermission().with("path", path);
}

KsError collision(const std::string& path) {
    return {kKsGeneralErrorDomain,
            kKsFileWriteFileExistsError,
            {{"path", path}, {"collidingURL", KsURL::fileURL(path).absoluteString()}}};
}

/// For objects of which one is held open: numbers of others are compared with the time of birth (ObjectIdentity).
/// ESTALE when it is not the object that is meant.
Result<void> checkIsMeant(const MeantFile& meant, const FileStatus& status) {
    if (meant.object && *meant.object != status.identity()) return KsError::posix(ESTALE, meant.url.path());
    return {};
}

NameKind nameKindOf(const KsURL& url) {
    return url.ts_isFolder() ? NameKind::folder : NameKind::document;
}

Result<Folder> openFolder(const MeantFile& meant) {
    Folder folder;
    folder.path = meant.url.path();
    folder.root = RootDirectories::shared().rootHolding(folder.path);
    if (!folder.root || !meant.url.isFileURL()) return refusal(folder.path);
    auto fd = RootDirectories::open(folder.path, O_PATH | O_DIRECTORY);
    if (!fd.ok()) return failure(fd.error(), folder.path);
    folder.fd = std::move(*fd);
    auto status = sys::statx(folder.fd.get(), "");
    if (!status.ok()) return failure(status.error(), folder.path);
    TRY(checkIsMeant(meant, *status));
    folder.status = *status;
    return folder;
}

/// Whether the object may not be moved away: a root, what holds one, the folder for what is temporary.
bool isFixed(const KsURL& url) {
    const std::string& path = url.path();
    for (const Root& root : RootDirectories::shared().all()) {
        const std::string_view fixed = root->path;
        if (fixed.starts_with(path) && (fixed.size() == path.size() || fixed[path.size()] == '/')) return true;
    }
    const std::string temporary = TesselManager::defaultManager().documentStorageURL().path() + "/";
    return path == temporary + std::string(kTemporaryLocalFolderName);
}

bool isRootObject(const FileStatus& status) {
    return std::ranges::any_of(RootDirectories::shared().all(),
                               [&](const Root& root) { return root->status.isSameObject(status); });
}

/// Where something is that is to be moved away, renamed or deleted.
Result<Place> openPlace(const MeantFile& meant) {
    const KsURL& url = meant.url;
    const std::optional<KsURL> parent = url.deletingLastPathComponent();
    if (!parent || isFixed(url)) return refusal(url.path());
    Place place{TRY(openFolder(*parent)), std::string(url.lastPathComponent()), {}, {}};
    Result<UniqueFd> handle = sys::openat(place.folder.fd.get(), place.name.c_str(), O_PATH | O_NOFOLLOW);
    if (!handle.ok()) return failure(handle.error(), url.path());
    place.handle = *std::move(handle);
    const Result<FileStatus> status = sys::statx(place.handle.get(), "");
    if (!status.ok()) return failure(status.error(), url.path());
    TRY(checkIsMeant(meant, *status));
    place.status = *status;
    if (isRootObject(place.status)) return refusal(url.path());
    return place;
}

/// What takes something out of a folder holds off the process's others that would: nobody can put another object under
/// its name without taking it away first.
Mutex& departuresFrom(const Folder& folder) {
    // A few for all folders: two that share one wait for each other, over a rename.
    static std::array<Mutex, 64>& mutexes = *new std::array<Mutex, 64>;
    return mutexes[folder.status.fileID % mutexes.size()];
}

/// ESTALE when the entry of the folder is not the object that is held.
Result<void> checkIsHeld(int folder, const char* name, int handle) {
    // Both as of now: layered file systems give an object that is changed another number, also through the handle.
    if (TRY(sys::statx(folder, name)).isSameObject(TRY(sys::statx(handle, "")))) return {};
    return KsError::posix(ESTALE);
}

/// Calls `take`, which takes the entry out of the folder, if it is the object that is held; ESTALE otherwise.
template <typename Take>
Result<void> takeOut(const Folder& folder, const std::string& name, const UniqueFd& handle, Take take) {
    const MutexLock lock(departuresFrom(folder));
    TRY(checkIsHeld(folder.fd.get(), name.c_str(), handle.get()));
    return take();
}

/// Whether the folder is in the other or is it, going up from it.
Result<bool> isWithin(int folder, const FileStatus& outer) {
    UniqueFd at = TRY(sys::openat(folder, ".", O_PATH | O_DIRECTORY));
    FileStatus status = TRY(sys::statx(at.get(), ""));
    while (!status.isSameObject(outer)) {
        UniqueFd above = TRY(sys::openat(at.get(), "..", O_PATH | O_DIRECTORY));
        const FileStatus next = TRY(sys::statx(above.get(), ""));
        if (next.isSameObject(status)) return false;  // The top.
        at = std::move(above);
        status = next;
    }
    return true;
}

/// Gives an entry a second name, and takes the first away. Of what another program puts under the first name meanwhile,
/// nothing is lost, unless in the microsecond between the last look and the call.
Result<void> linkAndUnlink(int from, const char* name, int to, const char* newName) {
    TRY(sys::linkat(from, name, to, newName));
    const auto undone = [&](const KsError& error) {
        (void)sys::unlinkat(to, newName);
        return error;
    };
    const Result<FileStatus> linked = sys::statx(to, newName);
    if (!linked.ok()) return undone(linked.error());
    const Result<FileStatus> left = sys::statx(from, name);
    if (!left.ok() && !left.error().isPosix(ENOENT)) return undone(left.error());
    // It has the new name alone: another took its old one over, or took that away.
    if (!left.ok() || !linked->isSameObject(*left)) return {};
    const Result<void> unlinked = sys::unlinkat(from, name);
    return unlinked.ok() ? unlinked : undone(unlinked.error());
}

/// renameat2 with RENAME_NOREPLACE, by other means where the file system doesn't know it: a folder takes the place of an
/// empty one made for it, anything else gets a second name and loses the first.
Result<void> renameWithoutReplacing(int from, const char* name, int to, const char* newName) {
    const Result<void> renamed = sys::renameat2(from, name, to, newName, RENAME_NOREPLACE);
    if (renamed.ok() || !renamed.error().isPosix(EINVAL)) return renamed;
    const FileStatus status = TRY(sys::statx(from, name));
    if (!status.isDirectory()) return linkAndUnlink(from, name, to, newName);
    if (TRY(isWithin(to, status))) return KsError::posix(EINVAL);
    TRY(sys::mkdirat(to, newName, kPrivateFolder));
    const Result<void> moved = sys::renameat2(from, name, to, newName, 0);
    if (!moved.ok()) (void)sys::unlinkat(to, newName, AT_REMOVEDIR);
    return moved;
}

/// The staging folder that is one rename away from the folder: the storage's, else one on the folder's own root. (The
/// kernel renames nothing from one mount to another, though both be of one device.)
Result<std::unique_ptr<StagingFolder>> stagingFor(const Folder& folder,
                                                  StagingFolder::Contents contents = StagingFolder::Contents::mayGo) {
    const Root storage =
        RootDirectories::shared().rootHolding(TesselManager::defaultManager().documentStorageURL().path());
    const auto isOneRenameAway = [&](const FileStatus& root) {
        return root.device == folder.status.device && root.mount == folder.status.mount;
    };
    return StagingFolder::make(storage && isOneRenameAway(storage->status) ? storage : folder.root, contents);
}

/// Gives what was built in the temporary folder its place.
Result<void> putInPlace(int from, const char* name, const Folder& folder, const std::string& newName) {
    const auto rename = [&] { return renameWithoutReplacing(from, name, folder.fd.get(), newName.c_str()); };
    const Result<void> renamed = rename();
    if (renamed.ok() || !renamed.error().isPosix(EACCES)) return renamed;
    // A folder that may not be written can't get another parent: it may for as long as it is moved.
    const UniqueFd handle = TRY(sys::openat(from, name, O_PATH | O_NOFOLLOW));
    const FileStatus status = TRY(sys::statx(handle.get(), ""));
    const bool isLocked = status.isDirectory() && (status.mode & S_IWUSR) == 0;
    const mode_t mode = status.mode & 07777;
    if (!isLocked || !sys::fchmod(handle.get(), mode | S_IWUSR).ok()) return renamed;
    const Result<void> moved = rename();
    const Result<void> restored = sys::fchmod(handle.get(), mode);
    if (!restored.ok())
        logError("can't set the mode of {}; {}", folder.pathOf(newName), restored.error().description());
    return moved;
}

/// Whether something lies in the storage's temporary folder, or below it.
bool isTemporary(const Place& place) {
    const KsURL storage = TesselManager::defaultManager().documentStorageURL();
    const std::string temporary = storage.appendingPathComponent(kTemporaryLocalFolderName).path();
    return place.path().starts_with(temporary + "/");
}

/// What is to be copied: an entry of an open folder, anywhere.
struct Source {
    UniqueFd folder;
    std::string name;
    FileStatus status;
};

Result<Source> openSource(const KsURL& url) {
    Source source;
    const std::optional<KsURL> parent = url.isFileURL() ? url.deletingLastPathComponent() : std::nullopt;
    if (!parent) return KsError::posix(EINVAL, url.path());
    source.name = url.lastPathComponent();
    TRY(ts_checkName(source.name));
    const bool isInRoot = RootDirectories::shared().rootHolding(parent->path()) != nullptr;
    constexpr int kFlags = O_PATH | O_DIRECTORY;
    auto folder = isInRoot ? RootDirectories::open(parent->path(), kFlags) : sys::open(parent->path().c_str(), kFlags);
    if (!folder.ok()) return failure(folder.error(), url.path());
    source.folder = std::move(*folder);
    const auto status = sys::statx(source.folder.get(), source.name.c_str());
    if (!status.ok()) return failure(status.error(), url.path());
    source.status = *status;
    return source;
}

/// Copies a file into a new one without a name, and links that: nobody ever sees a part of it, and nothing is left of it
/// when the process ends. EOPNOTSUPP where the file system has no such files.
Result<void> importFile(const Source& source, const Folder& folder, const std::string& path, TesselProgress& progress) {
    const UniqueFd handle = TRY(sys::openat(source.folder.get(), source.name.c_str(), O_PATH | O_NOFOLLOW));
    const FileStatus status = TRY(sys::statx(handle.get(), ""));
    if (!status.isRegular()) return KsError::posix(ESTALE);
    const UniqueFd contents = TRY(sys::reopen(handle.get(), O_RDONLY | O_NONBLOCK | O_NOCTTY));
    Result<UniqueFd> file = sys::openat(folder.fd.get(), ".", O_TMPFILE | O_WRONLY, kPrivateFile);
    // EISDIR and EINVAL: a kernel or a file system that takes it for an ordinary folder.
    if (!file.ok() && (file.error().isPosix(EISDIR) || file.error().isPosix(EINVAL))) return KsError::posix(EOPNOTSUPP);
    if (!file.ok()) return file.error();
    progress.setTotal(status.size, 1);
    TRY(TreeCopy(progress, path, {}).copyFile(contents.get(), status, file->get()));
    TRY(progress.check());
    TRY(sys::linkDescriptor(file->get(), folder.fd.get(), source.name.c_str()));
    progress.advance(0, 1);
    return {};
}

Result<void> importByStaging(const Source& source, const Folder& folder, const std::string& path,
                             TesselProgress& progress) {
    if (source.status.isDirectory() && TRY(isWithin(folder.fd.get(), source.status))) return KsError::posix(EINVAL);
    const auto staging = TRY(stagingFor(folder));
    TRY(measureTree(source.folder.get(), source.name.c_str(), path, &staging->status(), progress));
    TreeCopy copy(progress, path, {.attributeLoss = AttributeLoss::isLogged, .excluded = &staging->status()});
    TRY(copy.copy(source.folder.get(), source.name.c_str(), staging->fd(), StagingFolder::kItemName));
    TRY(progress.check());
    return putInPlace(staging->fd(), StagingFolder::kItemName, folder, source.name);
}

/// The answer of an edit that was to give something a place.
Result<KsURL> answer(const Result<void>& done, const Folder& folder, const std::string& name,
                     const std::string& subject) {
    if (done.ok()) return KsURL::fileURL(folder.pathOf(name));
    if (done.error().isPosix(EEXIST)) return collision(folder.pathOf(name));
    return failure(done.error(), subject);
}

/// Undoes a rename into a staging folder, under another name where the old one has been taken.
void putBack(StagingFolder& staging, const Folder& folder, const std::string& name, const FileStatus& status) {
    Result<void> back = renameWithoutReplacing(staging.fd(), StagingFolder::kItemName, folder.fd.get(), name.c_str());
    const NameKind kind = status.isDirectory() ? NameKind::folder : NameKind::document;
    for (std::uint64_t number = 2; !back.ok() && back.error().isPosix(EEXIST); ++number) {
        const std::string other = alternativeName(name, kind, number);
        back = renameWithoutReplacing(staging.fd(), StagingFolder::kItemName, folder.fd.get(), other.c_str());
    }
    if (back.ok()) return;
    logError("{} was left in {}; {}", folder.pathOf(name), staging.path(), back.error().description());
}

/// Takes the entry out of its folder, if it is the object that is held. The staging folder is one whose contents are
/// kept: what was taken may be something else, until that was looked at.
Result<void> takeAway(const Folder& folder, const std::string& name, const UniqueFd& handle, StagingFolder& staging) {
    TRY(takeOut(folder, name, handle, [&] {
        return sys::renameat2(folder.fd.get(), name.c_str(), staging.fd(), StagingFolder::kItemName, 0);
    }));
    const Result<void> held = checkIsHeld(staging.fd(), StagingFolder::kItemName, handle.get());
    if (held.ok()) return {};
    // Another program has put something else there since it was looked at.
    const Result<FileStatus> taken = sys::statx(staging.fd(), StagingFolder::kItemName);
    putBack(staging, folder, name, taken.ok() ? *taken : FileStatus());
    return held;
}

/// Takes the source of a finished copy away, unless it is not what was copied any more.
Result<void> removeCopied(const Place& place, const Folder& target, const std::string& name) {
    // Kept until it is certain that the copy is all there is: who writes to the source meanwhile writes to what was
    // copied before.
    const auto kept = TRY(stagingFor(place.folder, StagingFolder::Contents::areKept));
    TRY(takeAway(place.folder, place.name, place.handle, *kept));
    const Result<void> same = compareTrees(kept->fd(), StagingFolder::kItemName, target.fd.get(), name.c_str(),
                                           place.path(), Thoroughness::stamps, nullptr);
    if (!same.ok()) {
        putBack(*kept, place.folder, place.name, place.status);
        return same;
    }
    const Result<void> released = kept->letGo();
    if (!released.ok()) putBack(*kept, place.folder, place.name, place.status);
    return released;
}

/// Removes a copy that was put in place.
Result<void> takeCopyAway(const Folder& folder, const std::string& name, const UniqueFd& copy) {
    const auto kept = TRY(stagingFor(folder, StagingFolder::Contents::areKept));
    TRY(takeAway(folder, name, copy, *kept));
    return kept->letGo();
}

/// The name that something is to get; with bouncing, a free one where that is taken.
struct WantedName {
    std::string name;
    NameKind kind = NameKind::document;
    Bouncing bouncing = Bouncing::isRefused;
};

/// Calls `put` with the name, and with others while they are taken and that is no reason to refuse. The name that it got.
template <typename Put>
Result<std::string> putUnder(const WantedName& wanted, Put put) {
    std::string name = wanted.name;
    Result<void> done = put(name);
    for (std::uint64_t number = 2; wanted.bouncing == Bouncing::isAllowed && !done.ok() && done.error().isPosix(EEXIST);
         ++number) {
        name = alternativeName(wanted.name, wanted.kind, number);
        done = put(name);
    }
    if (!done.ok()) return done.error();
    return name;
}

Result<std::string> moveToOtherDevice(const Place& place, const Folder& folder, const WantedName& wanted,
                                      TesselProgress& progress) {
    const std::string path = place.path();
    if (place.status.isDirectory())
        TRY(checkTreeIsRemovable(place.folder.fd.get(), place.name.c_str(), path, progress));
    TRY(measureTree(place.folder.fd.get(), place.name.c_str(), path, nullptr, progress));
    auto staging = TRY(stagingFor(folder));
    TreeCopy copy(progress, path, {.attributeLoss = AttributeLoss::isAnError, .excluded = nullptr});
    TRY(copy.copy(place.folder.fd.get(), place.name.c_str(), staging->fd(), StagingFolder::kItemName));
    TRY(sys::syncfs(staging->fd()));
    TRY(compareTrees(place.folder.fd.get(), place.name.c_str(), staging->fd(), StagingFolder::kItemName, path,
                     Thoroughness::contents, &progress));
    TRY(progress.check());
    const UniqueFd built = TRY(sys::openat(staging->fd(), StagingFolder::kItemName, O_PATH | O_NOFOLLOW));
    std::string name = TRY(putUnder(wanted, [&](const std::string& one) {
        return putInPlace(staging->fd(), StagingFolder::kItemName, folder, one);
    }));
    // Also that it is there is to last, before the source goes. (By way of the staging folder, which lies on the same
    // file system: a handle alone can't be asked for that.)
    const Result<void> lasts = sys::syncfs(staging->fd());
    const Result<void> removed = lasts.ok() ? removeCopied(place, folder, name) : lasts;
    if (removed.ok()) return name;
    // The source is where it was: the copy goes again.
    const Result<void> undone = takeCopyAway(folder, name, built);
    if (!undone.ok()) logError("{} was left as a copy; {}", folder.pathOf(name), undone.error().description());
    return removed.error();
}

/// The name that it got.
Result<std::string> moveUnder(const WantedName& wanted, const Place& place, const Folder& folder,
                              TesselProgress& progress) {
    const int from = place.folder.fd.get();
    Result<std::string> moved = putUnder(wanted, [&](const std::string& name) {
        return takeOut(place.folder, place.name, place.handle, [&] {
            return isTemporary(place) ? putInPlace(from, place.name.c_str(), folder, name)
                                      : renameWithoutReplacing(from, place.name.c_str(), folder.fd.get(), name.c_str());
        });
    });
    if (moved.ok() || !moved.error().isPosix(EXDEV)) return moved;
    return moveToOtherDevice(place, folder, wanted, progress);
}

/// Takes the entry out of sight, and then removes it. Once it is out of sight, it is deleted.
Result<void> removeByStaging(const Place& place, TesselProgress* progress) {
    const auto staging = TRY(stagingFor(place.folder, StagingFolder::Contents::areKept));
    TRY(takeAway(place.folder, place.name, place.handle, *staging));
    const Result<void> released = staging->letGo();
    if (!released.ok()) {
        putBack(*staging, place.folder, place.name, place.status);
        return released;
    }
    const Result<void> removed = removeTree(staging->fd(), StagingFolder::kItemName, place.path(), progress);
    if (!removed.ok()) logError("can't remove all of {}; {}", place.path(), removed.error().description());
    return {};
}

Result<void> unlink(const Place& place, int flags) {
    return takeOut(place.folder, place.name, place.handle,
                   [&] { return sys::unlinkat(place.folder.fd.get(), place.name.c_str(), flags); });
}

Result<void> removeFile(const Place& place, Certainty certainty, TesselProgress& progress) {
    progress.setTotal(0, 1);
    if (certainty == Certainty::isWanted && removeByStaging(place, nullptr).ok()) return {};
    // Nothing has happened. A disk may be full, or the storage read-only, and its files can be deleted all the same.
    return unlink(place, 0);
}

Result<void> removeFolder(const Place& place, TesselProgress& progress) {
    TRY(progress.check());
    // An empty folder goes at once, whatever its own mode; of any other, this tells first what the file system refuses.
    const Result<void> removed = unlink(place, AT_REMOVEDIR);
    const bool isFull = !removed.ok() && (removed.error().isPosix(ENOTEMPTY) || removed.error().isPosix(EEXIST));
    if (!isFull) return removed;
    TRY(checkTreeIsRemovable(place.folder.fd.get(), place.name.c_str(), place.path(), progress));
    TRY(progress.check());
    return removeByStaging(place, &progress);
}

/// Where something is that may get another name.
Result<Place> openRenamed(const MeantFile& file, const std::optional<std::string>& newName) {
    if (newName) TRY(ts_checkName(*newName));
    return openPlace(file);
}

Result<KsURL> move(const Place& place, const Folder& target, const std::string& name, Bouncing bouncing,
                   TesselProgress& progress) {
    if (place.folder.status.isSameObject(target.status) && name == place.name) return KsURL::fileURL(place.path());
    const KsURL url = KsURL::fileURL(place.path());
    const WantedName wanted{name, bouncing == Bouncing::isAllowed ? nameKindOf(url) : NameKind::document, bouncing};
    const Result<std::string> moved = moveUnder(wanted, place, target, progress);
    if (!moved.ok()) return answer(moved.error(), target, name, place.path());
    return KsURL::fileURL(target.pathOf(*moved));
}

}  // namespace

namespace file_operations {

Result<KsURL> importUnderFolder(const KsURL& source, const MeantFile& folder, TesselProgress& progress) {
    const Folder target = TRY(openFolder(folder));
    const Source opened = TRY(openSource(source));
    const std::string& path = source.path();
    if (opened.status.isRegular()) {
        const Result<void> done = importFile(opened, target, path, progress);
        if (done.ok() || !done.error().isPosix(EOPNOTSUPP)) return answer(done, target, opened.name, path);
    }
    return answer(importByStaging(opened, target, path, progress), target, opened.name, path);
}

Result<KsURL> createSubFolder(const MeantFile& folder, const std::string& name) {
    TRY(ts_checkName(name));
    const Folder target = TRY(openFolder(folder));
    return answer(sys::mkdirat(target.fd.get(), name.c_str(), kAsTheUmaskSays), target, name, target.pathOf(name));
}

Result<KsURL> rename(const MeantFile& file, const std::string& newName) {
    const Place place = TRY(openRenamed(file, newName));
    TesselProgress progress;
    return move(place, place.folder, newName, Bouncing::isRefused, progress);
}

Result<KsURL> reparent(const MeantFile& file, const MeantFile& folder, const std::optional<std::string>& newName,
                       Bouncing bouncing, TesselProgress& progress) {
    const Place place = TRY(openRenamed(file, newName));
    const Folder target = TRY(openFolder(folder));
    return move(place, target, newName.value_or(place.name), bouncing, progress);
}

Result<KsURL> trash(const MeantFile& file, const KsURL& trashFolder) {
    const Place place = TRY(openPlace(file));
    const Folder target = TRY(openFolder(trashFolder));
    const char* name = place.name.c_str();
    const Result<void> moved = takeOut(place.folder, place.name, place.handle, [&] {
        return renameWithoutReplacing(place.folder.fd.get(), name, target.fd.get(), name);
    });
    return answer(moved, target, place.name, place.path());
}

Result<void> remove(const MeantFile& file, TesselProgress& progress, Certainty certainty) {
    const Place place = TRY(openPlace(file));
    const Result<void> removed =
        place.status.isDirectory() ? removeFolder(place, progress) : removeFile(place, certainty, progress);
    if (!removed.ok()) return failure(removed.error(), place.path());
    return {};
}

Result<void> makeFolderUnlessThere(const KsURL& folder) {
    const std::optional<KsURL> parent = folder.deletingLastPathComponent();
    if (!parent) return {};
    const Folder above = TRY(openFolder(*parent));
    const std::string name(folder.lastPathComponent());
    const Result<void> made = sys::mkdirat(above.fd.get(), name.c_str(), kPrivateFolder);
    if (made.ok()) return {};
    const Result<FileStatus> status = sys::statx(above.fd.get(), name.c_str());
    if (status.ok() && status->isDirectory()) return {};
    return answer(made, above, name, folder.path()).error();
}

}  // namespace file_operations

Result<void> ts_checkName(std::string_view name) {
    const bool isName = !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos &&
                        name.find('\0') == std::string_view::npos;
    if (!isName) return KsError::posix(EINVAL, std::string(name));
    if (name.size() > kNameBytesMax) return KsError::posix(ENAMETOOLONG, std::string(name));
    return {};
}

std::optional<KsURL> ts_collidingURL(const KsError& error) {
    if (!error.is(kKsGeneralErrorDomain, kKsFileWriteFileExistsError)) return std::nullopt;
    const auto url = error.userInfo().find("collidingURL");
    return url != error.userInfo().end() ? KsURL::parse(url->second) : std::nullopt;
}

Result<void> ts_withReadWriteAccess(const MeantFile& file, const std::function<Result<void>(int fd)>& body) {
    const Result<UniqueFd> fd = file.url.open(O_PATH | O_NOFOLLOW);
    if (!fd.ok()) return failure(fd.error(), file.url.path());
    if (file.object) TRY(checkIsMeant(file, TRY(sys::statx(fd->get(), ""))));
    return body(fd->get());
}

namespace {

/// Runs the work on a thread of the pool, which counts as blocked meanwhile: disks make it wait.
template <typename Work>
void inBackground(Work work) {
    dispatchAsync([work = std::move(work)]() mutable { work(); });
}

template <typename Work>
auto blocking(Work work) {
    const ThreadPool::BlockingRegion region;
    return work();
}

}  // namespace

std::shared_ptr<TesselProgress> ts_importUnderFolder(const KsURL& source, const MeantFile& folder,
                                                     FileOperationCompletion completion,
                                                     std::shared_ptr<TesselProgress> progress) {
    inBackground([source, folder, progress, completion = std::move(completion)] {
        completion(blocking([&] { return file_operations::importUnderFolder(source, folder, *progress); }));
    });
    return progress;
}

void ts_createSubFolder(const MeantFile& folder, std::string name, FileOperationCompletion completion) {
    inBackground([folder, name = std::move(name), completion = std::move(completion)] {
        completion(blocking([&] { return file_operations::createSubFolder(folder, name); }));
    });
}

void ts_renameWithNewName(const MeantFile& file, std::string newName, FileOperationCompletion completion) {
    inBackground([file, newName = std::move(newName), completion = std::move(completion)] {
        completion(blocking([&] { return file_operations::rename(file, newName); }));
    });
}

namespace {

void reparentInBackground(const MeantFile& file, const MeantFile& folder, std::optional<std::string> newName,
                          Bouncing bouncing, FileOperationCompletion completion,
                          std::shared_ptr<TesselProgress> progress) {
    inBackground([file, folder, newName = std::move(newName), bouncing, progress = std::move(progress),
                  completion = std::move(completion)] {
        completion(blocking([&] { return file_operations::reparent(file, folder, newName, bouncing, *progress); }));
    });
}

}  // namespace

std::shared_ptr<TesselProgress> ts_reparentUnderFolder(const MeantFile& file, const MeantFile& folder,
                                                       std::optional<std::string> newName,
                                                       FileOperationCompletion completion,
                                                       std::shared_ptr<TesselProgress> progress) {
    reparentInBackground(file, folder, std::move(newName), Bouncing::isRefused, std::move(completion), progress);
    return progress;
}

std::shared_ptr<TesselProgress> ts_reparentUnderFolder(const MeantFile& file, const MeantFile& folder,
                                                       Bouncing bouncing, FileOperationCompletion completion,
                                                       std::shared_ptr<TesselProgress> progress) {
    reparentInBackground(file, folder, std::nullopt, bouncing, std::move(completion), progress);
    return progress;
}

void ts_trashUnderFolder(const MeantFile& file, const KsURL& trashFolder, FileOperationCompletion completion) {
    inBackground([file, trashFolder, completion = std::move(completion)] {
        completion(blocking([&] { return file_operations::trash(file, trashFolder); }));
    });
}

std::shared_ptr<TesselProgress> ts_deleteWithCompletionHandler(const MeantFile& file, FileDeletionCompletion completion,
                                                               std::shared_ptr<TesselProgress> progress,
                                                               Certainty certainty) {
    inBackground([file, progress, certainty, completion = std::move(completion)] {
        const Result<void> removed = blocking([&] { return file_operations::remove(file, *progress, certainty); });
        completion(removed.ok() ? std::nullopt : std::optional(removed.error()));
    });
    return progress;
}

Result<std::uint64_t> ts_directorySize(const KsURL& directory) {
    const UniqueFd top = TRY(directory.open(O_PATH | O_DIRECTORY));
    const std::uint64_t device = TRY(sys::statx(top.get(), "")).device;
    std::uint64_t bytes = 0;
    alignas(8) std::byte buffer[16'384];
    // Folders wait as paths, not as descriptors: a deep tree must not use them up.
    std::vector<std::string> folders{""};
    while (!folders.empty()) {
        const std::string folder = std::move(folders.back());
        folders.pop_back();
        const Result<UniqueFd> fd = sys::openDirectoryBeneath(top.get(), folder, RESOLVE_NO_SYMLINKS | RESOLVE_NO_XDEV);
        if (!fd.ok()) continue;
        while (true) {
            const Result<std::size_t> size = sys::getdents(fd->get(), buffer);
            if (!size.ok() || *size == 0) break;
            for (std::size_t at = 0; at < *size;) {
                const auto* entry = reinterpret_cast<const DirectoryRecord*>(buffer + at);
                at += entry->length;
                if (entry->isDots()) continue;
                const Result<FileStatus> status = sys::statx(fd->get(), entry->name);
                if (!status.ok() || status->device != device) continue;
                if (status->isRegular()) bytes += status->size;
                if (status->isDirectory()) folders.push_back(folder.empty() ? entry->name : folder + "/" + entry->name);
            }
        }
    }
    return bytes;
}

}  // namespace cindral
