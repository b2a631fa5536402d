#include "provider/LocalFileEnumerator.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <utility>

#include "platform/eventstream/EventHistory.h"
#include "platform/eventstream/EventStream.h"
#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/ThreadPool.h"
#include "platform/revisions/RvStorageManager.h"
#include "platform/tessel/TesselErrors.h"
#include "provider/ChangesAhead.h"
#include "provider/ContainerContents.h"
#include "provider/LocalChangesObserverContext.h"
#include "provider/LocalTesselKitError.h"
#include "provider/fs/FSChangesEnumerator.h"
#include "provider/fs/FSChangesNotifier.h"
#include "provider/fs/FSDirectoryEnumerator.h"
#include "provider/fs/FSEventReader.h"
#include "provider/fs/FSGatherWitness.h"
#include "provider/fs/FSListingPositions.h"

namespace cindral {

namespace {

EnumeratorOptions pageOptions(const TesselItemIdentifier& container, const std::vector<KsURL>& urls,
                              std::uint64_t offset) {
    EnumeratorOptions options = container_contents::scanOptions(container, urls);
    options.offset = offset;
    options.limit = kGatherPageEntriesMax;
    options.positions = &FSListingPositions::shared();
    options.positionsKey = options.recursively ? "below" : "in";
    for (const KsURL& url : urls) {
        options.positionsKey += '\0';  // In no path.
        options.positionsKey += url.path();
    }
    return options;
}

// How far the pages of a follower's listing overlap: so many entries may go while one is read.
constexpr std::uint64_t kFollowerOverlap = 16;
constexpr std::size_t kEventsBatchMax = 1'000;
// Where much is happening, or folders are to be scanned, what is read ahead is mostly read in vain.
constexpr int kAheadsPassedOver = 16;

/// The event history, where it can tell what happened since the event without a wait for the first look at the roots.
std::shared_ptr<EventHistory> historyAfter(std::uint64_t eventID) {
    auto history = EventHistory::shared();
    return history && history->isReady() && history->canReplayAfter(eventID) ? history : nullptr;
}

/// False, after an error line, when what was complete before the call may not be in the history.
bool drain(EventHistory& history) {
    const ThreadPool::BlockingRegion region;
    const Result<void> drained = history.drain();
    if (!drained.ok()) logError("can't bring the event history up to date; {}", drained.error().description());
    return drained.ok();
}

std::shared_ptr<FSChangesNotifier> makeNotifier(const TesselItemIdentifier& container, const std::vector<KsURL>& urls) {
    auto notifier = FSChangesNotifier::create(container, urls);
    if (!notifier) logError("can't watch {}; enumeration will have no live update", urls.front().description());
    return notifier;
}

}  // namespace

struct LocalFileEnumerator::Gathered {
    std::vector<KsURL> entries;
    std::uint64_t reached = 0;
    bool isFull = false;
};

class LocalFileEnumerator::ReadingAhead : public TesselChangeObserver {
public:
    ReadingAhead(std::shared_ptr<TesselChangeObserver> observer, std::shared_ptr<LocalFileEnumerator> enumerator)
        : observer_(std::move(observer)), enumerator_(std::move(enumerator)) {}

    void didUpdateItems(TesselItems items) override { observer_->didUpdateItems(std::move(items)); }
    void didDeleteItemsWithIdentifiers(std::vector<TesselItemIdentifier> identifiers) override {
        observer_->didDeleteItemsWithIdentifiers(std::move(identifiers));
    }
    void finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor anchor, bool moreComing) override {
        // Before the client can ask: it is to wait for what is read ahead.
        const auto ahead = moreComing ? enumerator_->makeAhead(anchor) : nullptr;
        observer_->finishEnumeratingChangesUpToSyncAnchor(std::move(anchor), moreComing);
        if (ahead) enumerator_->fetchChanges(ahead, ahead->since(), /*isAhead=*/true);
    }
    void finishEnumeratingWithError(const KsError& error) override { observer_->finishEnumeratingWithError(error); }

private:
    const std::shared_ptr<TesselChangeObserver> observer_;
    const std::shared_ptr<LocalFileEnumerator> enumerator_;
};

