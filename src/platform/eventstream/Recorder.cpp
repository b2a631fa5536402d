#include "platform/eventstream/Recorder.h"

#include <fmt/format.h>
#include <linux/magic.h>
#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

#include "platform/foundation/FreeMemory.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/Sys.h"
#include "platform/foundation/ThreadPool.h"
#include "platform/foundation/TypeDatabase.h"
#include "platform/revisions/PackedRecord.h"
#include "platform/revisions/VolumeIndex.h"

namespace cindral {

namespace {

// What comes in quick succession is recorded together: one write instead of one for each.
constexpr std::chrono::milliseconds kGatherTime{5};
// After a failure, such as a full disk.
constexpr std::chrono::milliseconds kRetryDelay{5'000};
constexpr std::uint64_t kEventsBetweenTrims = 100'000;
constexpr int kPathTriesMax = 3;
// An audit works a fifth of the time.
constexpr int kAuditRest = 4;

/// Whether the kernel tells of every change: not of those that others make on a server or in a user's program.
bool tellsOfChanges(int folder) {
    struct statfs fileSystem {};
    if (::fstatfs(folder, &fileSystem) != 0) return true;
    constexpr std::array<std::uint32_t, 9> kRemote = {
        NFS_SUPER_MAGIC, SMB_SUPER_MAGIC,  CIFS_SUPER_MAGIC, SMB2_SUPER_MAGIC, FUSE_SUPER_MAGIC,
        V9FS_MAGIC,      CODA_SUPER_MAGIC, AFS_SUPER_MAGIC,  CEPH_SUPER_MAGIC,
    };
    return std::ranges::find(kRemote, static_cast<std::uint32_t>(fileSystem.f_type)) == kRemote.end();
}

// What is remembered for no document is of the volume itself: the set of types that its packages were told by.
constexpr DocumentID kVolumeItself{0};
// And where its roots are and were. A document of this number would be the last of four thousand millions.
constexpr DocumentID kRootsOfTheVolume{0xFFFF'FFFF};

Bytes currentTypes() {
    Bytes bytes(sizeof(std::uint64_t));
    storeInteger(bytes.data(), TypeDatabase::shared().declarationsFingerprint());
    return bytes;
}

}  // namespace

std::shared_ptr<Recorder> Recorder::start(std::shared_ptr<VolumeStore> store, Roots roots, Options options) {
    std::shared_ptr<Recorder> recorder(new Recorder(std::move(store), std::move(options)));
    {
        const MutexLock lock(recorder->stateMutex_);
        recorder->roots_ = std::make_shared<const Roots>(std::move(roots));
    }
    recorder->thread_ = std::thread([self = recorder.get()] { self->run(); });
    ::pthread_setname_np(recorder->thread_.native_handle(), "recorder");
    return recorder;
}

Recorder::Recorder(std::shared_ptr<VolumeStore> store, Options options)
    : store_(std::move(store)),
      options_(std::move(options)),
      wakeFd_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
      keeper_(*store_, {.now = options_.now,
                        .wallClock = options_.wallClock,
                        .isStopping = [this] { return stopping_.load(std::memory_order_relaxed); },
                        .seenFiles = &seenFiles_}) {}

Recorder::~Recorder() {
    stop();
}

void Recorder::stop() {
    stopping_ = true;
    const std::uint64_t one = 1;
    (void)!::write(wakeFd_.get(), &one, sizeof one);
    if (thread_.joinable()) thread_.join();
    const MutexLock lock(stateMutex_);
    stateChanged_.notifyAll();
}

std::shared_ptr<const Recorder::Roots> Recorder::roots() const {
    const MutexLock lock(stateMutex_);
    return roots_;
}

// MARK: The thread

void Recorder::run() {
    while (!stopping_) {
        const Result<void> started = startUp();
        finished(started);
        // A first reading fills much that is empty now.
        returnFreeMemory();
        if (started.ok() || stopping_) break;
        logError("can't read the roots; {}", started.error().description());
        rest(kRetryDelay);
    }
    tellObservers();
    lastNews_ = options_.now();
    nextAudit_ = lastNews_ + options_.auditInterval;
    if (!options_.recordsByItself) return;
    std::chrono::milliseconds timeout = options_.auditAfterIdle;
    bool isBehind = false;
    while (!stopping_) {
        // What is left of the last time waits for no news.
        const Wake wake = waitForNews(isBehind ? std::chrono::milliseconds(0) : timeout);
        if (wake == Wake::stop) return;
        if (wake == Wake::timeout && !isBehind) {
            timeout = idle();
            continue;
        }
        const std::uint64_t before = store_->currentEventID();
        if (const Result<void> settled = settle(); !settled.ok() && !stopping_) {
            logError("can't record what happens; {}", settled.error().description());
            rest(kRetryDelay);
        }
        // A mark on the file system wakes us for much that is none of ours: that is no reason to put an audit off.
        if (store_->currentEventID() != before) lastNews_ = options_.now();
        timeout = std::max(std::chrono::milliseconds(1), untilAudit());
        trim();
        rest(kGatherTime);
        const MutexLock lock(mutex_);
        isBehind = keeper_.isBehind();
    }
}

/// Unless it is to stop, or there are new roots.
void Recorder::rest(std::chrono::milliseconds time) {
    pollfd wake{wakeFd_.get(), POLLIN, 0};
    (void)::poll(&wake, 1, static_cast<int>(time.count()));
}

/// Until the next step of an audit: when nothing has happened for a while, and the last audit was long enough ago.
std::chrono::milliseconds Recorder::untilAudit() const {
    const auto due = std::max(lastNews_ + options_.auditAfterIdle, isAuditing_ ? lastNews_ : nextAudit_);
    return std::chrono::duration_cast<std::chrono::milliseconds>(due - options_.now());
}

Recorder::Wake Recorder::waitForNews(std::chrono::milliseconds timeout) {
    std::vector<pollfd> descriptors{{wakeFd_.get(), POLLIN, 0}};
    {
        const MutexLock lock(stateMutex_);
        for (const int descriptor : pollDescriptors_) descriptors.push_back({descriptor, POLLIN, 0});
    }
    const int ready = ::poll(descriptors.data(), descriptors.size(), static_cast<int>(timeout.count()));
    if (stopping_) return Wake::stop;
    if (ready == 0) return Wake::timeout;
    if ((descriptors.front().revents & POLLIN) != 0) {
        // Woken for new roots: their descriptors are polled from now on.
        std::uint64_t count = 0;
        (void)!::read(wakeFd_.get(), &count, sizeof count);
    }
    return Wake::news;
}

Result<void> Recorder::startUp() {
    const MutexLock lock(mutex_);
    keeper_.setRoots(sourcesFor(*roots()));
    noteState();
    const bool isFirst = !store_->historyBegin();
    if (isFirst) {
        TRY(keeper_.compareEverything(IndexKeeper::Journal::no));
        TRY(recordRoots());
        TRY(store_->rememberAttributes(kVolumeItself, currentTypes()));
        TRY(store_->beginHistory());
        TRY(keeper_.settle());
    } else {
        if (store_->attributes(kVolumeItself) != currentTypes()) {
            logInfo("the set of declared types has changed; the history begins anew");
            TRY(store_->renewUUID());
            TRY(store_->rememberAttributes(kVolumeItself, currentTypes()));
        }
        readFormerRoots();
        TRY(giveUpStaleRoots());
        TRY(keeper_.compareEverything(IndexKeeper::Journal::yes));
        TRY(recordRoots());
        TRY(store_->trimJournal(options_.eventsMax, options_.ageMax));
    }
    noteState();
    return {};
}

/// What was below a root that is none any more. Where none is what it was, this is another storage.
Result<void> Recorder::giveUpStaleRoots() {
    std::vector<FileID> stale;
    bool isKnown = false;
    const auto& current = keeper_.roots();
    TRY(store_->children(FileID{0}, [&](const IndexedObject& object) {
        const bool isCurrent = std::ranges::any_of(current, [&](const IndexKeeper::Root& root) {
            return root.fileID() == object.fileID && root.directory->status.birthStamp() == object.birthTime;
        });
        isKnown = isKnown || isCurrent;
        if (!isCurrent) stale.push_back(object.fileID);
    }));
    if (stale.empty()) return {};
    if (!isKnown) {
        logInfo("the storage is another one than before; the history begins anew");
        TRY(store_->renewUUID());
    }
    for (const FileID root : stale) TRY(keeper_.removeTree(root));
    return {};
}

/// Roots are recorded in no folder, so that the next start knows what they were.
Result<void> Recorder::recordRoots() {
    IndexChanges changes(IndexChanges::Journal::no);
    for (const IndexKeeper::Root& root : keeper_.roots()) {
        bool isRecorded = false;
        store_->indexed(root.fileID(), [&](const IndexedObject& object) {
            isRecorded = object.birthTime == root.directory->status.birthStamp() && object.changeTime != 0;
        });
        if (isRecorded) continue;
        IndexedObject object;
        object.fileID = root.fileID();
        object.birthTime = root.directory->status.birthStamp();
        object.name = "root";
        object.kind = ObjectKind::folder;
        object.changeTime = 1;
        changes.put(object);
    }
    if (!changes.empty()) TRY(store_->apply(changes, keeper_.rootIDs()));
    return rememberRoots();
}

/// The journal outlives this process, and so may a client that has not heard yet of what departed.
Result<void> Recorder::rememberRoots() {
    RootPaths current;
    for (const auto& root : *roots()) current.insert_or_assign(FileID{root->status.fileID}, root->path);
    Bytes bytes;
    {
        const MutexLock lock(stateMutex_);
        bytes = encodeRootPaths(current, formerRoots_);
    }
    if (store_->attributes(kRootsOfTheVolume) == bytes) return {};
    return store_->rememberAttributes(kRootsOfTheVolume, bytes);
}

void Recorder::readFormerRoots() {
    RootPaths paths = decodeRootPaths(store_->attributes(kRootsOfTheVolume));
    for (const auto& root : *roots()) paths.erase(FileID{root->status.fileID});
    const MutexLock lock(stateMutex_);
    formerRoots_ = std::move(paths);
}

void Recorder::finished(const Result<void>& startUp) {
    const MutexLock lock(stateMutex_);
    isReady_ = startUp.ok();
    startError_ = startUp.ok() ? std::nullopt : std::optional(startUp.error());
    stateChanged_.notifyAll();
}

Result<void> Recorder::settle() {
    Result<void> settled;
    {
        const MutexLock lock(mutex_);
        settled = keeper_.settle();
        noteState();
    }
    noteOutcome(settled);
    tellObservers();
    return settled;
}

void Recorder::noteOutcome(const Result<void>& outcome) {
    const MutexLock lock(stateMutex_);
    failure_ = outcome.ok() ? std::nullopt : std::optional(outcome.error());
}

void Recorder::trim() {
    const std::uint64_t current = store_->currentEventID();
    if (current - trimmedAt_ < kEventsBetweenTrims) return;
    trimmedAt_ = current;
    const Result<void> trimmed = store_->trimJournal(options_.eventsMax, options_.ageMax);
    if (!trimmed.ok()) logError("can't trim the event journal; {}", trimmed.error().description());
}

/// A step of an audit when one is due. Answers how long to rest.
std::chrono::milliseconds Recorder::idle() {
    const auto begin = options_.now();
    if (const auto left = untilAudit(); left > std::chrono::milliseconds(0)) return left + std::chrono::milliseconds(1);
    {
        const MutexLock lock(mutex_);
        if (auditStack_.empty()) auditStack_.assign(keeper_.rootIDs().begin(), keeper_.rootIDs().end());
        const FileID folder = auditStack_.back();
        auditStack_.pop_back();
        const std::uint64_t before = keeper_.changeCount();
        const Result<std::vector<FileID>> subfolders = keeper_.compareFolder(folder);
        if (subfolders.ok()) auditStack_.insert(auditStack_.end(), subfolders->begin(), subfolders->end());
        const std::uint64_t differences = keeper_.changeCount() - before;
        isAuditing_ = !auditStack_.empty();
        if (!isAuditing_) nextAudit_ = options_.now() + options_.auditInterval;
        const MutexLock stateLock(stateMutex_);
        status_.auditedDifferences += differences;
    }
    tellObservers();
    const auto took = std::chrono::duration_cast<std::chrono::milliseconds>(options_.now() - begin);
    return took * kAuditRest + std::chrono::milliseconds(1);
}

Result<std::uint64_t> Recorder::audit() {
    TRY(drain());
    std::uint64_t differences = 0;
    {
        const MutexLock lock(mutex_);
        const std::uint64_t before = keeper_.changeCount();
        TRY(keeper_.compareEverything(IndexKeeper::Journal::yes));
        differences = keeper_.changeCount() - before;
        const MutexLock stateLock(stateMutex_);
        status_.auditedDifferences += differences;
    }
    tellObservers();
    return differences;
}

// MARK: Roots and sources

std::shared_ptr<EventSource> Recorder::workingSource(std::shared_ptr<EventSource>& source, const SourceFactory& make,
                                                     const RootDirectory& root) {
    if (!source) {
        Result<std::unique_ptr<EventSource>> made = make();
        if (!made.ok()) {
            logDebug("can't use one of the kernel's event interfaces; {}", made.error().description());
            return nullptr;
        }
        source = *std::move(made);
    }
    const Result<void> added = source->addRoot(root.fd.get());
    if (added.ok()) return source;
    logDebug("{} does not work on {}; {}", source->name(), root.path, added.error().description());
    return nullptr;
}

std::shared_ptr<EventSource> Recorder::sourceFor(const RootDirectory& root) {
    if (!tellsOfChanges(root.fd.get())) {
        logInfo("the file system of {} does not tell of all changes; it is compared instead", root.path);
        return nullptr;
    }
    if (options_.choice != Choice::inotify) {
        if (auto source = workingSource(fanotify_, options_.makeFanotify, root)) return source;
        if (options_.choice == Choice::fanotify) {
            logInfo("fanotify can't be used on {}; inotify takes its place", root.path);
        }
    }
    auto source = workingSource(inotify_, options_.makeInotify, root);
    if (!source) logError("nothing tells of changes in {}; it is compared instead", root.path);
    return source;
}

std::vector<IndexKeeper::Root> Recorder::sourcesFor(const Roots& roots) {
    std::vector<IndexKeeper::Root> out;
    for (const auto& directory : roots) {
        IndexKeeper::Root root;
        root.directory = directory;
        root.stampsAreDistinct = sys::fileSystemTraits(directory->fd.get()).stampsAreDistinct;
        root.source = sourceFor(*directory);
        out.push_back(std::move(root));
    }
    return out;
}

Result<void> Recorder::setRoots(Roots wanted) {
    {
        const MutexLock lock(mutex_);
        const std::vector<IndexKeeper::Root> before = keeper_.roots();
        const auto has = [](const auto& list, FileID fileID) {
            return std::ranges::any_of(list, [&](const auto& root) { return FileID{root->status.fileID} == fileID; });
        };
        // First what has gone, while it is still known where it was.
        for (const IndexKeeper::Root& root : before) {
            if (!has(wanted, root.fileID())) TRY(keeper_.removeTree(root.fileID()));
        }
        std::vector<FileID> added;
        for (const auto& root : wanted) {
            const FileID fileID{root->status.fileID};
            if (std::ranges::find(before, fileID, &IndexKeeper::Root::fileID) == before.end()) added.push_back(fileID);
        }
        keeper_.setRoots(sourcesFor(wanted));
        {
            const MutexLock stateLock(stateMutex_);
            for (const auto& root : *roots_) formerRoots_[FileID{root->status.fileID}] = root->path;
            for (const auto& root : wanted) formerRoots_.erase(FileID{root->status.fileID});
            roots_ = std::make_shared<const Roots>(std::move(wanted));
        }
        for (const FileID root : added) TRY(keeper_.compareTree(root));
        TRY(recordRoots());
        noteState();
    }
    const std::uint64_t one = 1;
    (void)!::write(wakeFd_.get(), &one, sizeof one);
    tellObservers();
    return {};
}

// MARK: The state, as others see it

void Recorder::noteState() {
    Status status;
    std::vector<int> descriptors;
    for (const auto& source : {fanotify_, inotify_}) {
        if (!source) continue;
        descriptors.push_back(source->pollDescriptor());
    }
    const auto& roots = keeper_.roots();
    status.recorder = roots.empty() || !roots.front().source ? "none" : std::string(roots.front().source->name());
    if (!roots.empty() && roots.front().source) status.watches = roots.front().source->usage();
    for (const IndexKeeper::Root& root : roots) {
        if (!root.source)
            status.uncovered.push_back({root.directory->path, "its file system does not tell of changes"});
    }
    for (const FileID folder : keeper_.closedFolders()) {
        FolderPlaces places;
        status.uncovered.push_back(
            {placeOf(*this->roots(), keeper_.rootIDs(), folder, places).path, std::string(kUnreadable)});
    }
    if (keeper_.reachedWatchLimit() && inotify_) {
        const EventSource::Usage usage = inotify_->usage();
        const std::size_t unwatched = keeper_.unwatchedFolders().size();
        const std::string needed =
            fmt::format("{} watches used, limit {}, {} needed", usage.used, usage.limit, usage.used + unwatched);
        status.unwatchedFolders = unwatched;
        if (unwatched > 0) {
            if (!saidWatchLimit_) {
                logInfo("the limit of watches is reached ({}); the rest is compared at each request", needed);
            }
            saidWatchLimit_ = true;
            status.uncovered.push_back(
                {roots.empty() ? "" : roots.front().directory->path,
                 fmt::format("{} folders are beyond the limit of watches ({})", unwatched, needed)});
        }
    }
    const MutexLock lock(stateMutex_);
    status.auditedDifferences = status_.auditedDifferences;
    status_ = std::move(status);
    pollDescriptors_ = std::move(descriptors);
}

Recorder::Status Recorder::status() const {
    const MutexLock lock(stateMutex_);
    Status status = status_;
    status.isReading = !isReady_ && !startError_;
    status.failure = startError_ ? startError_ : failure_;
    return status;
}

bool Recorder::isReady() const {
    const MutexLock lock(stateMutex_);
    return isReady_;
}

// MARK: The history

KsUUID Recorder::volumeUUID() const {
    return store_->uuid();
}

std::uint64_t Recorder::currentEventID() const {
    return store_->currentEventID();
}

Result<void> Recorder::drain() {
    const ThreadPool::BlockingRegion region;
    {
        const MutexLock lock(stateMutex_);
        while (!isReady_ && !startError_ && !stopping_) stateChanged_.wait(stateMutex_);
        if (stopping_) return KsError::posix(ECANCELED);
        if (startError_) return *startError_;
    }
    return settle();
}

bool Recorder::canReplayAfter(std::uint64_t eventID) const {
    const auto begin = store_->historyBegin();
    return begin && eventID >= *begin && eventID <= store_->currentEventID();
}

const Recorder::FolderPlace& Recorder::placeOf(const Roots& roots, std::span<const FileID> rootIDs, FileID folder,
                                               FolderPlaces& known) const {
    const auto [at, isNew] = known.try_emplace(folder);
    FolderPlace& place = at->second;
    if (!isNew) return place;
    if (const auto recorded = store_->recordedPath(folder, rootIDs)) {
        place.path = roots[recorded->rootIndex]->path;
        if (!recorded->path.empty()) place.path += "/" + recorded->path;
        place.isOpen = recorded->isOpen;
    }
    return place;
}

Result<EventHistory::Batch> Recorder::pathEvents(std::uint64_t after, std::size_t max) const {
    // Before the events: there may be more by the time that they are read, and none of those is to be skipped.
    const std::uint64_t current = store_->currentEventID();
    const std::vector<JournalEvent> found = TRY(store_->events(after, max));
    const auto roots = this->roots();
    std::vector<FileID> rootIDs;
    for (const auto& root : *roots) rootIDs.push_back(FileID{root->status.fileID});
    RootPaths formerRoots;
    {
        const MutexLock lock(stateMutex_);
        formerRoots = formerRoots_;
    }
    Batch batch;
    batch.isLast = found.size() < max;
    batch.upTo = found.empty() ? after : found.back().id;
    if (batch.isLast) batch.upTo = std::max(batch.upTo, current);
    batch.events.reserve(found.size());
    FolderPlaces places;
    /// Where an object was when it left; empty where that was not recorded.
    const auto placeLeft = [&](const JournalEvent& departure) -> std::string {
        if (departure.path.empty()) return {};
        const auto root = std::ranges::find(rootIDs, departure.root);
        if (root != rootIDs.end()) {
            return (*roots)[static_cast<std::size_t>(root - rootIDs.begin())]->path + "/" + departure.path;
        }
        const auto former = formerRoots.find(departure.root);
        return former == formerRoots.end() ? std::string() : former->second + "/" + departure.path;
    };
    for (const JournalEvent& journalled : found) {
        FolderPlace folder = placeOf(*roots, rootIDs, journalled.parent, places);
        std::string name = journalled.name;
        // A folder on the way may have moved between two looks at the index: it leads to a root at every moment.
        for (int tries = 0; folder.path.empty() && tries < kPathTriesMax; ++tries) {
            FileID parent{};
            store_->indexed(journalled.fileID, [&](const IndexedObject& object) {
                if (object.eventID == journalled.id) parent = object.parent, name = object.name;
            });
            if (parent == FileID{}) break;
            places.clear();
            folder = placeOf(*roots, rootIDs, parent, places);
            folder.isOpen = false;
        }
        Event event;
        if (!folder.path.empty()) {
            event.path = folder.path + "/" + name;
        } else if (journalled.kind == JournalEvent::Kind::departed) {
            // Its folder is gone as well.
            event.path = placeLeft(journalled);
        }
        if (event.path.empty()) continue;
        event.id = journalled.id;
        event.fileID = journalled.fileID;
        event.documentID = journalled.documentID;
        event.kind = journalled.objectKind;
        if (journalled.kind == JournalEvent::Kind::departed) {
            event.flags = journalled.goesOn ? EventFlags::removed | EventFlags::renamed : EventFlags::removed;
            if (folder.path.empty() || event.path != placeLeft(journalled))
                event.flags = event.flags | EventFlags::cutOff;
        }
        if (journalled.kind == JournalEvent::Kind::present && journalled.objectKind == ObjectKind::file &&
            folder.isOpen) {
            event.seen =
                seenFiles_.find(journalled.fileID, journalled.birthTime, journalled.changeTime, journalled.size);
            event.folder = journalled.parent;
        }
        batch.events.push_back(std::move(event));
    }
    return batch;
}

Result<EventHistory::Batch> Recorder::documentEvents(std::uint64_t after, std::size_t max) const {
    const std::uint64_t current = store_->currentEventID();
    const std::vector<JournalEvent> found = TRY(store_->documentEvents(after, max));
    const auto roots = this->roots();
    const std::uint32_t device = roots->empty() ? 0 : roots->front()->status.deviceID();
    Batch batch;
    batch.isLast = found.size() < max;
    batch.upTo = found.empty() ? after : found.back().id;
    if (batch.isLast) batch.upTo = std::max(batch.upTo, current);
    for (const JournalEvent& journalled : found) {
        Event event;
        event.path = fmt::format(
            "/.docid/{}/changed/{}/src={},dst={}", device, static_cast<std::uint32_t>(journalled.documentID),
            static_cast<std::uint64_t>(journalled.fileID), static_cast<std::uint64_t>(journalled.target));
        event.id = journalled.id;
        event.fileID = journalled.target;
        event.documentID = journalled.documentID;
        batch.events.push_back(std::move(event));
    }
    return batch;
}

// MARK: Observers

std::uint64_t Recorder::addObserver(std::function<void()> observer) {
    const MutexLock lock(observersMutex_);
    observers_.emplace(nextObserver_, std::move(observer));
    return nextObserver_++;
}

void Recorder::removeObserver(std::uint64_t observer) {
    const MutexLock lock(observersMutex_);
    observers_.erase(observer);
}

void Recorder::tellObservers() {
    const MutexLock lock(observersMutex_);
    const std::uint64_t current = store_->currentEventID();
    if (current == toldEventID_) return;
    toldEventID_ = current;
    for (const auto& [number, observer] : observers_) observer();
}

}  // namespace cindral
