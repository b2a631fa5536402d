#include "provider/LocalAppLibraryCache.h"

#include <fcntl.h>
#include <fmt/format.h>

#include <cerrno>
#include <limits>
#include <utility>

#include "platform/foundation/Fatal.h"
#include "platform/foundation/Files.h"
#include "platform/foundation/KeyedArchive.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/SetAside.h"
#include "platform/tessel/TesselManager.h"

namespace cindral {
namespace {

// Written to disk: never change one. The key of the list is singular; files with it are out there.
constexpr const char* kFolderName = "Cindral Storage";
constexpr const char* kVersionTokenKey = "versionToken";
constexpr const char* kBundleProxyKey = "bundleProxy";

struct SourceNames {
    const char* description;
    const char* file;
    const char* queue;
};
constexpr SourceNames kMainNames{"main cache", "app-libraries.plist", "cindral.app-library-cache.main"};
constexpr SourceNames kWorkingSetNames{"working-set cache", "searchable-app-libraries.plist",
                                       "cindral.app-library-cache.working-set"};

const SourceNames& namesOf(LocalAppLibraryCacheSource source) {
    switch (source) {
        case LocalAppLibraryCacheSource::main: return kMainNames;
        case LocalAppLibraryCacheSource::workingSet: return kWorkingSetNames;
    }
    fatal("no such source of app libraries");
}

struct SharedCaches {
    Mutex mutex;
    std::shared_ptr<LocalAppLibraryCache> main GUARDED_BY(mutex);
    std::shared_ptr<LocalAppLibraryCache> workingSet GUARDED_BY(mutex);