std::shared_ptr<LocalFileEnumerator> LocalFileEnumerator::initWithContainer(TesselItemIdentifier container,
                                                                            std::vector<KsURL> urls,
                                                                            ReadsAhead readsAhead) {
    if (urls.empty()) {
        std::fputs("can't create enumerator for an empty list of URLs\n", stderr);
        std::abort();
    }
    return std::shared_ptr<LocalFileEnumerator>(
        new LocalFileEnumerator(std::move(container), std::move(urls), readsAhead));
}

LocalFileEnumerator::LocalFileEnumerator(TesselItemIdentifier container, std::vector<KsURL> urls, ReadsAhead readsAhead)
    : container_(std::move(container)),
      enumeratedItemURL_(urls.size() == 1 ? std::optional(urls.front()) : std::nullopt),
      urls_(std::move(urls)),
      notifier_(makeNotifier(container_, urls_)),
      shouldUpdateFileIDInPalimp_(container_ == kTesselWorkingSetContainerItemIdentifier),
      readsAhead_(readsAhead == ReadsAhead::yes) {}

LocalFileEnumerator::~LocalFileEnumerator() {
    if (notifier_) notifier_->stop();
}

std::string LocalFileEnumerator::enumeratedItemName() const {
    return enumeratedItemURL_ ? std::string(enumeratedItemURL_->lastPathComponent()) : container_;
}

void LocalFileEnumerator::enumerateItemsForObserver(std::shared_ptr<TesselEnumerationObserver> observer,
                                                    const TesselPage& page) {
    FSChangeToken token;
    std::string pageName;
    if (page == tesselInitialPageSortedByDate()) {
        pageName = "initialPageSortedByDate";
    } else if (page == tesselInitialPageSortedByName()) {
        pageName = "initialPageSortedByName";
    } else if (page == tesselInitialPageForFollowers()) {
        pageName = "initialPageForFollowers";
        token.isForFollower = true;
    } else {
        const std::optional<FSChangeToken> decoded = FSChangeToken::decode(page);
        if (!decoded) {
            logError("can't create change token from anchor data, resetting");
            observer->finishEnumeratingWithError(tesselErrorForExpiredPage());
            return;
        }
        token = *decoded;
        pageName = token.description();
    }
    const LogSection section("enumerate items for {} with page {}", enumeratedItemName(), pageName);
    hostEnumerates();
    gather(*observer, token);
}

void LocalFileEnumerator::gather(TesselEnumerationObserver& observer, FSChangeToken incoming) {
    std::optional<FSChangeToken> token = gatherToken(observer, incoming);
    if (!token) return;
    Result<Gathered> gathered = gatherEntries(*token);
    if (gathered.ok() && gathered->isFull && token->offset == 0 && settle(*token)) gathered = gatherEntries(*token);
    if (!gathered.ok()) return observer.finishEnumeratingWithError(gathered.error());
    const std::uint64_t reached = gathered->reached;
    const bool isFull = gathered->isFull;

    const bool goesBack = canGoBack(*token);
    std::optional<FSChangeToken> following;
    if (goesBack) {
        const Result<std::optional<FSChangeToken>> next = followingPage(*token, *gathered);
        if (!next.ok()) return observer.finishEnumeratingWithError(next.error());
        following = *next;
    } else {
        const Result<void> witnessed = witness(*token, *gathered);
        if (!witnessed.ok()) return observer.finishEnumeratingWithError(witnessed.error());
    }
    Result<TesselItems> items = itemsOf(*std::move(gathered));
    if (!items.ok()) return observer.finishEnumeratingWithError(items.error());
    observer.didEnumerateItems(std::move(*items));
    if (goesBack) {
        return observer.finishEnumeratingUpToPage(following ? std::optional(following->encode()) : std::nullopt);
    }

    if (reached < token->offset) {
        logInfo("enumerator returned an offset ({}) smaller than the initial offset {}", reached, token->offset);
        return observer.finishEnumeratingWithError(tesselErrorForExpiredPage());
    }
    if (isFull) {
        token->offset = reached;
        return observer.finishEnumeratingUpToPage(token->encode());
    }
    logDebug("gather phase finished for {}", urls_.front().description());
    observer.finishEnumeratingUpToPage(std::nullopt);
}

