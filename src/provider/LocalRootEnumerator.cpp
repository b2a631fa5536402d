#include "provider/LocalRootEnumerator.h"

#include <fmt/format.h>
#include <fmt/ranges.h>

#include <algorithm>
#include <utility>

#include "platform/eventstream/EventHistory.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/tessel/TesselErrors.h"
#include "platform/tessel/TesselManager.h"
#include "provider/ContainerContents.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/fs/FSChangeToken.h"

namespace cindral {

namespace {

// Entries of new roots that are made into items together.
constexpr std::size_t kContentsBatchMax = 200;
constexpr std::size_t kDeparturesBatchMax = 1000;
// A scan ends early when a folder moves away from under it. One that ends so often is of a tree that never rests.
constexpr int kContentsScansMax = 100;

bool isInitialPage(const TesselPage& page) {
    return page == tesselInitialPageSortedByName() || page == tesselInitialPageSortedByDate() ||
           page == tesselInitialPageForFollowers();
}

bool isBelowAny(std::string_view path, const std::vector<KsURL>& roots) {
    return std::ranges::any_of(roots, [&](const KsURL& root) {
        return path.starts_with(root.path()) && path.substr(root.path().size()).starts_with('/');
    });
}

std::vector<KsURL> without(std::vector<KsURL> urls, const std::vector<KsURL>& others) {
    std::erase_if(urls, [&](const KsURL& url) { return std::ranges::find(others, url) != others.end(); });
    return urls;
}

/// A manager as its cache has it between two refreshes: then the roots that it names are published.
std::shared_ptr<LocalAppLibraryManager> makeManager(LocalAppLibraryCacheSource source) {
    std::shared_ptr<LocalAppLibraryManager> manager;
    LocalAppLibraryManager::backgroundQueue().sync([&] { manager = LocalAppLibraryManager::create(source); });
    return manager;
}

/// Passes a page on, with the version of the list of app libraries in the page that follows: its offset counts over the
/// roots of that list.
class VersionedPages final : public TesselEnumerationObserver {
public:
    VersionedPages(std::shared_ptr<TesselEnumerationObserver> observer, std::uint64_t version)
        : observer_(std::move(observer)), version_(version) {}

