#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/KsUUID.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/Sys.h"

namespace cindral {

/// Remembers the folders that the listings of this process have read, and tells whether they are still what they were.
///
/// A listing that goes on beyond its first page bears an event ID. Two listings of the same directories that saw
/// different contents never bear the same one: when the second is named, what the first saw no longer holds, and the
/// event position moves on. It also moves on before a process names its first listing, so that what an earlier process
/// named is never taken for a listing of this one.
///
/// The listed directories themselves are held to their modification and change times. What lies below them is watched,
/// so that the question costs the same however many folders were read; where the watch limit is reached, the rest is
/// held to its times.
///
/// Thread safety: all operations, from any thread.
class FSGatherWitness {
public:
    static FSGatherWitness& shared();

    /// The event ID of a listing of the directories whose first page read these folders.
    Result<std::uint64_t> begin(const std::vector<KsURL>& urls, std::span<const DirectoryReference* const> folders);
    /// The listing read these folders, too.
    void sawFolders(const std::vector<KsURL>& urls, std::uint64_t eventID,
                    std::span<const DirectoryReference* const> folders);
    /// True when every folder that the listing has read is unchanged; false when one changed, or nothing is known of
    /// such a listing.
    bool holds(const std::vector<KsURL>& urls, std::uint64_t eventID);

private:
    struct Listing {
        std::uint64_t lastUse = 0;
        bool changed = false;
        std::unordered_set<std::uint64_t> folders;                     ///< file IDs of all that were seen
        std::unordered_map<std::string, FileStatus> heldToTheirTimes;  ///< by path
        std::vector<int> watches;
    };
    static std::string keyOf(const std::vector<KsURL>& urls, std::uint64_t eventID);
    Listing* find(const std::string& key) REQUIRES(mutex_);
    void see(Listing& listing, const std::vector<KsURL>& urls, const DirectoryReference& folder) REQUIRES(mutex_);
    bool watch(Listing& listing, const DirectoryReference& folder) REQUIRES(mutex_);
    bool isUnchanged(const Listing& listing) REQUIRES(mutex_);
    void drain() REQUIRES(mutex_);
    void removeOldest() REQUIRES(mutex_);

    Mutex mutex_;
    std::map<std::string, Listing> listings_ GUARDED_BY(mutex_);
    std::uint64_t uses_ GUARDED_BY(mutex_) = 0;
    std::size_t watches_ GUARDED_BY(mutex_) = 0;        ///< of all listings
    std::optional<KsUUID> namedIn_ GUARDED_BY(mutex_);  ///< volume of the first listing that was named
    sys::DirectoryWatch watch_ GUARDED_BY(mutex_);
    std::unordered_map<int, std::vector<Listing*>> watchers_
        GUARDED_BY(mutex_);  ///< listings in listings_, which never move
};

}  // namespace cindral