Result<LocalFileEnumerator::Gathered> LocalFileEnumerator::gatherEntries(const FSChangeToken& token) const {
    Gathered gathered;
    gathered.entries.reserve(kGatherPageEntriesMax);
    FSDirectoryEnumerator enumerator;
    TRY(enumerator.enumerate(pageOptions(container_, urls_, token.offset), [&](KsURL entry) -> Result<void> {
        gathered.entries.push_back(std::move(entry));
        return {};
    }));
    // A container that is one folder is nothing without it; of several, each is listed as far as it can be.
    if (urls_.size() == 1 && enumerator.openError()) return *enumerator.openError();
    gathered.reached = enumerator.counter();
    gathered.isFull = gathered.reached >= token.offset && gathered.reached - token.offset == kGatherPageEntriesMax;
    return gathered;
}

/// Has what happened before the first page recorded, so that the pages that follow it don't take it for news. True when
/// there was something: the listing then begins after it, with a page that is read anew.
bool LocalFileEnumerator::settle(FSChangeToken& token) const {
    const auto history = historyAfter(token.streamEventID);
    if (!history || !drain(*history)) return false;
    return std::exchange(token.streamEventID, history->currentEventID()) != token.streamEventID;
}

/// Keeps what the page has seen, for the question whether the next may follow, where no history will tell. A listing
/// that ends with its first page needs no witness.
Result<void> LocalFileEnumerator::witness(FSChangeToken& token, const Gathered& gathered) const {
    const bool isFirst = token.offset == 0;
    if (isFirst && (!gathered.isFull || historyAfter(token.streamEventID))) return {};
    std::vector<const DirectoryReference*> folders;
    for (const KsURL& entry : gathered.entries) {
        if (folders.empty() || folders.back() != entry.directory().get()) folders.push_back(entry.directory().get());
    }
    if (isFirst) {
        token.streamEventID = TRY(FSGatherWitness::shared().begin(urls_, folders));
    } else {
        FSGatherWitness::shared().sawFolders(urls_, token.streamEventID, folders);
    }
    return {};
}

bool LocalFileEnumerator::canGoBack(const FSChangeToken& token) const {
    // A folder that moves within a deep listing takes along more than its one event tells.
    return token.isForFollower && !container_contents::isDeep(container_) &&
           historyAfter(token.streamEventID) != nullptr;
}

/// Entries that went before the page, or while it was read, moved those behind them up, at most as far as so many went.
/// Up to the overlap, the page before has read what may have slipped by; beyond it, this page is read once more.
Result<std::optional<FSChangeToken>> LocalFileEnumerator::followingPage(const FSChangeToken& token,
                                                                        const Gathered& gathered) const {
    const auto history = historyAfter(token.streamEventID);
    if (!history || !drain(*history)) return tesselErrorForExpiredPage();
    FSChangeToken following = token;
    std::uint64_t gone = 0;
    for (bool isLast = false; !isLast;) {
        const EventHistory::Batch batch = TRY(history->pathEvents(following.streamEventID, kEventsBatchMax));
        for (const Event& event : batch.events) {
            if ((event.flags & EventFlags::removed) && container_contents::covers(container_, urls_, event.path))
                ++gone;
        }
        following.streamEventID = batch.upTo;
        isLast = batch.isLast;
    }
    const auto back = [](std::uint64_t from, std::uint64_t by) { return from - std::min(from, by); };
    if (token.offset > 0 && gone > kFollowerOverlap) {
        following.offset = back(token.offset, gone);
    } else if (!gathered.isFull) {
        return std::optional<FSChangeToken>();
    } else {
        following.offset = back(gathered.reached, gone + kFollowerOverlap);
    }
    return std::optional(following);
}

std::optional<FSChangeToken> LocalFileEnumerator::gatherToken(TesselEnumerationObserver& observer,
                                                              FSChangeToken token) {
    const std::optional<KsUUID> volume = EventStream::volumeUUID(urls_.front());
    if (!volume) {
        logError("can't get volume UUID for {}", urls_.front().description());
        observer.finishEnumeratingWithError(errorFor(LocalTesselKitError::unableToGetDeviceUUID));
        return std::nullopt;
    }
    if (token.offset > 0 && token.deviceUUID != *volume) {
        logInfo("device UUID changed ({} -> {})", token.deviceUUID.string(), volume->string());
        token.offset = 0;
    } else if (token.offset > 0) {
        if (!canGoBack(token) && !mayResume(observer, token)) return std::nullopt;
        return token;
    } else {
        logDebug("start gather phase");
    }
    token.version = FSChangeToken::kCurrentVersion;
    token.deviceUUID = *volume;
    token.streamEventID = EventStream::currentEventID();
    return token;
}

