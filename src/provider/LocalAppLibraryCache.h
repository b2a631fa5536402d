#pragma once

#include <cstdint>
#include <memory>
#include <string_view>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/PropertyList.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/roster/Roster.h"

namespace cindral {

/// The records of applications, in an order that counts.
using RoBundleProxies = std::vector<std::shared_ptr<const RoBundleProxy>>;

enum class LocalAppLibraryCacheSource {
    main,        ///< the newest list that is known: written by looking at the registry
    workingSet,  ///< the list that was last published to observers and to the search index
};
/// "main cache", "working-set cache".
std::string_view descriptionOf(LocalAppLibraryCacheSource source);

/// The list of applications that publish their documents, on disk, with a version that grows when the list changes.
///
/// A list of the main cache has a version of its own; the working set's cache bears the version of the main cache's list
/// that it is. Comparing the two tells that what was published is out of date.
///
/// Format: docs/app-library-cache.md.
///
/// Thread safety: loading and saving on the queue; all else from any thread.
class LocalAppLibraryCache {
public:
    /// Bytes of a cache that are worth reading.
    static constexpr std::size_t kBytesMax = 64 * 1'048'576;

    /// The process's own, made at first use in the manager's application-support folder.
    static std::shared_ptr<LocalAppLibraryCache> shared(LocalAppLibraryCacheSource source);
    /// Has them made anew at the next use, as a new process would. For tests.
    static void forgetShared();

    LocalAppLibraryCache(LocalAppLibraryCacheSource source, const KsURL& applicationSupport);

    /// Sets aside a file that would stop the process when it is loaded, and what is no file. Answers the new path; none
    /// where there is nothing of the kind.
    Result<std::optional<std::string>> setAsideWhatStops() const;

    SerialQueue& queue() { return queue_; }
    std::string_view description() const { return descriptionOf(source_); }
    const KsURL& cacheURL() const { return cacheURL_; }
    /// The highest version that was loaded or written by this process; 0 at first. Waits for the queue.
    std::uint64_t versionToken();

    struct Loaded {
        std::uint64_t versionToken = 0;
        RoBundleProxies bundleProxies;
    };
    /// On the queue; elsewhere it stops the process. What can't be read, and what is no cache, is version 0 without
    /// records; the file stays, and the next save replaces it. A keyed archive of something else than a dictionary stops
    /// the process: a cache that anything may be in would be overwritten silently.
    Loaded loadBundleProxies();
    /// On the queue; elsewhere it stops the process. Writes the version, or, to increment it, the one after
    /// versionToken(); answers what it wrote. After an error, all is as it was.
    Result<std::uint64_t> saveBundleProxies(const RoBundleProxies& bundleProxies, std::uint64_t versionToken,
                                            bool incrementVersion);

private:
    Result<Bytes> readFile() const;
    Loaded loadFrom(const PropertyList::Dictionary& root) REQUIRES(queue_);

    // Constant after construction.
    const LocalAppLibraryCacheSource source_;
    const KsURL cacheURL_;

    SerialQueue queue_;
    std::uint64_t versionToken_ GUARDED_BY(queue_) = 0;
};

}  // namespace cindral
