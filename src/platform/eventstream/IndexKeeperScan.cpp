#include <dirent.h>
#include <fcntl.h>
#include <linux/openat2.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

#include "platform/eventstream/IndexKeeper.h"
#include "platform/eventstream/IndexKeeperTypes.h"
#include "platform/eventstream/IndexKeeperWalk.h"
#include "platform/foundation/Log.h"

// How folders are compared with the index, and how the tree is reached.

namespace cindral {

using index_keeper::joined;
using index_keeper::kindOf;
using index_keeper::kLevelsMax;
using index_keeper::sizeOf;
using index_keeper::stampOf;

namespace {

// Folders that are kept open for what comes next in them; well below what a process may have open.
constexpr std::size_t kOpenFoldersMax = 128;
constexpr std::size_t kDirectoryBytes = 65'536;
// Room for less is not worth a call; more than the longest record takes.
constexpr std::size_t kDirectoryBytesMin = 4'096;
// Every folder's watch may bring news while others are read; the kernel's queue must not fill up meanwhile.
constexpr std::size_t kFoldersBetweenHints = 8;
// More folders than this are read ahead.
constexpr std::size_t kFoldersBeforeReadingAhead = 16;
// A folder that can't be reached so often keeps moving, or can't be opened for a reason of its own.
constexpr int kScanAttemptsMax = 6;

}  // namespace

std::string index_keeper::joined(std::string_view folder, std::string_view name) {
    std::string path(folder);
    if (!path.empty()) path += '/';
    path += name;
    return path;
}

// MARK: Comparing

Result<void> IndexKeeper::compareEverything(Journal journal) {
    journal_ = journal;
    everythingIsDirty_ = true;
    const Result<void> done = workOff();
    journal_ = Journal::yes;
    return done;
}

Result<void> IndexKeeper::compareTree(FileID folder) {
    toScan_.push_back(folder);
    return workOff();
}

Result<std::vector<FileID>> IndexKeeper::compareFolder(FileID fileID) {
    TRY(takeHints());
    std::vector<FileID> subfolders;
    if (const auto folder = openFolder(fileID)) {
        std::vector<Subfolder> found;
        const Result<void> compared = compareEntries(*folder, &found);
        if (!compared.ok()) everythingIsDirty_ = true;
        TRY(Result<void>(compared));
        for (const Subfolder& subfolder : found) subfolders.push_back(subfolder.fileID);
    }
    TRY(workOff());
    return subfolders;
}

Result<void> IndexKeeper::compareUnwatched() {
    // A copy: what is found to be watched now leaves the set.
    const std::vector<FileID> unwatched(unwatched_.begin(), unwatched_.end());
    for (const FileID fileID : unwatched) {
        const auto folder = openFolder(fileID);
        if (!folder) {
            if (find(fileID)) {
                scanLater(fileID);
            } else if (rootWithID(fileID) == nullptr) {
                unwatched_.erase(fileID);
            }
            continue;
        }
        watch(*folder);
        TRY(compareEntries(*folder, nullptr));
        lookAtFolderItself(*folder);
    }
    return {};
}

Result<void> IndexKeeper::scanPending() {
    for (const auto& [folder, attempts] : unreached_) toScan_.push_back(folder);
    while (!toScan_.empty()) {
        const FileID folder = toScan_.back();
        toScan_.pop_back();
        TRY(scan(folder));
    }
    return {};
}

Result<void> IndexKeeper::scan(FileID top) {
    TRY(flush());
    const auto first = openFolder(top);
    if (!first) {
        scanLater(top);
        return {};
    }
    TreeWalk walk(*this, *first->root, {top, first->path});
    std::unordered_set<FileID> forgotten;
    forgotten_ = &forgotten;
    const Result<void> compared = compareWalk(walk);
    forgotten_ = nullptr;
    TRY(Result<void>(compared));
    // Their numbers were others' before, whose watches ended when that was found: after these had been made.
    for (const FileID fileID : forgotten) {
        const auto folder = openFolder(fileID);
        if (!folder) {
            scanLater(fileID);
            continue;
        }
        watch(*folder);
        TRY(compareEntries(*folder, nullptr));
    }
    return {};
}

Result<void> IndexKeeper::compareWalk(TreeWalk& walk) {
    std::optional<ReadAhead> ahead;
    Comparison comparison;
    std::size_t count = 0;
    while (true) {
        if (options_.isStopping()) return KsError::posix(ECANCELED);
        std::optional<Batch> batch = ahead ? ahead->next() : walk.next();
        if (!batch) return {};
        if (!ahead && batch->folder) lookAtEntries(*batch);
        if (batch->isFirst && ++count % kFoldersBetweenHints == 0) TRY(takeHints());
        if (!batch->folder) {
            logDebug("can't read the folder {}; {}", batch->place.path, batch->error->description());
            noteOpenFailure(*batch->error);
            scanLater(batch->place.fileID);
            continue;
        }
        if (batch->isFirst) {
            unreached_.erase(batch->folder->fileID);
            noteWatched(*batch->folder, batch->watched);
        }
        TRY(compareBatch(comparison, *batch));
        TRY(flushWhenFull());
        // What is small is done before a thread has started.
        if (!ahead && count == kFoldersBeforeReadingAhead) ahead.emplace(walk);
    }
}

/// The folder has moved, or one above it, since its parent was read: it may be found in the next round. One that is gone
/// is not in the index then; one that is closed says so when it is opened.
void IndexKeeper::scanLater(FileID folder) {
    const std::optional<Known> known = find(folder);
    if (known && !known->object.isClosed && ++unreached_[folder] <= kScanAttemptsMax) {
        dirtyObjects_.insert(folder);
    } else {
        unreached_.erase(folder);
        // Never without anybody looking: it is compared at each call until it can be watched.
        if (known && !known->object.isClosed) unwatched_.insert(folder);
    }
}

Result<void> IndexKeeper::compareEntries(OpenFolder& folder, std::vector<Subfolder>* subfolders) {
    Comparison comparison;
    Batch batch;
    batch.folder = folder.shared_from_this();
    batch.isFirst = true;
    (void)::lseek(folder.fd.get(), 0, SEEK_SET);
    while (!batch.isLast) {
        readNames(batch);
        lookAtEntries(batch);
        TRY(compareBatch(comparison, batch));
        for (const BatchEntry& entry : batch.entries) {
            if (subfolders != nullptr && entry.status.isDirectory())
                subfolders->push_back({FileID{entry.status.fileID}, joined(folder.path, entry.name)});
        }
        batch.isFirst = false;
    }
    return {};
}

/// The names of the batch's folder that come next. Touches nothing of the keeper's.
void IndexKeeper::readNames(Batch& batch) {
    const OpenFolder& folder = *batch.folder;
    batch.entries.clear();
    if (!batch.names) batch.names = std::make_unique_for_overwrite<std::byte[]>(kDirectoryBytes);
    std::size_t size = 0;
    // To the end where there is room: a folder that isn't large is one batch.
    while (!batch.isLast && kDirectoryBytes - size >= kDirectoryBytesMin) {
        const Result<std::size_t> read =
            sys::getdents(folder.fd.get(), {batch.names.get() + size, kDirectoryBytes - size});
        if (!read.ok()) batch.error = read.error();
        batch.isLast = !read.ok() || *read == 0;
        size += read.ok() ? *read : 0;
    }
    for (std::size_t at = 0; at < size;) {
        const auto* record = reinterpret_cast<const DirectoryRecord*>(batch.names.get() + at);
        at += record->length;
        if (record->isDots()) continue;
        const bool mayBeFolder = record->type == DT_DIR || record->type == DT_UNKNOWN;
        batch.entries.push_back({.name = record->name, .mayBeFolder = mayBeFolder});
    }
}

/// What is gone meanwhile, or of another device, is taken out. Touches nothing of the keeper's.
void IndexKeeper::lookAtEntries(Batch& batch) {
    std::erase_if(batch.entries, [&](BatchEntry& entry) { return !entry.isSeen && !lookAt(batch, entry); });
}

/// Whether it is there, and ours. Touches nothing of the keeper's.
bool IndexKeeper::lookAt(Batch& batch, BatchEntry& entry) {
    const OpenFolder& folder = *batch.folder;
    const Result<FileStatus> status = sys::statx(folder.fd.get(), entry.name);
    if (!status.ok() && !status.error().isPosix(ENOENT)) {
        logDebug("can't look at {}/{}; {}", folder.path, entry.name, status.error().description());
        // What can't be looked at is not gone.
        batch.sawAll = false;
    }
    entry.isSeen = status.ok() && status->device == folder.root->directory->status.device;
    if (entry.isSeen) entry.status = *status;
    return entry.isSeen;
}

Result<void> IndexKeeper::compareBatch(Comparison& comparison, Batch& batch) {
    OpenFolder& folder = *batch.folder;
    if (batch.isFirst) {
        // What is counted and what is met are to be of one moment.
        if (journal_ == Journal::yes) TRY(flush());
        comparison = {.recorded = store_.childCount(folder.fileID)};
    }
    comparison.sawAll = comparison.sawAll && batch.sawAll;
    comparison.fileIDs.clear();
    for (const BatchEntry& entry : batch.entries) {
        comparison.fileIDs.push_back(FileID{entry.status.fileID});
        comparison.seen.push_back(entry.status.fileID);
    }
    TRY(store_.indexed(comparison.fileIDs, [&](std::size_t i, const IndexedObject* object) {
        BatchEntry& entry = batch.entries[i];
        if (object == nullptr || object->parent != folder.fileID || object->name != entry.name ||
            object->birthTime != entry.status.birthStamp())
            return;
        ++comparison.recordedHere;
        entry.isMatched = object->changeTime == stampOf(entry.status.changeTime) &&
                          object->size == sizeOf(entry.status) && object->kind == kindOf(entry.status, entry.name) &&
                          !object->isClosed && !object->hasOtherNames && entry.status.names == 1;
        // A folder's number of links says nothing.
        if (entry.status.isDirectory() && !object->isClosed) {
            entry.isMatched = object->changeTime == stampOf(entry.status.changeTime) &&
                              object->kind == kindOf(entry.status, entry.name);
        }
    }));
    for (const BatchEntry& entry : batch.entries) {
        if (!entry.isMatched) TRY(seeCompared(folder, entry));
    }
    if (!batch.isLast) return {};
    if (batch.error) {
        // What can't be read is not gone, and is no reason not to read the others.
        logDebug("can't read the folder {}; {}", folder.path, batch.error->description());
        return {};
    }
    if (!comparison.sawAll || comparison.recordedHere == comparison.recorded) return {};
    return findLost(folder, comparison.seen);
}

Result<void> IndexKeeper::seeCompared(OpenFolder& folder, const BatchEntry& entry) {
    const std::size_t before = toScan_.size();
    TRY(see(folder, entry.name, entry.status, false));
    watchNames(folder, entry.name, entry.status);
    if (entry.isEntered) {
        const auto added = toScan_.begin() + static_cast<std::ptrdiff_t>(before);
        toScan_.erase(std::remove(added, toScan_.end(), FileID{entry.status.fileID}), toScan_.end());
    }
    return flushWhenFull();
}

/// What the index has in the folder and the folder doesn't.
Result<void> IndexKeeper::findLost(OpenFolder& folder, std::vector<std::uint64_t>& seen) {
    TRY(flush());
    std::ranges::sort(seen);
    std::vector<Known> missing;
    TRY(store_.children(folder.fileID, [&](const IndexedObject& object) {
        if (std::ranges::binary_search(seen, static_cast<std::uint64_t>(object.fileID))) return;
        missing.push_back({object, std::string(object.name)});
        missing.back().object.name = {};
    }));
    for (const Known& known : missing) {
        const Result<FileStatus> status = sys::statx(folder.fd.get(), known.name.c_str());
        if (!status.ok() && !status.error().isPosix(ENOENT)) continue;
        const bool isThere = status.ok() && status->device == folder.root->directory->status.device;
        if (isThere && known.isSame(FileID{status->fileID}, status->birthStamp())) continue;
        lost(folder.fileID, known.name, known, isThere ? std::optional(FileID{status->fileID}) : std::nullopt);
    }
    return {};
}

// MARK: Watching

void IndexKeeper::watch(const OpenFolder& folder) {
    noteWatched(folder, startWatching(folder));
}

/// EOPNOTSUPP where nothing tells of the root.
Result<void> IndexKeeper::startWatching(const OpenFolder& folder) const {
    const auto& source = folder.root->source;
    if (!source) return KsError::posix(EOPNOTSUPP);
    const MutexLock lock(sourcesMutex_);
    return source->watchFolder(folder.fd.get(), folder.fileID);
}

void IndexKeeper::noteWatched(const OpenFolder& folder, const Result<void>& watched) {
    if (watched.ok()) {
        unwatched_.erase(folder.fileID);
        return;
    }
    if (watched.error().isPosix(ENOSPC)) {
        reachedWatchLimit_ = true;
    } else if (folder.root->source) {
        logDebug("can't watch {}; {}", folder.path, watched.error().description());
    }
    unwatched_.insert(folder.fileID);
}

/// A file with several names may be changed through one that is outside of the roots.
void IndexKeeper::watchNames(const OpenFolder& folder, std::string_view name, const FileStatus& status) {
    if (!status.isRegular() || status.names < 2 || !folder.root->source) return;
    const Result<UniqueFd> file = sys::openat(folder.fd.get(), std::string(name).c_str(), O_PATH | O_NOFOLLOW);
    if (!file.ok()) return;
    const Result<void> watched = [&] {
        const MutexLock lock(sourcesMutex_);
        return folder.root->source->watchFile(file->get(), FileID{status.fileID});
    }();
    if (watched.ok()) return;
    logDebug("can't watch the file {}; {}", name, watched.error().description());
    if (!watched.error().isPosix(ENOSPC)) return;
    // Its folder is compared at each call until there are watches again.
    reachedWatchLimit_ = true;
    unwatched_.insert(folder.fileID);
}

void IndexKeeper::forgetWatch(FileID fileID) {
    {
        const MutexLock lock(sourcesMutex_);
        for (const auto& source : sources_) source->forget(fileID);
    }
    if (forgotten_ != nullptr) forgotten_->insert(fileID);
    unwatched_.erase(fileID);
    closed_.erase(fileID);
}

// MARK: Subtrees

Result<void> IndexKeeper::forEachBelow(FileID top, const std::function<Result<void>(const Below&)>& use) {
    struct Level {
        FileID folder{};
        bool isExpanded = false;
    };
    std::vector<Level> stack{{top, false}};
    // While folders are on their way to their places, the index may have one below another and that one below it.
    std::unordered_set<FileID> visited;
    std::vector<Below> files;
    while (!stack.empty()) {
        const FileID folder = stack.back().folder;
        if (stack.back().isExpanded) {
            stack.pop_back();
            if (folder != top) TRY(use({.fileID = folder, .isFolder = true}));
            continue;
        }
        stack.back().isExpanded = true;
        if (!visited.insert(folder).second) {
            stack.pop_back();
            continue;
        }
        files.clear();
        TRY(store_.children(folder, [&](const IndexedObject& object) {
            if (object.kind == ObjectKind::folder || object.kind == ObjectKind::package) {
                stack.push_back({object.fileID, false});
            } else {
                files.push_back({.fileID = object.fileID, .hasOtherNames = object.hasOtherNames});
            }
        }));
        for (const Below& file : files) TRY(use(file));
    }
    return {};
}

Result<void> IndexKeeper::removeBelow(FileID folder) {
    TRY(flush());
    return forEachBelow(folder, [this, folder](const Below& below) -> Result<void> {
        const bool hadOtherNames = !below.isFolder && mayHaveOtherNames(below.fileID, below.hasOtherNames);
        if (hadOtherNames && keepUnderOtherName(below.fileID, folder)) return flushWhenFull();
        if (below.isFolder) recent_.forgetFolder(below.fileID);
        if (below.isFolder || hadOtherNames) forgetWatch(below.fileID);
        const std::optional<Known> known = replacements_.empty() ? std::nullopt : find(below.fileID);
        if (known) TRY(takeOverFrom(*known));
        changes().remove(below.fileID);
        return flushWhenFull();
    });
}

Result<void> IndexKeeper::touchBelow(FileID folder) {
    if (journal_ == Journal::no) return {};
    return forEachBelow(folder, [this](const Below& below) -> Result<void> {
        changes().touch(below.fileID);
        return {};
    });
}

Result<void> IndexKeeper::removeTree(FileID folder) {
    // What departs is journalled with its path below a root: of a root that is none any more, it is the one of then.
    const std::vector<FileID> current = rootIDs_;
    if (rootWithID(folder) == nullptr) rootIDs_.push_back(folder);
    Result<void> removed = removeBelow(folder);
    forgetWatch(folder);
    if (removed.ok() && find(folder)) changes().remove(folder);
    if (removed.ok()) removed = flush();
    rootIDs_ = current;
    return removed;
}

// MARK: The tree

const IndexKeeper::Root* IndexKeeper::rootWithID(FileID fileID) const {
    const auto found = std::ranges::find(roots_, fileID, &Root::fileID);
    return found == roots_.end() ? nullptr : &*found;
}

/// Opens the folder at the path, if it is the one. No link is part of a path that leads to a folder by its parents.
Result<std::shared_ptr<IndexKeeper::OpenFolder>> IndexKeeper::open(FileID fileID, std::string_view path,
                                                                   const Root& root) const {
    auto folder = std::make_shared<OpenFolder>();
    const int rootFd = root.directory->fd.get();
    folder->fd = path.empty() ? TRY(sys::openDirectoryForReading(rootFd, "."))
                              : TRY(sys::openDirectoryBeneath(rootFd, path, RESOLVE_NO_SYMLINKS));
    const FileStatus status = TRY(sys::statx(folder->fd.get(), ""));
    if (FileID{status.fileID} != fileID || status.device != root.directory->status.device) {
        return KsError::posix(ESTALE);
    }
    folder->fileID = fileID;
    folder->path = path;
    folder->root = &root;
    folder->stampsAreDistinct = root.stampsAreDistinct;
    return folder;
}

/// A folder that can't be opened because it is not there, or not for us, is one thing; that nothing can be opened for
/// want of descriptors, memory or a sound disk is another: the round has failed then.
void IndexKeeper::noteOpenFailure(const KsError& error) {
    constexpr std::array<int, 6> kNotThere = {ENOENT, ENOTDIR, ELOOP, ESTALE, EACCES, EXDEV};
    if (std::ranges::none_of(kNotThere, [&](int code) { return error.isPosix(code); })) openFailure_ = error;
}

/// Null when it can't be opened where the index has it.
std::shared_ptr<IndexKeeper::OpenFolder> IndexKeeper::openFolder(FileID fileID) {
    if (const auto found = openFolders_.find(fileID); found != openFolders_.end()) return found->second;
    const Root* root = rootWithID(fileID);
    std::string path;
    if (root == nullptr) {
        // Folders on the way may have moved with changes that are not written yet.
        std::vector<std::string> names;
        FileID at = fileID;
        while ((root = rootWithID(at)) == nullptr) {
            const std::optional<Known> known = find(at);
            if (!known || names.size() > kLevelsMax) return nullptr;
            names.push_back(known->name);
            at = known->object.parent;
        }
        for (auto name = names.rbegin(); name != names.rend(); ++name) path = joined(path, *name);
    }
    Result<std::shared_ptr<OpenFolder>> folder = open(fileID, path, *root);
    if (!folder.ok()) {
        // Without a root, nothing at all can be said.
        if (rootWithID(fileID) != nullptr) openFailure_ = folder.error();
        noteOpenFailure(folder.error());
        return nullptr;
    }
    if (openFolders_.size() >= kOpenFoldersMax) openFolders_.clear();
    return openFolders_.emplace(fileID, *std::move(folder)).first->second;
}

std::optional<FileStatus> IndexKeeper::statusAt(FileID parent, const std::string& name) {
    const auto folder = openFolder(parent);
    if (!folder) return std::nullopt;
    const Result<FileStatus> status = sys::statx(folder->fd.get(), name.c_str());
    if (!status.ok() || status->device != folder->root->directory->status.device) return std::nullopt;
    return *status;
}

bool IndexKeeper::holds(FileID parent, const std::string& name, FileID fileID, std::int64_t birthTime) {
    const std::optional<FileStatus> status = statusAt(parent, name);
    return status && FileID{status->fileID} == fileID && status->birthStamp() == birthTime;
}

}  // namespace cindral