bool LocalFileEnumerator::mayResume(TesselEnumerationObserver& observer, const FSChangeToken& token) const {
    logDebug("resume gather phase at offset {}", token.offset);
    const FSEventReaderGatherPhaseResumeStatus status = FSEventReader::canResumeGatherPhase(urls_, token.streamEventID);
    if (std::holds_alternative<CanResume>(status)) {
        logDebug("safe to resume gather phase from FSEventID {}", token.streamEventID);
        return true;
    }
    if (const auto* deletion = std::get_if<DeletionOccurred>(&status)) {
        logInfo("deletion of {} requires to re-gather from scratch", deletion->path);
    } else {
        logInfo("can't replay historical FSEvents, need to re-start gather phase from scratch");
    }
    observer.finishEnumeratingWithError(tesselErrorForExpiredPage());
    return false;
}

Result<TesselItems> LocalFileEnumerator::itemsOf(Gathered gathered) const {
    std::vector<KsURL> listed;
    std::vector<KsURL> passedOver;
    std::optional<KsError> unreadable;
    listed.reserve(gathered.entries.size());
    for (KsURL& entry : gathered.entries) {
        if (container_contents::isListed(container_, entry)) {
            listed.push_back(std::move(entry));
            continue;
        }
        const Result<FileStatus> status = entry.status();
        if (!status.ok() && !status.error().isPosix(ENOENT)) {
            logError("can't read \"{}\"; {}", entry.path(), status.error().description());
            unreadable = status.error().with("path", entry.path());
        }
        passedOver.push_back(std::move(entry));
    }
    // A folder that may be listed but not searched has entries of which nothing can be told: that is no empty folder.
    // Among others, it is one that can't be read.
    if (listed.empty() && unreadable && !container_contents::isDeep(container_)) return *unreadable;
    // The next page counts from the beginning what this one has passed over: it must be told when some of that goes,
    // and only of what was identified is that told.
    if (gathered.isFull && !passedOver.empty()) TRY(RvStorageManager::defaultManager().identify(passedOver));
    return container_contents::itemsOf(std::move(listed));
}

void LocalFileEnumerator::enumerateChangesForObserver(std::shared_ptr<TesselChangeObserver> observer,
                                                      const TesselSyncAnchor& anchor) {
    const std::optional<FSChangeToken> token = FSChangeToken::decode(anchor);
    if (!token) {
        logError("can't create change token from anchor data, resetting");
        return observer->finishEnumeratingWithError(tesselErrorForExpiredPage());
    }
    const LogSection section("enumerate changes for {} {}", enumeratedItemName(), token->description());
    const std::optional<KsUUID> volume = EventStream::volumeUUID(urls_.front());
    if (!volume) {
        logError("can't get volume UUID for {}", urls_.front().description());
        return observer->finishEnumeratingWithError(errorFor(LocalTesselKitError::unableToGetDeviceUUID));
    }
    if (token->deviceUUID != *volume) {
        logInfo("device UUID changed ({} -> {})", token->deviceUUID.string(), volume->string());
        return observer->finishEnumeratingWithError(tesselErrorForExpiredPage());
    }
    hostEnumerates();
    if (!readsAhead_) return fetchChanges(std::move(observer), *token, /*isAhead=*/false);
    std::shared_ptr<ChangesAhead> ahead;
    std::uint64_t stops = 0;
    {
        const MutexLock lock(mutex_);
        ahead.swap(ahead_);
        stops = stops_;
    }
    const auto reading = std::make_shared<ReadingAhead>(std::move(observer), shared_from_this());
    if (!ahead || ahead->since() != *token) return fetchChanges(reading, *token, /*isAhead=*/false);
    ahead->whenDone([self = shared_from_this(), ahead, reading, stops] { self->handOver(*ahead, reading, stops); });
}

void LocalFileEnumerator::fetchChanges(std::shared_ptr<TesselChangeObserver> observer, const FSChangeToken& token,
                                       bool isAhead) {
    const auto context = std::make_shared<LocalChangesObserverContext>(std::move(observer), shared_from_this(),
                                                                       shouldUpdateFileIDInPalimp_);
    const auto enumerator =
        FSChangesEnumerator::create(container_, urls_, context, token, EventStream::currentEventID(),
                                    isAhead ? FSChangesEnumerator::Scans::refused : FSChangesEnumerator::Scans::made);
    context->setFSChangesEnumerator(enumerator);
    {
        const MutexLock lock(mutex_);
        enumerators_.insert(enumerator);
    }
    enumerator->start();
}

