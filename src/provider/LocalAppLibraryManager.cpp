#include "provider/LocalAppLibraryManager.h"

#include <fmt/format.h>
#include <fmt/ranges.h>

#include <algorithm>
#include <set>
#include <utility>

#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/tessel/TesselManager.h"

namespace cindral {
namespace {

// The registry's types of applications that people installed, or that came with the system.
constexpr unsigned kEnumeratedTypes[] = {0, 2};

struct SharedManager {
    Mutex mutex;
    std::shared_ptr<LocalAppLibraryManager> manager GUARDED_BY(mutex);

    static SharedManager& instance() {
        static SharedManager& shared = *new SharedManager;
        return shared;
    }
};

LocalAppLibraryCache::Loaded load(LocalAppLibraryCache& cache) {
    LocalAppLibraryCache::Loaded loaded;
    cache.queue().sync([&] { loaded = cache.loadBundleProxies(); });
    return loaded;
}

RoBundleProxies qualifyingApplications() {
    const LogSection section("retrieving app libraries from roster");
    RoBundleProxies list;
    for (const unsigned type : kEnumeratedTypes) {
        RoApplicationWorkspace::defaultWorkspace().enumerateApplicationsOfType(
            type, [&](const auto& record) { LocalAppLibraryManager::addIfQualified(record, list); });
    }
    std::vector<std::string> texts;
    for (const auto& record : list) texts.push_back(record->description());
    logDebug("bundle proxies [{}]", fmt::join(texts, ", "));
    return list;
}

bool isIdentical(const RoBundleProxies& a, const RoBundleProxies& b) {
    return std::ranges::equal(
        a, b, [](const auto& one, const auto& other) { return one->dataContainerURL() == other->dataContainerURL(); });
}

bool refreshMainCache() {
    const LogSection section("refreshing app libraries");
    const RoBundleProxies list = qualifyingApplications();
    const auto cache = LocalAppLibraryCache::shared(LocalAppLibraryCacheSource::main);
    const LocalAppLibraryCache::Loaded before = load(*cache);
    if (isIdentical(list, before.bundleProxies)) {
        logDebug("bundle proxies are identical to previous version");
        return false;
    }
    Result<std::uint64_t> saved(std::uint64_t{0});
    cache->queue().sync(
        [&] { saved = cache->saveBundleProxies(list, before.versionToken, /*incrementVersion=*/true); });
    if (!saved.ok()) {
        logError("can't refresh app libraries; {}", saved.error().description());
        return false;
    }
    logDebug("main cache version token is now {}", *saved);
    return true;
}

}  // namespace

SerialQueue& LocalAppLibraryManager::backgroundQueue() {
    static SerialQueue& queue = *new SerialQueue("cindral.app-library.background");
    return queue;
}

std::shared_ptr<LocalAppLibraryManager> LocalAppLibraryManager::shared() {
    SharedManager& shared = SharedManager::instance();
    const MutexLock lock(shared.mutex);
    if (!shared.manager) {
        shared.manager.reset(new LocalAppLibraryManager(LocalAppLibraryCacheSource::workingSet, /*isShared=*/true));
        shared.manager->publishRoots();
    }
    return shared.manager;
}

void LocalAppLibraryManager::forgetShared() {
    SharedManager& shared = SharedManager::instance();
    {
        const MutexLock lock(shared.mutex);
        shared.manager.reset();
    }
    RootDirectories::shared().setApplicationContainers({});
}

std::shared_ptr<LocalAppLibraryManager> LocalAppLibraryManager::create(LocalAppLibraryCacheSource source) {
    return std::shared_ptr<LocalAppLibraryManager>(new LocalAppLibraryManager(source, /*isShared=*/false));
}

LocalAppLibraryManager::LocalAppLibraryManager(LocalAppLibraryCacheSource source, bool isShared)
    : cacheSource_(source),
      isShared_(isShared),
      cache_(LocalAppLibraryCache::shared(source)),
      mainCache_(LocalAppLibraryCache::shared(LocalAppLibraryCacheSource::main)),
      rootURLs_(std::make_shared<const std::vector<KsURL>>()) {
    const LogSection section("loading bundle proxies from {}", cache().description());
    const LocalAppLibraryCache::Loaded loaded = load(cache());
    Content content;
    for (const auto& record : loaded.bundleProxies) {
        auto item = LocalAppLibraryItem::initWithBundleProxy(*record);
        if (item) {
            add(record, std::move(item), content);
        } else {
            logDebug("can't create app library from bundle proxy");
            content.identifiersWithoutItem.insert(record->appLibraryIdentifier());
        }
    }
    take(std::move(content), loaded.versionToken);
}

void LocalAppLibraryManager::add(const std::shared_ptr<const RoBundleProxy>& record,
                                 std::shared_ptr<const LocalAppLibraryItem> item, Content& content) {
    const KsURL& rootURL = *item->fileURL();
    content.bundleProxiesByRootURLs.insert_or_assign(rootURL.path(), Library{KsURL::fileURL(rootURL.path()), record});
    content.appLibrariesByItemIDs.insert_or_assign(item->itemIdentifier(), std::move(item));
}

void LocalAppLibraryManager::addIfQualified(const std::shared_ptr<const RoBundleProxy>& record, RoBundleProxies& list) {
    if (!record) return logError("enumerate Application provided nil proxy");
    const auto* application = dynamic_cast<const RoApplicationProxy*>(record.get());
    if (application == nullptr || application->publication() != RoApplicationProxy::Publication::published) return;
    const std::string& identifier = application->bundleIdentifier();
    logDebug("add {}", identifier.empty() ? "<unknown>" : identifier);
    list.push_back(record);
}

bool LocalAppLibraryManager::refreshAppLibraries() {
    if (backgroundQueue().isCurrent()) return refreshMainCache();
    bool isChanged = false;
    backgroundQueue().sync([&] { isChanged = refreshMainCache(); });
    return isChanged;
}

LocalAppLibraryManager::Content LocalAppLibraryManager::contentOf(const RoBundleProxies& records) {
    Content content;
    for (const auto& record : records) {
        auto item = LocalAppLibraryItem::initWithBundleProxy(*record);
        if (item) {
            add(record, std::move(item), content);
        } else {
            logDebug("can't create app library for {}", record->bundleIdentifier());
            content.identifiersWithoutItem.insert(record->appLibraryIdentifier());
        }
    }
    return content;
}

bool LocalAppLibraryManager::upgradeFromMainCache(TesselChangeObserver* observer, bool deleteIndexOfRemovedDomains) {
    const LogSection section("upgrading content from main cache");
    const std::uint64_t mainToken = mainCache_->versionToken();
    const std::uint64_t ownToken = versionToken();
    if (mainToken == ownToken) return false;
    if (ownToken > mainToken) {
        logError("version token shouldn't be greater than the main's cache version ({} vs {}); {}", ownToken, mainToken,
                 description());
    }
    const LocalAppLibraryCache::Loaded loaded = load(*mainCache_);
    Content content = contentOf(loaded.bundleProxies);
    std::vector<TesselItemIdentifier> removed = identifiersMissingFrom(content);
    if (observer != nullptr && !content.appLibrariesByItemIDs.empty()) {
        TesselItems items;
        for (const auto& [identifier, item] : content.appLibrariesByItemIDs) items.push_back(item);
        observer->didUpdateItems(std::move(items));
    }
    if (observer != nullptr && !removed.empty()) observer->didDeleteItemsWithIdentifiers(removed);
    if (deleteIndexOfRemovedDomains && !removed.empty()) deleteIndexOf(removed);
    take(std::move(content), loaded.versionToken);
    logDebug("upgraded manager {}", description());
    return true;
}

std::vector<TesselItemIdentifier> LocalAppLibraryManager::identifiersMissingFrom(const Content& content) {
    std::set<TesselItemIdentifier> missing;
    queue_.sync([&] {
        queue_.assertCurrent();
        missing = content_.identifiersWithoutItem;
        for (const auto& [identifier, item] : content_.appLibrariesByItemIDs) missing.insert(identifier);
    });
    std::erase_if(missing, [&](const auto& each) { return content.appLibrariesByItemIDs.contains(each); });
    return {missing.begin(), missing.end()};
}

void LocalAppLibraryManager::deleteIndexOf(const std::vector<TesselItemIdentifier>& identifiers) {
    logDebug("asking provider manager to delete index from deleted domains");
    std::vector<std::string> domains;
    for (const TesselItemIdentifier& identifier : identifiers) domains.push_back(identifier.substr(1));
    // Shared: the host may keep its completion for longer than the wait.
    const auto done = std::make_shared<DispatchSemaphore>(0);
    TesselManager::defaultManager().deleteSearchableItemsWithDomainIdentifiers(
        domains, [done, domains](const std::optional<KsError>& error) {
            if (error) {
                logError("can't delete searchable items from [{}]; {}", fmt::join(domains, ", "), error->description());
            } else {
                logDebug("items from domains [{}] removed from index", fmt::join(domains, ", "));
            }
            done->signal();
        });
    done->wait();
}

void LocalAppLibraryManager::take(Content content, std::uint64_t versionToken) {
    std::vector<KsURL> urls;
    std::vector<std::string> paths;
    for (const auto& [path, library] : content.bundleProxiesByRootURLs) {
        urls.push_back(library.rootURL);
        paths.push_back(path);
    }
    auto rootURLs = std::make_shared<const std::vector<KsURL>>(std::move(urls));
    // Held open before anybody hears of them: what is below one is reached from its descriptor alone.
    if (isShared_) RootDirectories::shared().addApplicationContainers(paths);
    queue_.sync([&] {
        queue_.assertCurrent();
        content_ = std::move(content);
        versionToken_ = versionToken;
        const MutexLock lock(rootURLsMutex_);
        rootURLs_ = std::move(rootURLs);
    });
}

void LocalAppLibraryManager::publishRoots() {
    std::vector<std::string> paths;
    for (const KsURL& url : *sharedRootURLs()) paths.push_back(url.path());
    RootDirectories::shared().setApplicationContainers(paths);
}

Result<void> LocalAppLibraryManager::saveToCache() {
    const LogSection section("saving bundle proxies to {}", cache().description());
    RoBundleProxies records;
    std::uint64_t token = 0;
    queue_.sync([&] {
        queue_.assertCurrent();
        for (const auto& [path, library] : content_.bundleProxiesByRootURLs) records.push_back(library.bundleProxy);
        token = versionToken_;
    });
    Result<std::uint64_t> saved(std::uint64_t{0});
    cache().queue().sync([&] { saved = cache().saveBundleProxies(records, token, /*incrementVersion=*/false); });
    if (!saved.ok()) return saved.error();
    return {};
}

std::shared_ptr<const LocalAppLibraryItem> LocalAppLibraryManager::itemForIdentifier(
    const TesselItemIdentifier& identifier) {
    std::shared_ptr<const LocalAppLibraryItem> item;
    queue_.sync([&] {
        queue_.assertCurrent();
        const auto found = content_.appLibrariesByItemIDs.find(identifier);
        if (found != content_.appLibrariesByItemIDs.end()) item = found->second;
    });
    return item;
}

std::shared_ptr<const RoBundleProxy> LocalAppLibraryManager::bundleProxyForRootURL(const KsURL& url) {
    std::shared_ptr<const RoBundleProxy> record;
    queue_.sync([&] {
        queue_.assertCurrent();
        const auto found = content_.bundleProxiesByRootURLs.find(url.path());
        if (found != content_.bundleProxiesByRootURLs.end()) record = found->second.bundleProxy;
    });
    return record;
}

TesselItems LocalAppLibraryManager::items() {
    TesselItems items;
    queue_.sync([&] {
        queue_.assertCurrent();
        for (const auto& [identifier, item] : content_.appLibrariesByItemIDs) items.push_back(item);
    });
    return items;
}

std::shared_ptr<const std::vector<KsURL>> LocalAppLibraryManager::sharedRootURLs() const {
    const MutexLock lock(rootURLsMutex_);
    return rootURLs_;
}

std::uint64_t LocalAppLibraryManager::versionToken() {
    std::uint64_t token = 0;
    queue_.sync([&] {
        queue_.assertCurrent();
        token = versionToken_;
    });
    return token;
}

std::string LocalAppLibraryManager::description() {
    std::uint64_t token = 0;
    std::size_t libraries = 0;
    queue_.sync([&] {
        queue_.assertCurrent();
        token = versionToken_;
        libraries = content_.appLibrariesByItemIDs.size();
    });
    return fmt::format("<LocalAppLibraryManager {}{} versionToken:{} cache-source:{} app-libraries:{}>", fmt::ptr(this),
                       isShared_ ? " SHARED" : "", token, cache().description(), libraries);
}

}  // namespace cindral
