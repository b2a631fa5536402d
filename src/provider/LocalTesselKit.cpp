#include "provider/LocalTesselKit.h"

#include <fmt/ranges.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <utility>

#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/SetAside.h"
#include "platform/roster/Roster.h"
#include "platform/tessel/NotificationCenter.h"
#include "platform/tessel/StagingFolder.h"
#include "platform/tessel/TesselErrors.h"
#include "platform/tessel/TesselManager.h"
#include "provider/AppRefresh.h"
#include "provider/CindralProvider.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/LocalAppLibraryCache.h"
#include "provider/LocalAppLibraryItem.h"
#include "provider/LocalFileEnumerator.h"
#include "provider/LocalRootEnumerator.h"
#include "provider/LocalTesselKitError.h"
#include "provider/LocalThumbnails.h"
#include "provider/Utilities.h"

namespace cindral {

namespace {

constexpr std::chrono::milliseconds kAppRefreshIntervalMin{500};
// Looks for an item that others move meanwhile.
constexpr int kLooksAtItemMax = 3;

NotificationCenter& requiredDistributedCenter() {
    NotificationCenter* center = NotificationCenter::distributedCenter();
    if (center == nullptr) {
        std::fputs("the distributed notification center is missing\n", stderr);
        std::abort();
    }
    return *center;
}

/// What an earlier process left half done goes before anybody looks.
void removeAbandoned() {
    for (const auto& root : RootDirectories::shared().all()) StagingFolder::removeAbandoned(*root);
}

}  // namespace

class LocalTesselKit::InstalledAppsProxy {
public:
    void setProvider(std::weak_ptr<LocalTesselKit> provider) {
        const MutexLock lock(mutex_);
        provider_ = std::move(provider);
    }
    std::shared_ptr<LocalTesselKit> provider() const {
        const MutexLock lock(mutex_);
        return provider_.lock();
    }

private:
    mutable Mutex mutex_;
    std::weak_ptr<LocalTesselKit> provider_ GUARDED_BY(mutex_);
};

class LocalTesselKit::FirstRefresh {
public:
    FirstRefresh() { group_.enter(); }
    /// One at a time.
    void end() {
        if (isOver_) return;
        // As at the start, in the folders that are known only now.
        removeAbandoned();
        isOver_ = true;
        group_.leave();
    }
    void wait() {
        if (!isOver_) group_.wait();
    }

private:
    std::atomic<bool> isOver_ = false;
    DispatchGroup group_;
};

LocalTesselKit::LocalTesselKit()
    : firstRefresh_(std::make_shared<FirstRefresh>()),
      appRefreshPacer_("cindral.app-refresh.pacer", appRefreshQueue_, kAppRefreshIntervalMin),
      installedAppsProxy_(std::make_shared<InstalledAppsProxy>()) {
    // Captures nothing of the provider: a refresh may outlast it.
    appRefreshPacer_.setEventBlock([first = firstRefresh_] { refreshApps([&] { first->end(); }); });
    appRefreshPacer_.resume();
    appRefreshPacer_.signal();
}

std::shared_ptr<LocalTesselKit> LocalTesselKit::init() {
    removeAbandoned();
    std::shared_ptr<LocalTesselKit> provider(new LocalTesselKit);
    NotificationCenter& center = requiredDistributedCenter();
    const InstalledAppsProxy* proxy = provider->installedAppsProxy_.get();
    provider->installedAppsProxy_->setProvider(provider);
    center.addObserver(proxy, notificationCallback, kApplicationRegisteredNotification, SuspensionBehavior::coalesce);
    center.addObserver(proxy, notificationCallback, kApplicationUnregisteredNotification, SuspensionBehavior::coalesce);
    logInfo("auto notify changes on TesselWorkingSetContainerItemIdentifier at startup");
    TesselManager::defaultManager().signalEnumeratorForContainerItemIdentifier(kTesselWorkingSetContainerItemIdentifier,
                                                                               [](const std::optional<KsError>&) {});
    return provider;
}

LocalTesselKit::~LocalTesselKit() {
    // A notification that comes in between finds the proxy without a provider, and is dropped.
    SerialQueue::main().async(
        [proxy = std::move(installedAppsProxy_)] { requiredDistributedCenter().removeEveryObserver(proxy.get()); });
}

void LocalTesselKit::notificationCallback(const void* observer, std::string_view /*name*/) {
    if (observer == nullptr) return;
    const auto provider = static_cast<const InstalledAppsProxy*>(observer)->provider();
    if (provider) provider->appRefreshPacer_.signal();
}

std::shared_ptr<const LocalItem> LocalTesselKit::resolveItem(const TesselItemIdentifier& identifier,
                                                             LocalItem::Customs customs) {
    if (identifier.starts_with('#')) {
        const auto proxy = RoBundleProxy::bundleProxyForIdentifier(identifier.substr(1));
        return proxy ? LocalAppLibraryItem::initWithBundleProxy(*proxy) : nullptr;
    }
    if (identifier == kTesselTemporaryLocalFolderItemIdentifier)
        return LocalItem::initWithURL(temporaryLocalFolderURL(), std::move(customs));
    std::optional<KsURL> url = fileURLWithItemIdentifier(identifier);
    return url ? LocalItem::initWithURL(*std::move(url), std::move(customs)) : nullptr;
}

/// Where an item is, and which object it is there.
Result<MeantFile> LocalTesselKit::lookUp(const TesselItemIdentifier& identifier) {
    LocalItem::Customs customs;
    customs.isOnlyLookedUp = true;
    // Between the look at where it is and the look at what is there, others may have moved it and taken its place.
    for (int looks = 0; looks < kLooksAtItemMax; ++looks) {
        const auto item = resolveItem(identifier, customs);
        if (!item) break;
        const Result<FileStatus> status = item->fileURL()->status();
        const bool isNumbered = identifier.find('=') != std::string::npos;
        const bool isMeant = item->itemIdentifier() == identifier || !isNumbered ||
                             (status.ok() && fileIDWithItemIdentifier(identifier) == status->fileID);
        if (isMeant && status.ok()) return MeantFile(*item->fileURL(), status->identity());
    }
    return tesselErrorForNonExistentItemWithIdentifier(identifier);
}

Result<KsURL> LocalTesselKit::urlForItem(const TesselItemIdentifier& identifier) {
    return TRY(lookUp(identifier)).url;
}

void LocalTesselKit::waitUntilReady() {
    firstRefresh_->wait();
}

std::optional<KsURL> LocalTesselKit::URLForItemWithPersistentIdentifier(const TesselItemIdentifier& identifier) {
    return urlForItemWithPersistentIdentifier(identifier);
}

std::optional<KsURL> LocalTesselKit::urlForItemWithPersistentIdentifier(const TesselItemIdentifier& identifier) {
    const Result<MeantFile> file = find(identifier, Lookup::lenient);
    return file.ok() ? std::optional(file->url) : std::nullopt;
}

KsError LocalTesselKit::missingItem(const TesselItemIdentifier& identifier, Lookup lookup) {
    return lookup == Lookup::strict ? tesselErrorForNonExistentItemWithIdentifier(identifier)
                                    : tsItemNotFoundError(identifier);
}

Result<MeantFile> LocalTesselKit::find(const TesselItemIdentifier& identifier, Lookup lookup) {
    if (lookup == Lookup::strict) return lookUp(identifier);
    const LogSection section("fetching URL for \"{}\"", identifier);
    Result<MeantFile> file = lookUp(identifier);
    if (file.ok()) {
        logDebug("found {}", file->url.description());
        return file;
    }
    if (file.error().code() == static_cast<std::int64_t>(LocalTesselKitError::itemNotFound)) {
        logDebug("can't find URL matching identifier {}; {}", identifier, file.error().description());
    } else {
        logError("can't find URL matching identifier {}; {}", identifier, file.error().description());
    }
    return missingItem(identifier, lookup);
}

std::optional<TesselItemIdentifier> LocalTesselKit::persistentIdentifierForItemAtURL(const KsURL& url) {
    return persistentIdentifierForItemAt(url);
}

std::optional<TesselItemIdentifier> LocalTesselKit::persistentIdentifierForItemAt(const KsURL& url) {
    const LogSection section("fetching item identifier for \"{}\"", url.description());
    std::optional<TesselItemIdentifier> identifier;
    if (url.lastPathComponent() == kDocumentsName)
        identifier = CdlFileObjectIdentifier::fromAppLibraryDataContainerURL(url);
    if (!identifier) {
        LocalItem::Customs customs;
        customs.isOnlyLookedUp = true;
        const auto item = LocalItem::initWithURL(url, std::move(customs));
        if (!item) return std::nullopt;
        identifier = item->itemIdentifier();
    }
    logDebug("found {}", *identifier);
    return identifier;
}

Result<std::shared_ptr<const TesselItem>> LocalTesselKit::itemForIdentifier(const TesselItemIdentifier& identifier) {
    return std::shared_ptr<const TesselItem>(TRY(fetchItem(identifier)));
}

Result<std::shared_ptr<const LocalItem>> LocalTesselKit::fetchItem(const TesselItemIdentifier& identifier) {
    const LogSection section("fetching item's properties for \"{}\"", identifier);
    std::shared_ptr<const LocalItem> item = resolveItem(identifier);
    if (!item) {
        logError("item lookup failed for identifier \"{}\"", identifier);
        return errorFor(LocalTesselKitError::invalidItemIdentifier).with("identifier", identifier);
    }
    logDebug("found {}", item->description());
    return item;
}

Result<std::shared_ptr<TesselEnumerator>> LocalTesselKit::enumeratorForContainerItemIdentifier(
    const TesselItemIdentifier& container) {
    const LogSection section("enumerator for {}", container);
    if (container == kTesselRootContainerItemIdentifier || container == kTesselWorkingSetContainerItemIdentifier ||
        container == kTesselAllDirectoriesContainerItemIdentifier) {
        return std::shared_ptr<TesselEnumerator>(LocalRootEnumerator::initWithContainer(container));
    }
    KsURL url = TRY(urlForItem(container));
    auto enumerator = LocalFileEnumerator::initWithContainer(container, {std::move(url)});
    enumerator->start();
    return std::shared_ptr<TesselEnumerator>(std::move(enumerator));
}

void LocalTesselKit::providePlaceholderAtURL(const KsURL& /*url*/, Completion completion) {
    completion(std::nullopt);
}

void LocalTesselKit::startProvidingItemAtURL(const KsURL& url, Completion completion) {
    providePlaceholderAtURL(url, std::move(completion));
}

void LocalTesselKit::stopProvidingItemAtURL(const KsURL& /*url*/) {}

void LocalTesselKit::itemChangedAtURL(const KsURL& url) {
    stopProvidingItemAtURL(url);
}

void LocalTesselKit::defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                                    ItemCompletion completion) {
    const LogSection section("default location for {}", bundleIdentifier);
    const auto proxy = RoBundleProxy::bundleProxyForIdentifier(bundleIdentifier);
    if (!proxy) {
        logError("can't create bundle proxy with '{}'", bundleIdentifier);
        return completion(tsInvalidParameterError("bundleIdentifier", bundleIdentifier));
    }
    std::shared_ptr<const TesselItem> item = LocalAppLibraryItem::initWithBundleProxy(*proxy);
    if (!item) {
        logError("can't create an app library item with {}", proxy->description());
        return completion(tsInvalidParameterError("bundleIdentifier", bundleIdentifier));
    }
    completion(std::move(item));
}