    void didEnumerateItems(TesselItems items) override { observer_->didEnumerateItems(std::move(items)); }
    void finishEnumeratingUpToPage(std::optional<TesselPage> nextPage) override {
        auto token = nextPage ? FSChangeToken::decode(*nextPage) : std::nullopt;
        if (token) {
            token->appLibraryVersionToken = version_;
            nextPage = token->encode();
        }
        observer_->finishEnumeratingUpToPage(std::move(nextPage));
    }
    void finishEnumeratingWithError(const KsError& error) override { observer_->finishEnumeratingWithError(error); }

private:
    const std::shared_ptr<TesselEnumerationObserver> observer_;
    const std::uint64_t version_;
};

/// From the taking of a list to its saving, one working set at a time: who took an older list must not save it over a newer.
SerialQueue& publishingQueue() {
    static SerialQueue& queue = *new SerialQueue("cindral.root-enumerator.publishing");
    return queue;
}

}  // namespace

std::shared_ptr<LocalRootEnumerator> LocalRootEnumerator::initWithContainer(TesselItemIdentifier container) {
    return std::shared_ptr<LocalRootEnumerator>(new LocalRootEnumerator(std::move(container)));
}

LocalRootEnumerator::LocalRootEnumerator(TesselItemIdentifier container)
    : container_(std::move(container)),
      appLibraryManager_(
          makeManager(isWorkingSet() ? LocalAppLibraryCacheSource::workingSet : LocalAppLibraryCacheSource::main)),
      localFileEnumerator_(
          LocalFileEnumerator::initWithContainer(container_, monitoredRoots(), LocalFileEnumerator::ReadsAhead::yes)) {}

std::vector<KsURL> LocalRootEnumerator::monitoredRoots() const {
    std::vector<KsURL> roots = appLibraryManager_->rootURLs();
    roots.push_back(TesselManager::defaultManager().documentStorageURL());
    return roots;
}

std::shared_ptr<LocalFileEnumerator> LocalRootEnumerator::localFileEnumerator() const {
    const MutexLock lock(mutex_);
    return localFileEnumerator_;
}

bool LocalRootEnumerator::isRunning() const {
    const MutexLock lock(mutex_);
    return isRunning_;
}

// Items

void LocalRootEnumerator::enumerateItemsForObserver(std::shared_ptr<TesselEnumerationObserver> observer,
                                                    const TesselPage& page) {
    enumQueue_.async([self = shared_from_this(), observer = std::move(observer), page] {
        const LogSection section("enumerate root items for {}", self->container_);
        self->listItems(observer, page);
    });
}

void LocalRootEnumerator::listItems(const std::shared_ptr<TesselEnumerationObserver>& observer,
                                    const TesselPage& page) {
    const std::uint64_t version = appLibraryManager_->versionToken();
    if (isInitialPage(page)) {
        TesselItems libraries = appLibraryManager_->items();
        const std::size_t count = libraries.size();
        observer->didEnumerateItems(std::move(libraries));
        logDebug("discovered {} app-libraries", count);
    } else if (const auto token = FSChangeToken::decode(page); token && token->appLibraryVersionToken != version) {
        logInfo("app libraries changed ({} -> {}), need to re-start gather phase from scratch",
                token->appLibraryVersionToken, version);
        return observer->finishEnumeratingWithError(tesselErrorForExpiredPage());
    }
    localFileEnumerator()->enumerateItemsForObserver(std::make_shared<VersionedPages>(observer, version), page);
}

// Changes

void LocalRootEnumerator::enumerateChangesForObserver(std::shared_ptr<TesselChangeObserver> observer,
                                                      const TesselSyncAnchor& anchor) {
    enumQueue_.async([self = shared_from_this(), observer = std::move(observer), anchor] {
        const LogSection section("enumerate root changes for {}", self->container_);
        self->listChanges(observer, anchor);
    });
}

void LocalRootEnumerator::listChanges(const std::shared_ptr<TesselChangeObserver>& observer,
                                      const TesselSyncAnchor& anchor) {
    std::optional<FSChangeToken> token = FSChangeToken::decode(anchor);
    if (!token) {
        logError("can't create change token from anchor data, resetting");
        return observer->finishEnumeratingWithError(tesselErrorForExpiredPage());
    }
    logDebug("notifying app library changes since {}", token->appLibraryVersionToken);
    if (!notifyAppLibraryChanges(*observer, *token)) return;
    localFileEnumerator()->enumerateChangesForObserver(observer, token->encode());
}

bool LocalRootEnumerator::notifyAppLibraryChanges(TesselChangeObserver& observer, FSChangeToken& token) {
    const std::uint64_t asked = token.appLibraryVersionToken;
    const std::uint64_t local = appLibraryManager_->versionToken();
    if (local < asked) {
        logInfo("app-library version is greater than local version, need to restart from scratch");
        observer.finishEnumeratingWithError(tesselErrorForExpiredPage());
        return false;
    }
    if (asked == 0) return sendAllKnown(observer, token);
    if (asked == local) return sendNews(observer, token);

    const std::uint64_t main = LocalAppLibraryCache::shared(LocalAppLibraryCacheSource::main)->versionToken();
    std::string published;
    if (isWorkingSet())
        published = fmt::format(", workingSetVersion: {}", LocalAppLibraryManager::shared()->versionToken());
    logError(
        "change token version matches nothing, need to restart from scratch [changeTokenVersion: {}, localVersion: "
        "{}{}, mainCacheVersion: {}]",
        asked, local, published, main);
    observer.finishEnumeratingWithError(tesselErrorForExpiredPage());
    return false;
}

/// The client has been told of no list. It may have listed before there was one, and then knows nothing of what is in
/// the libraries, either.
bool LocalRootEnumerator::sendAllKnown(TesselChangeObserver& observer, FSChangeToken& token) {
    logDebug("change token version is zero, let's send all the app-libraries known");
    upgrade(nullptr);
    observer.didUpdateItems(appLibraryManager_->items());
    token.appLibraryVersionToken = appLibraryManager_->versionToken();
    return sendContents(observer, appLibraryManager_->rootURLs());
}

bool LocalRootEnumerator::sendNews(TesselChangeObserver& observer, FSChangeToken& token) {
    logDebug("change token version matches local version");
    const std::vector<KsURL> before = appLibraryManager_->rootURLs();
    if (!upgrade(&observer)) return true;
    token.appLibraryVersionToken = appLibraryManager_->versionToken();
    const std::vector<KsURL> after = appLibraryManager_->rootURLs();
    return sendDepartures(observer, without(before, after), token.streamEventID) &&
           sendContents(observer, without(after, before));
}

bool LocalRootEnumerator::upgrade(TesselChangeObserver* observer) {
    if (!isWorkingSet()) return takeNewerList(observer);
    bool isUpgraded = false;
    publishingQueue().sync([&] {
        isUpgraded = takeNewerList(observer);
        if (!isUpgraded) return;
        if (const Result<void> saved = appLibraryManager_->saveToCache(); !saved.ok())
            logError("can't save working-set cache to disk; {}", saved.error().description());
    });
    return isUpgraded;
}

bool LocalRootEnumerator::takeNewerList(TesselChangeObserver* observer) {
    // Between two refreshes: so that the process's own list is the same, and what it has is published.
    bool isUpgraded = false;
    LocalAppLibraryManager::backgroundQueue().sync([&] {
        isUpgraded = appLibraryManager_->upgradeFromMainCache(observer, /*deleteIndexOfRemovedDomains=*/isWorkingSet());
    });
    if (isUpgraded) updateMonitoredRoots();
    return isUpgraded;
}

/// What is in a root was recorded when the root was first published, which may be before the client's anchor: replaying
/// what came after that would miss it.
bool LocalRootEnumerator::sendContents(TesselChangeObserver& observer, const std::vector<KsURL>& roots) const {
    if (roots.empty()) return true;
    // From here on, what happens in them is recorded.
    RootDirectories::shared().waitForObserver();
    std::vector<KsURL> entries;
    const auto send = [&]() -> Result<void> {
        if (entries.empty()) return {};
        TesselItems items = TRY(container_contents::itemsOf(std::exchange(entries, {})));
        if (!items.empty()) observer.didUpdateItems(std::move(items));
        return {};
    };
    const auto scan = [&]() -> Result<void> {
        entries.clear();
        FSDirectoryEnumerator enumerator;
        TRY(enumerator.enumerate(container_contents::scanOptions(container_, roots), [&](KsURL entry) -> Result<void> {
            if (container_contents::isListed(container_, entry)) entries.push_back(std::move(entry));
            return entries.size() < kContentsBatchMax ? Result<void>() : send();
        }));
        return send();
    };
    Result<void> scanned = scan();
    for (int scans = 1; !scanned.ok() && scanned.error() == tesselErrorForExpiredPage() && scans < kContentsScansMax;
         ++scans) {
        scanned = scan();
    }
    if (scanned.ok()) return true;
    logError("can't list the app libraries that came; {}", scanned.error().description());
    observer.finishEnumeratingWithError(tesselErrorForExpiredPage());
    return false;
}

/// A library that is gone takes what is below it out of a client's view, but for what it has under folders that are not
/// listed themselves: a deep listing holds what is in the trash, without the folder that is its parent.
bool LocalRootEnumerator::sendDepartures(TesselChangeObserver& observer, const std::vector<KsURL>& roots,
                                         std::uint64_t since) const {
    const auto history = EventHistory::shared();
    if (roots.empty() || !history || !container_contents::isDeep(container_)) return true;
    // What was below a root that is taken back is recorded as having departed.
    RootDirectories::shared().waitForObserver();
    Result<void> read = history->drain();
    for (bool isLast = false; read.ok() && !isLast;) {
        const Result<EventHistory::Batch> batch = history->pathEvents(since, kDeparturesBatchMax);
        if (!batch.ok()) {
            read = batch.error();
            break;
        }
        std::vector<TesselItemIdentifier> gone;
        for (const Event& event : batch->events) {
            if (!(event.flags & EventFlags::removed) || !isBelowAny(event.path, roots)) continue;
            gone.push_back(CdlFileObjectIdentifier::fromFileID(static_cast<std::uint64_t>(event.fileID)));
            if (event.documentID != DocumentID{})
                gone.push_back(CdlFileObjectIdentifier::fromDocumentID(static_cast<std::uint64_t>(event.documentID)));
        }
        if (!gone.empty()) observer.didDeleteItemsWithIdentifiers(std::move(gone));
        since = batch->upTo;
        isLast = batch->isLast;
    }
    if (read.ok()) return true;
    logError("can't tell what was in the app libraries that went; {}", read.error().description());
    observer.finishEnumeratingWithError(tesselErrorForExpiredPage());
    return false;
}

void LocalRootEnumerator::updateMonitoredRoots() {
    std::shared_ptr<LocalFileEnumerator> before;
    {
        const MutexLock lock(mutex_);
        if (isRunning_) before = localFileEnumerator_;
    }
    if (before) before->stop();
    std::vector<std::string> texts;
    std::vector<KsURL> roots = monitoredRoots();
    for (const KsURL& root : roots) texts.push_back(root.description());
    const auto current =
        LocalFileEnumerator::initWithContainer(container_, std::move(roots), LocalFileEnumerator::ReadsAhead::yes);
    {
        const MutexLock lock(mutex_);
        localFileEnumerator_ = current;
    }
    logDebug("updated root enumerator to monitor [{}]", fmt::join(texts, ", "));
    if (!isCurrentAndRunning(current)) return;
    current->start();
    if (!isCurrentAndRunning(current)) current->stop();  // It was stopped meanwhile, before there was anything to stop.
}

bool LocalRootEnumerator::isCurrentAndRunning(const std::shared_ptr<LocalFileEnumerator>& enumerator) const {
    const MutexLock lock(mutex_);
    return isRunning_ && localFileEnumerator_ == enumerator;
}

void LocalRootEnumerator::currentSyncAnchorWithCompletionHandler(
    std::function<void(std::optional<TesselSyncAnchor>)> completion) {
    // What happens after the anchor is recorded in every root of the list that it names.
    RootDirectories::shared().waitForObserver();
    localFileEnumerator()->currentSyncAnchorWithCompletionHandler(
        [manager = appLibraryManager_, completion = std::move(completion)](std::optional<TesselSyncAnchor> anchor) {
            std::optional<FSChangeToken> token = anchor ? FSChangeToken::decode(*anchor) : std::nullopt;
            if (!token) return completion(std::nullopt);
            token->appLibraryVersionToken = manager->versionToken();
            completion(token->encode());
        });
}

// Monitoring

void LocalRootEnumerator::start() {
    std::shared_ptr<LocalFileEnumerator> current;
    {
        const MutexLock lock(mutex_);
        if (std::exchange(isRunning_, true)) return;
        current = localFileEnumerator_;
    }
    current->start();
    if (!isCurrentAndRunning(current)) current->stop();  // Another took its place meanwhile, or it was stopped.
}

void LocalRootEnumerator::stop() {
    std::shared_ptr<LocalFileEnumerator> current;
    {
        const MutexLock lock(mutex_);
        if (!std::exchange(isRunning_, false)) return;
        current = localFileEnumerator_;
    }
    current->stop();
}

void LocalRootEnumerator::invalidate() {
    stop();
    localFileEnumerator()->invalidate();
}

}  // namespace cindral