/// What is then to be enumerated for the next who asks; null where nothing is to be read ahead.
std::shared_ptr<ChangesAhead> LocalFileEnumerator::makeAhead(const TesselSyncAnchor& anchor) {
    std::optional<FSChangeToken> token = FSChangeToken::decode(anchor);
    if (!token) return nullptr;
    const auto ahead = std::make_shared<ChangesAhead>(*std::move(token), EventStream::currentEventID());
    // What nobody came for is let go of without the lock.
    std::shared_ptr<ChangesAhead> before;
    const MutexLock lock(mutex_);
    if (isInvalidated_) return nullptr;
    if (aheadsToPassOver_ > 0) {
        --aheadsToPassOver_;
        return nullptr;
    }
    before.swap(ahead_);
    ahead_ = ahead;
    return ahead;
}

void LocalFileEnumerator::handOver(ChangesAhead& ahead, const std::shared_ptr<TesselChangeObserver>& observer,
                                   std::uint64_t stops) {
    const FSChangeToken& token = ahead.since();
    const auto history = historyAfter(token.streamEventID);
    const bool isOfNow = history && drain(*history) && history->currentEventID() == ahead.currentEventID() &&
                         history->canReplayAfter(token.streamEventID);
    // It waited here, where stop() does not find it; or for what was read ahead, which that has stopped.
    if (this->stops() != stops) return observer->finishEnumeratingWithError(KsError::posix(ECANCELED));
    if (isOfNow && ahead.handTo(*observer)) return;
    {
        const MutexLock lock(mutex_);
        aheadsToPassOver_ = kAheadsPassedOver;
    }
    fetchChanges(observer, token, /*isAhead=*/false);
}

std::uint64_t LocalFileEnumerator::stops() const {
    const MutexLock lock(mutex_);
    return stops_;
}

void LocalFileEnumerator::currentSyncAnchorWithCompletionHandler(
    std::function<void(std::optional<TesselSyncAnchor>)> completion) {
    const std::optional<KsUUID> volume = EventStream::volumeUUID(urls_.front());
    if (!volume) {
        logError("can't get volume UUID for \"{}\"", urls_.front().description());
        return completion(std::nullopt);
    }
    // Behind everything that the client can have seen; behind a first reading, too, before which nothing can be
    // replayed.
    if (const auto history = EventHistory::shared()) drain(*history);
    FSChangeToken token;
    token.deviceUUID = *volume;
    token.streamEventID = EventStream::currentEventID();
    completion(token.encode());
}

void LocalFileEnumerator::removeEnumerator(const std::shared_ptr<FSChangesEnumerator>& enumerator) {
    const MutexLock lock(mutex_);
    enumerators_.erase(enumerator);
}

void LocalFileEnumerator::hostEnumerates() const {
    if (notifier_) notifier_->hostDidEnumerate();
}

void LocalFileEnumerator::start() {
    if (!notifier_) return;
    notifier_->setClient(weak_from_this());
    notifier_->start();
}

void LocalFileEnumerator::stop() {
    if (notifier_) notifier_->stop();
    std::set<std::shared_ptr<FSChangesEnumerator>> running;
    std::shared_ptr<ChangesAhead> ahead;
    {
        const MutexLock lock(mutex_);
        ++stops_;
        running = enumerators_;
        ahead.swap(ahead_);
    }
    // Each takes itself out when its observer has been finished.
    for (const auto& enumerator : running) enumerator->stop();
}

/// Who asked waits for an answer; for what is read ahead, nobody does. It must not outlive the host's history and store.
void LocalFileEnumerator::invalidate() {
    std::shared_ptr<ChangesAhead> ahead;
    {
        const MutexLock lock(mutex_);
        isInvalidated_ = true;
        ahead.swap(ahead_);
    }
    stop();
    if (!ahead) return;
    DispatchSemaphore ended(0);
    ahead->whenDone([&ended] { ended.signal(); });
    ended.wait();
}

}  // namespace cindral