    static SharedCaches& instance() {
        static SharedCaches& caches = *new SharedCaches;
        return caches;
    }
};

/// Objects of archived classes other than the record's are not decoded, wherever they stand.
bool hasOnlyAllowedClasses(const PropertyList& value) {
    if (const auto* array = value.array()) {
        for (const PropertyList& each : *array) {
            if (!hasOnlyAllowedClasses(each)) return false;
        }
    }
    const std::string* name = RoBundleProxy::archivedClassOf(value);
    if (name != nullptr) return *name == RoBundleProxy::kArchivedClass;
    if (const auto* dictionary = value.dictionary()) {
        for (const auto& [key, each] : *dictionary) {
            if (!hasOnlyAllowedClasses(each)) return false;
        }
    }
    return true;
}

/// Whether the archive can be read, and is of something else than a cache.
bool isOfSomethingElse(const keyed_archive::Unarchived& archive) {
    if (archive.root && !hasOnlyAllowedClasses(*archive.root)) return false;
    return !archive.root || !archive.root->dictionary() || RoBundleProxy::archivedClassOf(*archive.root) != nullptr;
}

std::optional<RoBundleProxies> bundleProxiesIn(const PropertyList* value) {
    if (value == nullptr || value->array() == nullptr) return std::nullopt;
    RoBundleProxies proxies;
    for (const PropertyList& each : *value->array()) {
        auto proxy = RoBundleProxy::unarchived(each);
        if (!proxy) return std::nullopt;
        proxies.push_back(std::move(proxy));
    }
    return proxies;
}

}  // namespace

std::string_view descriptionOf(LocalAppLibraryCacheSource source) {
    return namesOf(source).description;
}

std::shared_ptr<LocalAppLibraryCache> LocalAppLibraryCache::shared(LocalAppLibraryCacheSource source) {
    SharedCaches& caches = SharedCaches::instance();
    const MutexLock lock(caches.mutex);
    auto& cache = source == LocalAppLibraryCacheSource::main ? caches.main : caches.workingSet;
    if (!cache)
        cache = std::make_shared<LocalAppLibraryCache>(source, TesselManager::defaultManager().applicationSupportURL());
    return cache;
}

void LocalAppLibraryCache::forgetShared() {
    SharedCaches& caches = SharedCaches::instance();
    const MutexLock lock(caches.mutex);
    caches.main.reset();
    caches.workingSet.reset();
}

LocalAppLibraryCache::LocalAppLibraryCache(LocalAppLibraryCacheSource source, const KsURL& applicationSupport)
    : source_(source),
      cacheURL_(applicationSupport.appendingPathComponent(kFolderName).appendingPathComponent(namesOf(source).file)),
      queue_(namesOf(source).queue) {}

std::uint64_t LocalAppLibraryCache::versionToken() {
    std::uint64_t token = 0;
    queue_.sync([&] {
        queue_.assertCurrent();
        token = versionToken_;
    });
    return token;
}

Result<Bytes> LocalAppLibraryCache::readFile() const {
    Result<Bytes> bytes = files::readAll(cacheURL_.path(), kBytesMax);
    if (!bytes.ok() && bytes.error().isPosix(ENOENT)) return KsError(kKsGeneralErrorDomain, kKsFileNoSuchFileError);
    return bytes;
}

LocalAppLibraryCache::Loaded LocalAppLibraryCache::loadBundleProxies() {
    queue_.assertCurrent();
    const Result<Bytes> bytes = readFile();
    if (!bytes.ok()) {
        if (bytes.error().is(kKsGeneralErrorDomain, kKsFileNoSuchFileError)) {
            logDebug("nothing cached on disk");
        } else {
            logError("can't load cache from disk let's reset; {}", bytes.error().description());
        }
        return {};
    }
    logDebug("read from disk {} bytes at {}", bytes->size(), cacheURL_.path());
    const auto archive = keyed_archive::unarchive(*bytes);
    if (!archive || (archive->root && !hasOnlyAllowedClasses(*archive->root))) return {};
    if (isOfSomethingElse(*archive)) {
        fatal(fmt::format("the {} at {} is an archive of something else; remove that file, and it is made anew",
                          description(), cacheURL_.path()));
    }
    return loadFrom(*archive->root->dictionary());
}

Result<std::optional<std::string>> LocalAppLibraryCache::setAsideWhatStops() const {
    if (auto aside = TRY(setAsideUnless(cacheURL_.path(), ExpectedKind::file))) return aside;
    const Result<Bytes> bytes = readFile();
    const auto archive = bytes.ok() ? keyed_archive::unarchive(*bytes) : std::nullopt;
    if (!archive) return std::optional<std::string>();
    const auto* root = archive->root ? archive->root->dictionary() : nullptr;
    const auto token = root != nullptr ? root->find(kVersionTokenKey) : PropertyList::Dictionary::const_iterator();
    // Such a version can have no successor.
    const bool isUsedUp = root != nullptr && token != root->end() && token->second.unsignedInteger() != nullptr &&
                          *token->second.unsignedInteger() == std::numeric_limits<std::uint64_t>::max();
    if (!isUsedUp && !isOfSomethingElse(*archive)) return std::optional<std::string>();
    return std::optional(TRY(setAside(cacheURL_.path())));
}

LocalAppLibraryCache::Loaded LocalAppLibraryCache::loadFrom(const PropertyList::Dictionary& root) {
    const auto token = root.find(kVersionTokenKey);
    if (token == root.end() || token->second.unsignedInteger() == nullptr) {
        logDebug("version token invalid; data on disk is corrupted let's reset");
        return {};
    }
    const auto list = root.find(kBundleProxyKey);
    auto proxies = bundleProxiesIn(list == root.end() ? nullptr : &list->second);
    if (!proxies) {
        logDebug("bundle proxies invalid; data on disk is corrupted let's reset");
        return {};
    }
    logDebug("loaded {} app library items from data", proxies->size());
    const std::uint64_t loaded = *token->second.unsignedInteger();
    if (versionToken_ < loaded) {
        versionToken_ = loaded;
        logDebug("version token was set to {} after load", loaded);
    }
    return {loaded, *std::move(proxies)};
}

Result<std::uint64_t> LocalAppLibraryCache::saveBundleProxies(const RoBundleProxies& bundleProxies,
                                                              std::uint64_t versionToken, bool incrementVersion) {
    queue_.assertCurrent();
    TRY(files::makeFolders(cacheURL_.deletingLastPathComponent()->path()));
    if (incrementVersion) {
        if (versionToken_ == std::numeric_limits<std::uint64_t>::max()) fatal("app library versions are used up");
        versionToken = versionToken_ + 1;
    }
    PropertyList::Array list;
    for (const auto& proxy : bundleProxies) list.push_back(proxy->archived());
    const Bytes bytes = keyed_archive::archive(
        PropertyList::Dictionary{{kVersionTokenKey, versionToken}, {kBundleProxyKey, std::move(list)}});
    TRY(files::replace(cacheURL_.path(), bytes));
    logDebug("wrote on disk {} bytes at {}", bytes.size(), cacheURL_.path());
    versionToken_ = versionToken;
    return versionToken;
}

}  // namespace cindral
