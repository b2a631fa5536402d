#include "provider/fs/FSEventReader.h"

#include <fmt/format.h>

#include <algorithm>
#include <map>
#include <utility>

#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/TypeDatabase.h"
#include "platform/revisions/RvStorageManager.h"
#include "platform/tessel/TesselManager.h"
#include "provider/ContainerContents.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/fs/FSGatherWitness.h"

namespace cindral {

namespace {

constexpr std::uint32_t kCreationFlags = static_cast<std::uint32_t>(EventStreamCreationFlags::useStringObjects) |
                                         static_cast<std::uint32_t>(EventStreamCreationFlags::fileEvents) |
                                         static_cast<std::uint32_t>(EventStreamCreationFlags::useExtendedData);
constexpr const char* kDocumentTree = "/.docid";
// The volume that document-ID changes are told of is the one that holds it; where there is none, the storage's.
constexpr const char* kDeviceFolder = "/private/var/";
// Events looked at together: as many as a client is given changes at once, so that little is looked at in vain.
constexpr std::size_t kEventsTogetherMax = 100;
// Listings that are remembered to have been resumed; a client walks a handful at a time.
constexpr std::size_t kResumedListingsMax = 1024;

std::uint32_t deviceOfDocumentTree() {
    const std::uint32_t device = deviceID(KsURL::fileURL(kDeviceFolder));
    return device != 0 ? device : deviceID(TesselManager::defaultManager().documentStorageURL());
}

/// Decides whether a listing may go on: the reader's delegate for one replay.
class FSEventChecker : public FSEventReaderDelegate {
public:
    LookFurther readerDidReceiveEvent(FSEventReader& /*reader*/, const Event& event,
                                      std::string_view /*path*/) override {
        if (event.flags & EventFlags::removed) decide(DeletionOccurred{event.path});
        return LookFurther::no;
    }
    // What went without an event of its own can't be told.
    void readerMustScan(FSEventReader& /*reader*/, const Event& /*event*/) override {
        decide(CantReplayHistoricalFSEvents());
    }
    void readerDidLoseEvents(FSEventReader& /*reader*/, const Event& /*event*/) override {
        decide(CantReplayHistoricalFSEvents());
    }
    void readerDidFail(FSEventReader& /*reader*/, const KsError& /*error*/) override {
        decide(CantReplayHistoricalFSEvents());
    }
    void readerDidFinishHistory(FSEventReader& /*reader*/, std::uint64_t eventID) override {
        reached_ = eventID;
        decide(CanResume());
    }

    FSEventReaderGatherPhaseResumeStatus wait() {
        sema_.wait();
        return gatherPhaseResumeStatus_;
    }
    std::uint64_t reached() const { return reached_; }

private:
    /// The first decision stands, and ends the wait.
    void decide(FSEventReaderGatherPhaseResumeStatus status) {
        if (std::exchange(isDecided_, true)) return;
        gatherPhaseResumeStatus_ = std::move(status);
        sema_.signal();
    }

    // The reader's queue's until the semaphore is signalled, constant afterwards.
    FSEventReaderGatherPhaseResumeStatus gatherPhaseResumeStatus_ = CanResume();
    std::uint64_t reached_ = 0;
    bool isDecided_ = false;