void LocalTesselKit::fetchThumbnailsForItemIdentifiersWithType(const std::vector<TesselItemIdentifier>& identifiers,
                                                               unsigned /*requestedSize*/,
                                                               TypedThumbnailCompletion perThumbnail,
                                                               Completion completion) {
    const LogSection section("fetching thumbnails for [{}]", fmt::join(identifiers, ", "));
    for (const TesselItemIdentifier& identifier : identifiers) {
        std::optional<Bytes> thumbnail = thumbnailForItemIdentifier(identifier);
        const std::optional<std::string> type =
            thumbnail ? std::optional(std::string(kPngTypeIdentifier)) : std::nullopt;
        perThumbnail(identifier, std::move(thumbnail), type);
    }
    completion(std::nullopt);
}

Result<std::vector<std::string>> repairCindralProvider(const std::string& applicationSupport) {
    std::vector<std::string> aside;
    const KsURL folder = KsURL::fileURL(applicationSupport);
    if (auto renamed = TRY(setAsideUnless(applicationSupport, ExpectedKind::folder))) aside.push_back(*renamed);
    for (const auto source : {LocalAppLibraryCacheSource::main, LocalAppLibraryCacheSource::workingSet}) {
        const LocalAppLibraryCache cache(source, folder);
        const std::string& file = cache.cacheURL().path();
        const std::string holder = file.substr(0, file.rfind('/'));
        if (auto renamed = TRY(setAsideUnless(holder, ExpectedKind::folder))) aside.push_back(*std::move(renamed));
        if (auto renamed = TRY(cache.setAsideWhatStops())) aside.push_back(*std::move(renamed));
    }
    return aside;
}

std::shared_ptr<TesselExtension> makeCindralProvider() {
    return LocalTesselKit::init();
}

}  // namespace cindral
