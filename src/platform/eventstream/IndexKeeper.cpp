#include "platform/eventstream/IndexKeeper.h"

#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <iterator>
#include <span>
#include <utility>

#include "platform/eventstream/IndexKeeperTypes.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/TrashName.h"
#include "platform/foundation/TypeDatabase.h"
#include "platform/revisions/ObjectFinder.h"
#include "platform/revisions/OwnAttributes.h"

// Rounds, looking, and saves. What compares whole folders is in IndexKeeperScan.cpp.

namespace cindral {

using index_keeper::kindOf;
using index_keeper::kLevelsMax;
using index_keeper::sizeOf;
using index_keeper::stampOf;

namespace {

// A transaction of so many changes costs little more than its changes.
constexpr std::size_t kChangesAtOnceMax = 1'000;
// A folder that can't be reached so often keeps moving, or can't be opened for a reason of its own.
constexpr int kAttemptsMax = 6;
// What comes while a call works is left to the next one after so many rounds. Everything that was complete before the
// call is done by then: what is looked for turns up while folders are still reached, or is given up.
constexpr int kRoundsMax = kAttemptsMax + 2;
// Numbers from here on are no object's, as far as they are not found to be one's.
constexpr std::uint64_t kFirstFormer = 0xFFFF'FFFF'0000'0000;
// No object's: of one that is recorded where it is only supposed to be. (0 is of one that nobody has looked at.)
constexpr std::int64_t kSupposedStamp = 1;
// A number given to an object younger than this was given while it was being saved.
constexpr std::int64_t kYoungNanoseconds = 60'000'000'000;

bool isFormer(FileID fileID) {
    return static_cast<std::uint64_t>(fileID) >= kFirstFormer;
}

/// The number in a name such as "#123": what the kernel calls a file that was made without a name.
std::optional<FileID> numberOfNameless(std::string_view name) {
    if (!name.starts_with('#') || name.size() < 2) return std::nullopt;
    std::uint64_t number = 0;
    const auto read = std::from_chars(name.data() + 1, name.data() + name.size(), number);
    if (read.ec != std::errc() || read.ptr != name.data() + name.size()) return std::nullopt;
    return FileID{number};
}

}  // namespace

ObjectKind index_keeper::kindOf(const FileStatus& status, std::string_view name) {
    return objectKindOf(status, status.isDirectory() && TypeDatabase::shared().isPackageName(name));
}

IndexKeeper::IndexKeeper(VolumeStore& store, Options options) : store_(store), options_(std::move(options)) {}
IndexKeeper::~IndexKeeper() = default;

void IndexKeeper::setRoots(std::vector<Root> roots) {
    openFolders_.clear();
    contexts_.clear();
    roots_ = std::move(roots);
    rootIDs_.clear();
    sources_.clear();
    for (const Root& root : roots_) {
        rootIDs_.push_back(root.fileID());
        if (root.source && std::ranges::find(sources_, root.source) == sources_.end()) sources_.push_back(root.source);
    }
}

// MARK: Hints

Result<void> IndexKeeper::takeHints() {
    const MutexLock lock(sourcesMutex_);
    for (const auto& source : sources_) TRY(source->drain([this](const EventHint& hint) { note(hint); }));
    return {};
}

void IndexKeeper::note(const EventHint& hint) {
    switch (hint.kind) {
        case EventHint::Kind::entry: dirtyFolders_[hint.folder].names.emplace(hint.name); break;
        case EventHint::Kind::object:
        case EventHint::Kind::lost: dirtyObjects_.insert(hint.fileID); break;
        case EventHint::Kind::overflow:
            if (!everythingIsDirty_) logInfo("events were lost; comparing everything");
            everythingIsDirty_ = true;
            break;
    }
}

// MARK: Rounds

Result<void> IndexKeeper::settle() {
    return workOff();
}

/// Whatever fails, nothing is forgotten: the next call compares everything.
Result<void> IndexKeeper::workOff() {
    const Result<void> done = rounds();
    openFolders_.clear();
    contexts_.clear();
    if (!done.ok()) {
        // Replacements and vacancies stay: each is looked at anew before a document is handed over, and can't be found
        // again.
        changes_.reset();
        placed_.clear();
        departures_.clear();
        everythingIsDirty_ = true;
    }
    return done;
}

Result<void> IndexKeeper::rounds() {
    openFailure_.reset();
    TRY(takeHints());
    bool isFirst = true;
    for (int round = 0; round < kRoundsMax; ++round) {
        if (!isFirst && !isDirty() && departures_.empty()) break;
        ++roundNumber_;
        placedFolder_ = false;
        TRY(lookAtDirt());
        if (isFirst) TRY(compareUnwatched());
        isFirst = false;
        TRY(scanPending());
        TRY(flush());
        waitForRenames();
        TRY(takeHints());
        TRY(endRound(!isDirty(), round + 1 == kRoundsMax));
        TRY(flush());
        if (openFailure_) return *std::exchange(openFailure_, std::nullopt);
    }
    return {};
}

/// A rename takes an object from its old name before the event is out, but both folders are locked until it is. Who
/// has read a folder knows that no such rename is under way in it.
void IndexKeeper::waitForRenames() {
    std::vector<FileID> parents;
    for (const Departure& departure : departures_) {
        if (departure.round == roundNumber_) parents.push_back(departure.parent);
    }
    std::ranges::sort(parents);
    parents.erase(std::ranges::unique(parents).begin(), parents.end());
    alignas(8) std::byte buffer[4'096];
    for (const FileID parent : parents) {
        const auto folder = openFolder(parent);
        if (!folder) continue;
        (void)::lseek(folder->fd.get(), 0, SEEK_SET);
        (void)sys::getdents(folder->fd.get(), buffer);
    }
}

Result<void> IndexKeeper::lookAtDirt() {
    if (std::exchange(everythingIsDirty_, false)) {
        if (options_.seenFiles != nullptr) options_.seenFiles->clear();
        dirtyFolders_.clear();
        dirtyObjects_.clear();
        unreached_.clear();
        toScan_ = rootIDs_;
        return {};
    }
    auto folders = std::exchange(dirtyFolders_, {});
    const auto objects = std::exchange(dirtyObjects_, {});
    for (auto& [fileID, dirt] : folders) TRY(lookAtDirtyFolder(fileID, std::move(dirt)));
    for (const FileID fileID : objects) TRY(lookAtObject(fileID));
    return {};
}

Result<void> IndexKeeper::lookAtDirtyFolder(FileID fileID, FolderDirt dirt) {
    const auto folder = openFolder(fileID);
    if (!folder) {
        if (rootWithID(fileID) != nullptr) return {};
        // Where it can't be reached, its own parent tells what became of it.
        TRY(lookAtObject(fileID));
        // Should it be gone from the roots, what changed by a name in it may have another name that is not.
        for (const std::string& name : dirt.names) {
            for (const Known& known : findAt(fileID, name)) {
                if (!known.isAt(fileID, name)) dirtyObjects_.insert(known.object.fileID);
            }
        }
        lookAgainLater(fileID, std::move(dirt));
        return {};
    }
    for (const std::string& name : dirt.names) {
        TRY(look(*folder, name));
        TRY(flushWhenFull());
    }
    lookAtFolderItself(*folder);
    return {};
}

/// The folder may have moved, or one above it, and be found in the next round. One that is gone is not in the index
/// then; one that was closed is compared when it is opened again.
void IndexKeeper::lookAgainLater(FileID fileID, FolderDirt dirt) {
    const std::optional<Known> known = find(fileID);
    if (!known || known->object.isClosed) return;
    if (++dirt.attempts > kAttemptsMax) {
        // Never without anybody looking: it is compared at each call until it can be watched.
        unwatched_.insert(fileID);
        return;
    }
    FolderDirt& later = dirtyFolders_[fileID];
    later.attempts = std::max(later.attempts, dirt.attempts);
    later.names.merge(dirt.names);
}

Result<void> IndexKeeper::lookAtObject(FileID fileID) {
    if (rootWithID(fileID) != nullptr) return {};
    const std::optional<Known> known = find(fileID);
    if (!known) return {};
    if (const auto folder = openFolder(known->object.parent)) return look(*folder, known->name);
    if (rootWithID(known->object.parent) == nullptr) lookAgainLater(known->object.parent, {{known->name}, 0});
    return {};
}

/// Gives up what did not turn up. In a quiet round nothing is dirty any more, so nothing can. Otherwise what was lost in
/// this round waits for the next, and for longer where folders can't be reached while others are found at new places: it
/// may be in one that is reached once the folder above it is.
Result<void> IndexKeeper::endRound(bool isQuiet, bool isLast) {
    const auto isWaiting = [](const auto& dirty) { return dirty.second.attempts > 0; };
    const bool mayBeReached =
        !isLast && placedFolder_ && (!unreached_.empty() || std::ranges::any_of(dirtyFolders_, isWaiting));
    const auto isOver = [&](std::uint64_t since) {
        return isQuiet || since + kAttemptsMax <= roundNumber_ || (since < roundNumber_ && !mayBeReached);
    };
    fillVacancies();
    std::vector<Departure> waiting;
    for (Departure& departure : std::exchange(departures_, {})) {
        if (isOver(departure.round)) {
            TRY(giveUp(departure));
            TRY(flushWhenFull());
        } else {
            waiting.push_back(std::move(departure));
        }
    }
    departures_.insert(departures_.end(), std::make_move_iterator(waiting.begin()),
                       std::make_move_iterator(waiting.end()));
    return departures_.empty() ? resolveReplacements() : Result<void>();
}

Result<void> IndexKeeper::giveUp(const Departure& departure) {
    const std::optional<Known> known = find(departure.fileID);
    // It turned up elsewhere, or its number went to another object: either way it is where the index says.
    if (!known || !known->isSame(departure.fileID, departure.birthTime) ||
        !known->isAt(departure.parent, departure.name))
        return {};
    if (holds(departure.parent, departure.name, departure.fileID, departure.birthTime)) return {};
    entriesChanged(departure.parent);
    const bool hadOtherNames = !known->isFolder() && mayHaveOtherNames(departure.fileID, known->object.hasOtherNames);
    if (hadOtherNames) {
        // Which folders are still there decides, as far as that is known.
        TRY(flush());
        if (keepUnderOtherName(departure.fileID, FileID{})) return {};
    }
    if (known->object.documentID != DocumentID{}) {
        recent_.add(departure.parent, departure.name, known->object.documentID, options_.now());
    }
    if (known->isFolder()) {
        recent_.forgetFolder(departure.fileID);
        TRY(removeBelow(departure.fileID));
        forgetWatch(departure.fileID);
        contexts_.clear();
    } else if (hadOtherNames) {
        forgetWatch(departure.fileID);
    }
    TRY(takeOverFrom(*known));
    placed_.erase(departure.fileID);
    changes().remove(departure.fileID);
    return {};
}

/// Whoever takes its document over does so before it is gone.
Result<void> IndexKeeper::takeOverFrom(const Known& leaving) {
    const DocumentID document = leaving.object.documentID;
    const auto found = replacements_.find(document);
    if (document == DocumentID{} || found == replacements_.end()) return {};
    const Replacement replacement = std::move(found->second);
    replacements_.erase(found);
    return takeOver(document, replacement.parent, replacement.name, replacement.newcomer);
}

/// Also where it was last seen with one: a rename over a name counts it off while the file can still be met under it.
bool IndexKeeper::mayHaveOtherNames(FileID fileID, bool hadWhenSeen) const {
    return hadWhenSeen || !store_.otherNames(fileID).empty();
}

/// False when the object has no other name that leads to it. What is in `leaving` is on its way out with it.
bool IndexKeeper::keepUnderOtherName(FileID fileID, FileID leaving) {
    const std::optional<Known> known = find(fileID);
    if (!known) return false;
    std::optional<VolumeStore::Name> unreached;
    for (VolumeStore::Name& other : store_.otherNames(fileID)) {
        // By its path, anew: a folder that was opened before may have left the roots since, with the name in it.
        openFolders_.erase(other.parent);
        if (!openFolder(other.parent)) {
            if (!unreached && leadsToRoot(other.parent, leaving)) unreached = std::move(other);
            continue;
        }
        const std::optional<FileStatus> status = statusAt(other.parent, other.name);
        if (!status || !known->isSame(FileID{status->fileID}, status->birthStamp())) continue;
        changes().removeName(fileID, other.parent, other.name);
        put(other.parent, other.name, *status, false);
        return true;
    }
    if (unreached) recordUnderName(*known, *unreached);
    return unreached.has_value();
}

/// A folder on the way to the name has moved, with the name in it or not: that is looked at once it is found.
void IndexKeeper::recordUnderName(const Known& known, const VolumeStore::Name& name) {
    changes().removeName(known.object.fileID, name.parent, name.name);
    Known there{known.object, name.name};
    there.object.parent = name.parent;
    there.object.changeTime = kSupposedStamp;
    IndexedObject object = there.object;
    object.name = there.name;
    changes().put(object);
    placed_.insert_or_assign(known.object.fileID, std::move(there));
    entriesChanged(name.parent);
    dirtyFolders_[name.parent].names.insert(name.name);
}

/// Whether the index has the folder below a root, and not in the other.
bool IndexKeeper::leadsToRoot(FileID folder, FileID other) const {
    for (std::size_t levels = 0; levels < kLevelsMax; ++levels) {
        if (folder == other) return false;
        if (rootWithID(folder) != nullptr) return true;
        const std::optional<Known> known = find(folder);
        if (!known) return false;
        folder = known->object.parent;
    }
    return false;
}

IndexChanges& IndexKeeper::changes() {
    if (!changes_) changes_ = std::make_unique<IndexChanges>(journal_);
    return *changes_;
}

Result<void> IndexKeeper::flush() {
    placed_.clear();
    // In one transaction with what changed inside of them.
    for (const FileID folder : std::exchange(touchedFolders_, {})) changes().touch(folder);
    if (!changes_ || changes_->empty()) return {};
    const auto changes = std::exchange(changes_, nullptr);
    changeCount_ += changes->size();
    TRY(store_.apply(*changes, rootIDs_));
    return {};
}

Result<void> IndexKeeper::flushWhenFull() {
    return changes_ && changes_->size() >= kChangesAtOnceMax ? flush() : Result<void>();
}

// MARK: Looking

Result<void> IndexKeeper::look(OpenFolder& folder, const std::string& name) {
    const Result<FileStatus> status = sys::statx(folder.fd.get(), name.c_str());
    if (!status.ok() && !status.error().isPosix(ENOENT)) {
        // EACCES: the folder was closed; what is in it is told when it is opened again.
        logDebug("can't look at {}/{}; {}", folder.path, name, status.error().description());
        return {};
    }
    const std::vector<Known> formers = findAt(folder.fileID, name);
    const bool isHere = status.ok() && status->device == folder.root->directory->status.device;
    const auto here = isHere ? std::optional(FileID{status->fileID}) : std::nullopt;
    if (isHere) {
        TRY(see(folder, name, *status, true));
        noteSeen(folder, name, *status);
    }
    if (formers.empty() && !isHere) {
        if (const auto nameless = numberOfNameless(name)) dirtyObjects_.insert(*nameless);
    }
    for (const Known& former : formers) {
        if (former.object.fileID != here) lost(folder.fileID, name, former, here);
    }
    return {};
}

/// Another name is looked at by hints of its own, and changes what the first one's said.
void IndexKeeper::noteSeen(const OpenFolder& folder, const std::string& name, const FileStatus& status) {
    if (options_.seenFiles == nullptr) return;
    SeenFiles& files = *options_.seenFiles;
    std::string attributes;
    if (status.isRegular() && status.names == 1 && files.takesMore() &&
        !sys::hasXattrs(folder.fd.get(), name.c_str(), attributes).valueOr(true)) {
        files.put(status);
    } else {
        files.forget(FileID{status.fileID});
    }
}

/// A name of an object that is no longer there, or has another.
void IndexKeeper::lost(FileID parent, std::string_view name, const Known& known, std::optional<FileID> newcomer) {
    if (!known.isAt(parent, name)) {
        // One of its other names. The number of names is part of its status.
        changes().removeName(known.object.fileID, parent, name);
        entriesChanged(parent);
        dirtyObjects_.insert(known.object.fileID);
        return;
    }
    departures_.push_back({parent, std::string(name), known.object.fileID, known.object.birthTime, roundNumber_});
    if (newcomer && known.object.documentID != DocumentID{}) {
        replacements_.emplace(known.object.documentID, Replacement{parent, std::string(name), *newcomer});
    }
}

Result<void> IndexKeeper::see(OpenFolder& folder, std::string_view name, const FileStatus& status, bool isHinted) {
    const std::optional<Known> known = find(FileID{status.fileID});
    if (known && known->object.birthTime == status.birthStamp()) {
        return seeKnown(folder, name, status, *known, isHinted);
    }
    return seeNew(folder, name, status, known);
}

Result<void> IndexKeeper::seeKnown(OpenFolder& folder, std::string_view name, const FileStatus& status,
                                   const Known& known, bool isHinted) {
    const IndexedObject& object = known.object;
    const bool isFolder = status.isDirectory();
    const bool isChanged = object.changeTime != stampOf(status.changeTime) || object.size != sizeOf(status) ||
                           object.kind != kindOf(status, name);
    const bool isClosed = isFolder && (isChanged || object.isClosed)
                              ? sys::isClosedDirectory(folder.fd.get(), std::string(name).c_str())
                              : object.isClosed;
    if (!known.isAt(folder.fileID, name)) {
        if (isFolder || !holds(object.parent, known.name, object.fileID, object.birthTime)) {
            return seeMoved(folder, name, status, known, isClosed);
        }
        return seeOtherName(folder, name, status, known);
    }
    // Where two changes may bear the same stamp, a hint alone says that there was one.
    if (isFolder) noteClosed(object.fileID, isClosed);
    const bool showsOtherwise = isFolder && (object.isClosed != isClosed || object.kind != kindOf(status, name));
    // What is below is touched in the same transaction, so it is to be in the index by then.
    if (showsOtherwise) TRY(flush());
    if (!isChanged && object.isClosed == isClosed && (!isHinted || folder.stampsAreDistinct || isFolder)) return {};
    put(folder.fileID, name, status, isClosed);
    rememberAttributes(folder, name, known);
    if (!isFolder) {
        if (object.hasOtherNames && status.names < 2) forgetWatch(object.fileID);
        watchNames(folder, name, status);
        return {};
    }
    // A listing has recorded it before the recorder came to it: what is in it is still to be read.
    if (object.changeTime == 0 && !isClosed) toScan_.push_back(object.fileID);
    if (!showsOtherwise) return {};
    // What is below shows, or no longer shows, where it did not, or did.
    contexts_.clear();
    if (!isClosed) toScan_.push_back(object.fileID);
    return touchBelow(object.fileID);
}

Result<void> IndexKeeper::seeMoved(OpenFolder& folder, std::string_view name, const FileStatus& status,
                                   const Known& known, bool isClosed) {
    const IndexedObject& object = known.object;
    movedAway(known, folder.fileID, name);
    if (!status.isDirectory()) {
        for (const VolumeStore::Name& other : store_.otherNames(object.fileID)) {
            if (other.parent == folder.fileID && other.name == name) {
                changes().removeName(object.fileID, other.parent, other.name);
            }
        }
    }
    entriesChanged(object.parent);
    entriesChanged(folder.fileID);
    if (!status.isDirectory()) {
        const bool mayHoldOldName = status.names > 1 && !isFormer(object.parent) && !openFolder(object.parent);
        put(folder.fileID, name, status, false);
        // Its old folder is on its way to another place, with the name in it.
        if (mayHoldOldName) changes().addName(object.fileID, object.parent, known.name);
        arrived(folder.fileID, name, object.fileID);
        watchNames(folder, name, status);
        return {};
    }
    placedFolder_ = true;
    noteClosed(object.fileID, isClosed);
    const Context before = contextInside(object.parent, known.name, object.kind);
    const Context after = contextInside(folder.fileID, name, kindOf(status, name));
    // A folder that becomes a trash is no item any more, wherever it is: what is in it is told of after it.
    const bool isShownOtherwise = before.differsFrom(after) || (name == kTrashName && known.name != kTrashName);
    // What is below is touched in the same transaction, so it is to be in the index by then.
    if (isShownOtherwise) TRY(flush());
    put(folder.fileID, name, status, isClosed);
    arrived(folder.fileID, name, object.fileID);
    contexts_.clear();
    const bool isUnread = before.root != after.root || object.changeTime == 0 || object.isClosed;
    if (isUnread && !isClosed) toScan_.push_back(object.fileID);
    return isShownOtherwise ? touchBelow(object.fileID) : Result<void>();
}

Result<void> IndexKeeper::seeOtherName(OpenFolder& folder, std::string_view name, const FileStatus& status,
                                       const Known& known) {
    const IndexedObject& object = known.object;
    const std::vector<Known> here = findAt(folder.fileID, name);
    const auto isIt = [&](const Known& one) { return one.object.fileID == object.fileID; };
    if (std::ranges::none_of(here, isIt)) {
        changes().addName(object.fileID, folder.fileID, name);
        entriesChanged(folder.fileID);
    }
    // The stamp alone doesn't tell: a link sets it before it counts the name, and the file may be looked at in between.
    const bool isUncounted = status.names > 1 && !object.hasOtherNames;
    if (isUncounted || object.changeTime != stampOf(status.changeTime) || object.size != sizeOf(status)) {
        put(object.parent, known.name, status, false);
    }
    watchNames(folder, name, status);
    return {};
}

/// A folder whose number is another object's now goes on under a number of none, with all that the index has in it: that
/// is no longer there, but may well be somewhere, until the folder is given up. A process that ends before that finds it
/// missing when it is started again.
Result<void> IndexKeeper::keepAsFormer(const Known& folder) {
    TRY(flush());
    FileID former{kFirstFormer + formers_++};
    while (find(former)) former = FileID{kFirstFormer + formers_++};
    recent_.forgetFolder(folder.object.fileID);
    std::vector<Known> moved;
    TRY(store_.children(folder.object.fileID, [&](const IndexedObject& object) {
        Known& child = moved.emplace_back(object, std::string(object.name));
        child.object.parent = former;
    }));
    moved.push_back(folder);
    moved.back().object.fileID = former;
    std::ranges::reverse(moved);
    for (std::size_t at = 0; at < moved.size(); at += kChangesAtOnceMax) {
        IndexChanges changes(IndexChanges::Journal::no);
        for (Known& known : std::span(moved).subspan(at, std::min(kChangesAtOnceMax, moved.size() - at))) {
            known.object.name = known.name;
            changes.put(known.object);
        }
        TRY(store_.apply(changes, rootIDs_));
    }
    departures_.push_back({folder.object.parent, folder.name, former, folder.object.birthTime, roundNumber_});
    contexts_.clear();
    return {};
}

Result<void> IndexKeeper::seeNew(OpenFolder& folder, std::string_view name, const FileStatus& status,
                                 const std::optional<Known>& formerHolder) {
    const FileID fileID{status.fileID};
    if (formerHolder) {
        // The number was another object's. That one is gone, wherever it was.
        const DocumentID document = formerHolder->object.documentID;
        if (document != DocumentID{}) vacated(*formerHolder);
        entriesChanged(formerHolder->object.parent);
        if (formerHolder->isFolder()) TRY(keepAsFormer(*formerHolder));
        forgetWatch(fileID);
        placed_.erase(fileID);
    }
    const bool isFolder = status.isDirectory();
    const bool isClosed = isFolder && sys::isClosedDirectory(folder.fd.get(), std::string(name).c_str());
    if (isFolder) noteClosed(fileID, isClosed);
    put(folder.fileID, name, status, isClosed);
    entriesChanged(folder.fileID);
    arrived(folder.fileID, name, fileID);
    if (isFolder) {
        placedFolder_ = true;
        if (!isClosed) toScan_.push_back(fileID);
    } else {
        watchNames(folder, name, status);
    }
    return {};
}

void IndexKeeper::noteClosed(FileID folder, bool isClosed) {
    if (isClosed) {
        closed_.insert(folder);
    } else {
        closed_.erase(folder);
    }
}

/// A folder whose entries changed is itself changed.
void IndexKeeper::lookAtFolderItself(OpenFolder& folder) {
    if (rootWithID(folder.fileID) != nullptr) return;
    const std::optional<Known> known = find(folder.fileID);
    const Result<FileStatus> status = sys::statx(folder.fd.get(), "");
    // One without a name is told of by its parent.
    if (!known || !status.ok() || status->names == 0 || status->birthStamp() != known->object.birthTime) return;
    if (known->object.changeTime == stampOf(status->changeTime)) return;
    if (sys::isClosedDirectory(folder.fd.get(), ".") != known->object.isClosed) {
        // What is below shows, or no longer shows. That is found where its parent is looked at.
        dirtyObjects_.insert(folder.fileID);
        return;
    }
    put(known->object.parent, known->name, *status, known->object.isClosed);
}

void IndexKeeper::put(FileID parent, std::string_view name, const FileStatus& status, bool isClosed) {
    IndexedObject object;
    object.fileID = FileID{status.fileID};
    object.birthTime = status.birthStamp();
    object.parent = parent;
    object.name = name;
    object.kind = kindOf(status, name);
    object.changeTime = stampOf(status.changeTime);
    object.size = sizeOf(status);
    object.isClosed = isClosed;
    object.hasOtherNames = !status.isDirectory() && status.names > 1;
    changes().put(object);
    packagesChanged(parent);
    if (object.hasOtherNames && journal_ == Journal::yes) {
        for (const VolumeStore::Name& other : store_.otherNames(object.fileID)) packagesChanged(other.parent);
    }
    // A file with one name is not met again before it is written, except under another name: it is looked up there.
    const bool mayBeMetAgain =
        status.isDirectory() || object.hasOtherNames || placed_.contains(object.fileID) || journal_ == Journal::yes;
    if (!mayBeMetAgain) return;
    Known known{object, std::string(name)};
    known.object.name = {};
    if (const auto before = find(object.fileID); before && before->object.birthTime == object.birthTime) {
        known.object.documentID = before->object.documentID;
        known.object.isListed = before->object.isListed;
    }
    placed_.insert_or_assign(object.fileID, std::move(known));
}

void IndexKeeper::rememberAttributes(const OpenFolder& folder, std::string_view name, const Known& known) {
    const DocumentID document = known.object.documentID;
    if (document == DocumentID{}) return;
    const Result<Bytes> attributes = own_attributes::read(folder.fd.get(), std::string(name).c_str());
    if (!attributes.ok() || *attributes == store_.attributes(document)) return;
    const Result<void> remembered = store_.rememberAttributes(document, *attributes);
    if (!remembered.ok()) logError("can't remember the attributes of {}; {}", name, remembered.error().description());
}

// MARK: Saves

/// A document that moves aside under a backup's name makes place for the one that replaces it.
void IndexKeeper::movedAway(const Known& known, FileID newParent, std::string_view newName) {
    if (known.object.documentID == DocumentID{} || newParent != known.object.parent) return;
    if (!isBackupName(newName, known.name)) return;
    vacated(known);
}

/// The document's name is free for the one that replaces it, which may have been met before: a folder is read in an order
/// of its own, and folders are read for longer than an editor may take.
void IndexKeeper::vacated(const Known& known) {
    const DocumentID document = known.object.documentID;
    const FileID parent = known.object.parent;
    recent_.add(parent, known.name, document, options_.now());
    if (known.object.changeTime == kSupposedStamp) return;
    vacancies_.push_back({parent, known.name, document, birthOf(parent)});
}

/// At the end of the round whoever was there has been met. The number of the folder may be another's by now.
void IndexKeeper::fillVacancies() {
    for (const Vacancy& vacancy : std::exchange(vacancies_, {})) {
        if (birthOf(vacancy.parent) != vacancy.birthOfParent) continue;
        for (const Known& newcomer : findAt(vacancy.parent, vacancy.name)) {
            if (newcomer.object.documentID == vacancy.document) continue;
            replacements_.emplace(vacancy.document, Replacement{vacancy.parent, vacancy.name, newcomer.object.fileID});
        }
    }
}

/// As the index has it; 0 for a root.
std::int64_t IndexKeeper::birthOf(FileID folder) const {
    const std::optional<Known> known = rootWithID(folder) == nullptr ? find(folder) : std::nullopt;
    return known ? known->object.birthTime : 0;
}

/// Something is under a name that it did not have before.
void IndexKeeper::arrived(FileID parent, std::string_view name, FileID newcomer) {
    if (const auto document = recent_.take(parent, name, options_.now())) {
        replacements_.emplace(*document, Replacement{parent, std::string(name), newcomer});
    }
}

Result<void> IndexKeeper::resolveReplacements() {
    if (replacements_.empty()) return {};
    // Who has just been given up holds no document.
    TRY(flush());
    std::multimap<DocumentID, Replacement> undecided;
    for (auto& [documentID, replacement] : std::exchange(replacements_, {})) {
        const auto document = store_.document(documentID);
        if (!document) continue;
        const std::optional<Known> holder = find(document->fileID);
        const bool isHeld =
            holder && holder->object.documentID == documentID && holder->object.birthTime == document->birthTime;
        if (isHeld && holder->object.changeTime == kSupposedStamp) {
            undecided.emplace(documentID, std::move(replacement));
            continue;
        }
        // The document is still somebody's: only a backup gives it away.
        const bool isBackup =
            isHeld && holder->object.parent == replacement.parent && isBackupName(holder->name, replacement.name);
        if (isHeld && !isBackup) continue;
        TRY(takeOver(documentID, replacement.parent, replacement.name, replacement.newcomer));
    }
    replacements_.merge(undecided);
    return {};
}

Result<void> IndexKeeper::takeOver(DocumentID document, FileID parent, const std::string& name, FileID newcomer) {
    TRY(flush());
    const std::optional<Known> known = find(newcomer);
    if (!known || !known->isAt(parent, name) || !mayTakeOver(*known)) return {};
    if (known->object.documentID == document) return {};
    if (known->object.kind == ObjectKind::package) TRY(replaceContents(document, newcomer));
    changes().handOver(document, newcomer);
    (void)recent_.take(parent, name, options_.now());
    restoreAttributes(document, parent, name, newcomer);
    return {};
}

/// Who looks into a package by its document finds the newcomer's contents there now, and no longer those of the former
/// one, should that be still there.
Result<void> IndexKeeper::replaceContents(DocumentID document, FileID newcomer) {
    const auto record = store_.document(document);
    const std::optional<Known> former = record ? find(record->fileID) : std::nullopt;
    if (former && former->object.documentID == document) {
        TRY(store_.children(former->object.fileID,
                            [&](const IndexedObject& child) { changes().leave(child.fileID, newcomer); }));
    }
    return store_.children(newcomer, [&](const IndexedObject& child) { changes().touch(child.fileID); });
}

/// An older document with a number of its own was moved over another, and stays itself.
bool IndexKeeper::mayTakeOver(const Known& newcomer) const {
    if (newcomer.object.kind != ObjectKind::file && newcomer.object.kind != ObjectKind::package) return false;
    if (newcomer.object.documentID == DocumentID{}) return true;
    const std::int64_t age = stampOf(options_.wallClock()) - newcomer.object.birthTime;
    return newcomer.object.birthTime != 0 && age < kYoungNanoseconds;
}

void IndexKeeper::restoreAttributes(DocumentID document, FileID parent, const std::string& name, FileID newcomer) {
    const Bytes attributes = store_.attributes(document);
    if (attributes.empty()) return;
    const auto folder = openFolder(parent);
    if (!folder) return;
    // Its kind was looked at: what waits for a reader when it is opened is not among them, and is not waited for.
    const Result<UniqueFd> file =
        sys::openat(folder->fd.get(), name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY);
    const Result<FileStatus> status = file.ok() ? sys::statx(file->get(), "") : Result<FileStatus>(file.error());
    if (!status.ok() || FileID{status->fileID} != newcomer) return;
    const Result<std::size_t> put = own_attributes::restoreMissing(file->get(), attributes);
    if (!put.ok()) logError("can't put back the attributes of {}; {}", name, put.error().description());
    if (put.ok() && *put > 0) dirtyObjects_.insert(newcomer);
}

// MARK: The index, with what is not written yet

std::optional<IndexKeeper::Known> IndexKeeper::find(FileID fileID) const {
    if (const auto placed = placed_.find(fileID); placed != placed_.end()) return placed->second;
    std::optional<Known> found;
    store_.indexed(fileID, [&](const IndexedObject& object) {
        found.emplace(object, std::string(object.name));
        found->object.name = {};
    });
    return found;
}

/// Several, while one takes the place of another that is not given up yet.
std::vector<IndexKeeper::Known> IndexKeeper::findAt(FileID parent, std::string_view name) const {
    std::vector<Known> found;
    store_.childrenNamed(parent, name, [&](const IndexedObject& object) {
        found.emplace_back(object, std::string(object.name)).object.name = {};
    });
    std::erase_if(found, [&](Known& known) {
        const auto placed = placed_.find(known.object.fileID);
        if (placed == placed_.end()) return false;
        const Known& now = placed->second;
        // It was here, and has moved since; or its number is another object's.
        if (known.isAt(parent, name) && !now.isAt(parent, name)) return true;
        if (now.object.birthTime != known.object.birthTime) return true;
        known = now;
        return false;
    });
    return found;
}

IndexKeeper::Context IndexKeeper::contextInside(FileID parent, std::string_view name, ObjectKind kind) {
    Context context = contextOf(parent);
    if (name == kTrashName) context.isInTrash = true;
    return kind == ObjectKind::package ? (context.packages.emplace_back(), context) : context;
}

const IndexKeeper::Context& IndexKeeper::contextOf(FileID folder) {
    const auto found = contexts_.find(folder);
    if (found != contexts_.end()) return found->second;
    // Should the folders lie in a circle, while they are on their way to their places, it ends here.
    contexts_[folder].root = folder;
    Context context;
    const std::optional<Known> known = rootWithID(folder) == nullptr ? find(folder) : std::nullopt;
    if (known) {
        context = contextOf(known->object.parent);
        if (known->name == kTrashName) context.isInTrash = true;
        if (known->object.kind == ObjectKind::package) context.packages.push_back(folder);
    } else {
        context.root = folder;
    }
    return contexts_.insert_or_assign(folder, std::move(context)).first->second;
}

/// What changes inside a package changes the package.
void IndexKeeper::packagesChanged(FileID folder) {
    if (journal_ == Journal::no) return;
    const Context& context = contextOf(folder);
    touchedFolders_.insert(context.packages.begin(), context.packages.end());
}

/// A folder that entries came to or went from has changed. Its stamp need not say so: some file systems give it that of
/// the entry, which may be one that it bears already.
void IndexKeeper::entriesChanged(FileID folder) {
    if (journal_ == Journal::no || isFormer(folder)) return;
    if (rootWithID(folder) == nullptr) touchedFolders_.insert(folder);
    packagesChanged(folder);
}

}  // namespace cindral
