#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/roster/Roster.h"
#include "platform/tessel/TesselEnumerator.h"
#include "provider/LocalAppLibraryCache.h"
#include "provider/LocalAppLibraryItem.h"

namespace cindral {

/// A version of the list of app libraries: one item for each application that qualifies and whose folder is there.
///
/// A manager stays at the version that it was loaded with until it is upgraded to the main cache's. The process's own,
/// which the provider keeps up to date, says which folders are published: the root directories follow it.
///
/// Thread safety: all operations, from any thread.
class LocalAppLibraryManager {
public:
    /// The process's own, of the working set's cache, loaded at first use.
    static std::shared_ptr<LocalAppLibraryManager> shared();
    /// Has it made anew at the next use, and its folders not published meanwhile. For tests.
    static void forgetShared();
    /// One of the caller's own, loaded from the cache.
    static std::shared_ptr<LocalAppLibraryManager> create(LocalAppLibraryCacheSource source);
    LocalAppLibraryManager(const LocalAppLibraryManager&) = delete;
    LocalAppLibraryManager& operator=(const LocalAppLibraryManager&) = delete;

    /// The queue on which the registry is looked at ("cindral.app-library.background").
    static SerialQueue& backgroundQueue();
    /// Reads the registry into the main cache. Whether that changed: another application, or another order, is a change.
    const std::string& queueLabel() const { return queue_.label(); }
    /// Waits for the background queue, unless it is on it.
    static bool refreshAppLibraries();
    /// Adds the record to the list when it is an application's, whose documents are published.
    static void addIfQualified(const std::shared_ptr<const RoBundleProxy>& record, RoBundleProxies& list);

    /// Whether there was another list to take. Its items and the identifiers that are gone are told to the observer, if
    /// there is one, before it returns; so is the search index, whose answer is waited for.
    bool upgradeFromMainCache(TesselChangeObserver* observer, bool deleteIndexOfRemovedDomains);
    /// Writes the manager's records and version to its cache.
    Result<void> saveToCache();
    /// Has the root directories hold the folders of this manager, each opened anew where another took its place. Of the
    /// process's own.
    void publishRoots();

    /// Null when there is none.
    std::shared_ptr<const LocalAppLibraryItem> itemForIdentifier(const TesselItemIdentifier& identifier);
    std::shared_ptr<const RoBundleProxy> bundleProxyForRootURL(const KsURL& url);
    /// In the order of their identifiers.
    TesselItems items();
    std::vector<KsURL> rootURLs() const { return *sharedRootURLs(); }
    /// The same without a copy or a wait, for what is asked for every item.
    std::shared_ptr<const std::vector<KsURL>> sharedRootURLs() const;
    std::uint64_t versionToken();
    LocalAppLibraryCacheSource cacheSource() const { return cacheSource_; }
    /// For log lines.
    std::string description();

private:
    struct Library {
        KsURL rootURL;
        std::shared_ptr<const RoBundleProxy> bundleProxy;
    };
    struct Content {
        std::map<TesselItemIdentifier, std::shared_ptr<const LocalAppLibraryItem>> appLibrariesByItemIDs;
        std::map<std::string, Library> bundleProxiesByRootURLs;  ///< by path
        /// Of records that no item could be made from: clients may have been told of one when it could.
        std::set<TesselItemIdentifier> identifiersWithoutItem;
    };

    LocalAppLibraryManager(LocalAppLibraryCacheSource source, bool isShared);
    static void add(const std::shared_ptr<const RoBundleProxy>& record, std::shared_ptr<const LocalAppLibraryItem> item,
                    Content& content);
    static Content contentOf(const RoBundleProxies& records);
    static void deleteIndexOf(const std::vector<TesselItemIdentifier>& identifiers);
    std::vector<TesselItemIdentifier> identifiersMissingFrom(const Content& content);
    void take(Content content, std::uint64_t versionToken);
    LocalAppLibraryCache& cache() const { return *cache_; }

    // Constant after construction.
    const LocalAppLibraryCacheSource cacheSource_;
    const bool isShared_;
    const std::shared_ptr<LocalAppLibraryCache> cache_;
    const std::shared_ptr<LocalAppLibraryCache> mainCache_;

    mutable Mutex rootURLsMutex_;
    std::shared_ptr<const std::vector<KsURL>> rootURLs_ GUARDED_BY(rootURLsMutex_);  ///< those of content_

    SerialQueue queue_{"cindral.app-library-manager"};
    std::uint64_t versionToken_ GUARDED_BY(queue_) = 0;
    Content content_ GUARDED_BY(queue_);
};

/// What the conversion of identifiers asks of the app libraries.
///
/// Thread safety: all operations, from any thread.
struct CdlAppLibraryManager {
    /// The root of every app library, in no particular order.
    static std::vector<KsURL> rootURLsForAppLibraries() { return LocalAppLibraryManager::shared()->rootURLs(); }
    /// The same without a copy.
    static std::shared_ptr<const std::vector<KsURL>> sharedRootURLsForAppLibraries() {
        return LocalAppLibraryManager::shared()->sharedRootURLs();
    }
};

}  // namespace cindral