    DispatchSemaphore sema_{0};
};

/// Up to which event listings were found to have lost nothing, so that each page asks only for what came since.
class ResumedListings {
public:
    static ResumedListings& shared() {
        static ResumedListings& listings = *new ResumedListings;
        return listings;
    }
    static std::string keyOf(const EventHistory& history, const std::vector<KsURL>& urls, std::uint64_t eventID) {
        std::string key = history.volumeUUID().string() + std::to_string(eventID);
        for (const KsURL& url : urls) {
            key += '\0';  // In no path.
            key += url.path();
        }
        return key;
    }
    std::uint64_t reached(const std::string& key, std::uint64_t eventID) {
        const MutexLock lock(mutex_);
        const auto found = reached_.find(key);
        return found == reached_.end() ? eventID : std::max(eventID, found->second);
    }
    void put(const std::string& key, std::uint64_t eventID) {
        const MutexLock lock(mutex_);
        if (reached_.size() >= kResumedListingsMax) reached_.clear();  // What is forgotten is replayed again.
        reached_[key] = eventID;
    }

private:
    Mutex mutex_;
    std::map<std::string, std::uint64_t> reached_ GUARDED_BY(mutex_);
};

}  // namespace

bool FSEventReaderDelegate::readerShouldMakeItem(FSEventReader& /*reader*/, const Event& /*event*/,
                                                 const KsURL& /*entry*/) {
    return true;
}
void FSEventReaderDelegate::readerDidUpdateItem(FSEventReader& /*reader*/, const Event& /*event*/,
                                                const TesselItemIdentifier& /*identifier*/,
                                                const std::shared_ptr<const TesselItem>& /*item*/) {}
void FSEventReaderDelegate::readerDidDeleteItem(FSEventReader& /*reader*/, const Event& /*event*/,
                                                const TesselItemIdentifier& /*identifier*/) {}
void FSEventReaderDelegate::readerDidDropEvent(FSEventReader& /*reader*/, const Event& /*event*/,
                                               const TesselItemIdentifier& /*identifier*/) {}
void FSEventReaderDelegate::readerDidMoveDirectory(FSEventReader& /*reader*/, const Event& /*event*/) {}
void FSEventReaderDelegate::readerDidFail(FSEventReader& /*reader*/, const KsError& /*error*/) {}

/// What an event was found to be about, before it is reported.
struct FSEventReader::Look {
    enum class Kind { flags, nothing, scan, directoryMoved, deleted, dropped, item };
    Kind kind = Kind::nothing;
    const Event* event = nullptr;
    TesselItemIdentifier identifier{};  ///< deleted, dropped and item: the event's own
    std::optional<KsURL> entry{};       ///< item: until it is made
    std::string path{};                 ///< item: of the entry
    std::shared_ptr<const TesselItem> item{};
};

std::shared_ptr<FSEventReader> FSEventReader::create(std::vector<KsURL> urls, FSEventReaderMode mode, bool verbose,
                                                     std::uint64_t sinceEventID) {
    return std::shared_ptr<FSEventReader>(new FSEventReader(std::move(urls), mode, verbose, sinceEventID));
}

FSEventReader::FSEventReader(std::vector<KsURL> urls, FSEventReaderMode mode, bool verbose, std::uint64_t sinceEventID)
    : urls_(std::move(urls)),
      mode_(mode),
      verbose_(verbose),
      streamQueue_(std::make_shared<SerialQueue>("cindral.fsevents-stream")),
      lastProcessedFSEventID_(sinceEventID),
      entryFinder_(urls_) {}

FSEventReader::~FSEventReader() {
    if (isStarted()) {
        logError("stream deleted without being stopped; {}", description());
        stop();
    }
    // A replay that waits for the recorder may be on the queue: who lets go of the reader does not wait with it.
    streamQueue_->async([queue = streamQueue_] {});
}

void FSEventReader::setDelegate(std::weak_ptr<FSEventReaderDelegate> delegate) {
    const MutexLock lock(mutex_);
    delegate_ = std::move(delegate);
}

std::shared_ptr<EventStream> FSEventReader::makeStream() {
    const std::uint64_t since = lastProcessedFSEventID();
    auto callback = [weak = weak_from_this()](std::span<const Event> events) {
        if (const auto self = weak.lock()) self->handle(events);
    };
    std::shared_ptr<EventStream> stream;
    if (mode_ == FSEventReaderMode::docIDBased) {
        stream = EventStream::createRelativeToDevice(deviceOfDocumentTree(), {kDocumentTree}, since, kLatency,
                                                     kCreationFlags, std::move(callback));
    } else {
        std::vector<std::string> paths;
        for (const KsURL& url : urls_) paths.push_back(url.path());
        stream = EventStream::create(std::move(paths), since, kLatency, kCreationFlags, std::move(callback));
    }
    stream->setDispatchQueue(streamQueue_);
    return stream;
}

void FSEventReader::start() {
    std::shared_ptr<EventStream> stream = makeStream();
    {
        const MutexLock lock(mutex_);
        if (stream_) return;
        stream_ = stream;
    }
    stream->start();
}

void FSEventReader::stop() {
    std::shared_ptr<EventStream> stream;
    {
        const MutexLock lock(mutex_);
        stream.swap(stream_);
    }
    if (!stream) return;
    stream->stop();
    stream->invalidate();
}

bool FSEventReader::isStarted() const {
    const MutexLock lock(mutex_);
    return stream_ != nullptr;
}

std::uint64_t FSEventReader::lastProcessedFSEventID() const {
    const MutexLock lock(mutex_);
    return lastProcessedFSEventID_;
}

FSEntryFinder& FSEventReader::entryFinder() {
    streamQueue_->assertCurrent();
    return entryFinder_;
}

std::string FSEventReader::description() const {
    return fmt::format("<FSEventReader {}>", mode_ == FSEventReaderMode::pathBased ? "pathBased" : "docIDBased");
}

void FSEventReader::handle(std::span<const Event> events) {
    streamQueue_->assertCurrent();
    std::shared_ptr<FSEventReaderDelegate> delegate;
    {
        const MutexLock lock(mutex_);
        delegate = delegate_.lock();
    }
    if (!delegate) return;
    entryFinder_.forget();
    while (!events.empty() && isStarted()) {
        const std::size_t count = std::min(events.size(), kEventsTogetherMax);
        if (!handleTogether(*delegate, events.first(count))) return;
        events = events.subspan(count);
    }
}

/// False when the reader is no longer to go on.
bool FSEventReader::handleTogether(FSEventReaderDelegate& delegate, std::span<const Event> events) {
    std::vector<Look> looks;
    std::vector<KsURL> entries;
    std::optional<KsError> failure;
    looks.reserve(events.size());
    for (const Event& event : events) {
        Result<Look> look = lookAt(delegate, event);
        if (!look.ok()) {
            failure = look.error();
            break;
        }
        look->event = &event;
        if (look->entry) {
            look->path = look->entry->path();
            entries.push_back(*std::exchange(look->entry, std::nullopt));
        }
        looks.push_back(*std::move(look));
    }
    Result<TesselItems> items = entries.empty() ? TesselItems() : container_contents::itemsOf(std::move(entries));
    if (!items.ok()) return fail(delegate, items.error());
    auto next = items->begin();
    for (Look& look : looks) {
        // The items come in the order of the entries, some left out.
        if (look.kind == Look::Kind::item && next != items->end() && (*next)->fileURL()->path() == look.path)
            look.item = std::move(*next++);
        report(delegate, look);
        if (!isStarted()) return false;
        const MutexLock lock(mutex_);
        lastProcessedFSEventID_ = std::max(lastProcessedFSEventID_, look.event->id);
    }
    return failure ? fail(delegate, *failure) : true;
}

/// Where it stopped, a reader that is started again goes on.
bool FSEventReader::fail(FSEventReaderDelegate& delegate, const KsError& error) {
    stop();
    delegate.readerDidFail(*this, error);
    return false;
}

void FSEventReader::report(FSEventReaderDelegate& delegate, const Look& look) {
    const Event& event = *look.event;
    switch (look.kind) {
        case Look::Kind::nothing: return;
        case Look::Kind::flags: return reportFlags(delegate, *this, event);
        case Look::Kind::scan: return delegate.readerMustScan(*this, event);
        case Look::Kind::directoryMoved: return delegate.readerDidMoveDirectory(*this, event);
        case Look::Kind::deleted: return delegate.readerDidDeleteItem(*this, event, look.identifier);
        case Look::Kind::dropped: return delegate.readerDidDropEvent(*this, event, look.identifier);
        case Look::Kind::item:
            if (look.item) return delegate.readerDidUpdateItem(*this, event, look.identifier, look.item);
            logDebug("dropping fsevent at {}; can't create local item", look.path);
            return delegate.readerDidDropEvent(*this, event, look.identifier);
    }
}

void FSEventReader::reportFlags(FSEventReaderDelegate& delegate, FSEventReader& reader, const Event& event) {
    const bool isWrapped = event.flags & EventFlags::idsWrapped;
    const bool isDropped = event.flags & (EventFlags::userDropped | EventFlags::kernelDropped);
    if (isWrapped) logInfo("fsevents id wrapped");
    if (isDropped) logInfo("dropped fsevents");
    if (isWrapped || isDropped) delegate.readerDidLoseEvents(reader, event);
    if (event.flags & EventFlags::historyDone) {
        logInfo("done processing history");
        delegate.readerDidFinishHistory(reader, event.id);
    }
}

/// Whether what left the path is, or held, one of the directories.
bool FSEventReader::mayMoveDirectory(const Event& event) const {
    return (event.flags & EventFlags::removed) &&
           std::ranges::any_of(urls_, [&](const KsURL& url) { return isAtOrBelow(url.path(), event.path); });
}

Result<FSEventReader::Look> FSEventReader::lookAt(FSEventReaderDelegate& delegate, const Event& event) {
    if (verbose_)
        logDebug("fsevent {} at \"{}\" (flags: {:#x}, fileID: {})", event.id, event.path,
                 static_cast<std::uint32_t>(event.flags), static_cast<std::uint64_t>(event.fileID));
    constexpr EventFlags kWithoutPath =
        EventFlags::idsWrapped | EventFlags::userDropped | EventFlags::kernelDropped | EventFlags::historyDone;
    if (event.flags & kWithoutPath) return Look{.kind = Look::Kind::flags};
    if (mode_ == FSEventReaderMode::docIDBased) return lookAtDocument(delegate, event);
    const bool isMonitored = directoryHolding(urls_, event.path) != nullptr;
    if (!isMonitored && mayMoveDirectory(event)) return Look{.kind = Look::Kind::directoryMoved};
    if (event.flags & EventFlags::mustScanSubdirectories) {
        const auto isBelow = [&](const KsURL& url) { return isAtOrBelow(url.path(), event.path); };
        if (isMonitored || std::ranges::any_of(urls_, isBelow)) return Look{.kind = Look::Kind::scan};
    }
    return lookAtPath(delegate, event, event.path, event.fileID,
                      event.fileID == FileID{}
                          ? TesselItemIdentifier()
                          : CdlFileObjectIdentifier::fromFileID(static_cast<std::uint64_t>(event.fileID)));
}

/// `identifier` is the event's own; empty when it has none.
Result<FSEventReader::Look> FSEventReader::lookAtPath(FSEventReaderDelegate& delegate, const Event& event,
                                                      std::string_view path, FileID fileID,
                                                      TesselItemIdentifier identifier) {
    if (directoryHolding(urls_, path) == nullptr) {
        logDebug("dropping fsevent at {}; URL is not monitored", path);
        return Look{};
    }
    if (delegate.readerDidReceiveEvent(*this, event, path) == FSEventReaderDelegate::LookFurther::no) return Look{};
    FSFoundEntry found;
    if (event.seen) found.url = entryFinder().foundAlready(path, event.folder, *event.seen);
    if (found.url) {
        found.standing = FSFoundEntry::Standing::reached;
    } else {
        found = TRY(entryFinder().find(path));
    }
    if (found.standing == FSFoundEntry::Standing::outside)
        return Look{.kind = Look::Kind::dropped, .identifier = std::move(identifier)};
    if (found.standing == FSFoundEntry::Standing::missing) {
        if (!identifier.empty()) return Look{.kind = Look::Kind::deleted, .identifier = std::move(identifier)};
        logDebug("dropping fsevent at \"{}\"; No object at path", path);
        return Look{};
    }
    const std::uint64_t there = TRY(found.url->status()).fileID;
    if (FileID{there} != fileID) {
        logDebug("dropping fsevent at {}; fileObjectIDs don't match ({}, {})", path, there,
                 static_cast<std::uint64_t>(fileID));
        return Look{.kind = Look::Kind::dropped, .identifier = std::move(identifier)};
    }
    // It left, and it is here again: whether this is where it is now, another event says.
    if (event.flags & EventFlags::removed)
        return Look{.kind = Look::Kind::dropped, .identifier = std::move(identifier)};
    if (!delegate.readerShouldMakeItem(*this, event, *found.url)) {
        // A document that was another file's was listed as that one.
        if (mode_ == FSEventReaderMode::docIDBased)
            return Look{.kind = Look::Kind::dropped, .identifier = std::move(identifier)};
        return Look{};
    }
    return Look{.kind = Look::Kind::item, .identifier = std::move(identifier), .entry = std::move(found.url)};
}

Result<FSEventReader::Look> FSEventReader::lookAtDocument(FSEventReaderDelegate& delegate, const Event& event) {
    std::int64_t documentID = 0;
    std::int64_t sourceFileID = 0;
    std::int64_t destinationFileID = 0;
    if (!parseDocIDChangePath(event.path.c_str(), &documentID, &sourceFileID, &destinationFileID)) {
        logError("can't parse docID path \"{}\"; expected format is \"/.docid/$dev/changed/$docid/src=$src,dst=$dst\"",
                 event.path);
        return Look{};
    }
    TesselItemIdentifier identifier = CdlFileObjectIdentifier::fromDocumentID(static_cast<std::uint64_t>(documentID));
    if (destinationFileID == 0) {
        if (verbose_) logDebug("did delete {}", identifier);
        if (delegate.readerDidReceiveEvent(*this, event, {}) == FSEventReaderDelegate::LookFurther::no) return Look{};
        return Look{.kind = Look::Kind::deleted, .identifier = std::move(identifier)};
    }
    const FileID destination{static_cast<std::uint64_t>(destinationFileID)};
    const std::optional<std::string> path = recordedPathOf(destination);
    if (!path) {
        logDebug("can't compute url for {}", identifier);
        return Look{};
    }
    return lookAtPath(delegate, event, *path, destination, std::move(identifier));
}

FSEventReaderGatherPhaseResumeStatus FSEventReader::canResumeGatherPhase(const std::vector<KsURL>& on,
                                                                         std::uint64_t previousEventID) {
    // Of a listing that began while nothing could be replayed. Nothing is known here of one that began later.
    if (FSGatherWitness::shared().holds(on, previousEventID)) return CanResume();
    const auto history = EventHistory::shared();
    if (!history || !history->isReady() || !history->canReplayAfter(previousEventID))
        return CantReplayHistoricalFSEvents();
    const std::string key = ResumedListings::keyOf(*history, on, previousEventID);
    const auto reader = create(on, FSEventReaderMode::pathBased, /*verbose=*/false,
                               ResumedListings::shared().reached(key, previousEventID));
    const auto checker = std::make_shared<FSEventChecker>();
    reader->setDelegate(checker);
    reader->start();
    FSEventReaderGatherPhaseResumeStatus status = checker->wait();
    reader->stop();
    if (std::holds_alternative<CanResume>(status)) ResumedListings::shared().put(key, checker->reached());
    return status;
}

std::optional<std::string> recordedPathOf(FileID fileID) {
    const auto store = RvStorageManager::defaultManager().store();
    if (!store) return std::nullopt;
    const auto roots = RootDirectories::shared().all();
    std::vector<FileID> rootIDs;
    rootIDs.reserve(roots.size());
    for (const auto& root : roots) rootIDs.push_back(FileID{root->status.fileID});
    const auto recorded = store->recordedPath(fileID, rootIDs);
    if (!recorded) return std::nullopt;
    const std::string& root = roots[recorded->rootIndex]->path;
    return recorded->path.empty() ? root : root + "/" + recorded->path;
}

}  // namespace cindral
