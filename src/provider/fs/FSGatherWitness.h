#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/RootDirectories.h"

namespace cindral {

/// Remembers the folders that the listings of this process have read, and tells whether they are still what they were.
///
/// A listing bears the event ID that it began with. Two listings of the same directories that saw different contents never bear the same
/// one: when the second begins, what the first saw no longer holds, and the event position moves on.
///
/// Thread safety: all operations, from any thread.
class FSGatherWitness {
public:
    static FSGatherWitness& shared();

    /// The event ID that a listing of the directories begins with.
    std::uint64_t begin(const std::vector<KsURL>& urls);
    /// The listing read this folder, which was in this state before its first entry was read.
    void sawFolder(const std::vector<KsURL>& urls, std::uint64_t eventID, const DirectoryReference& folder);
    /// True when every folder that the listing has read is unchanged; false when one changed, or nothing is known of such a listing.
    bool holds(const std::vector<KsURL>& urls, std::uint64_t eventID);

private:
    struct SeenFolder {
        FileStatus status;
        bool provable = true;  ///< a change right after it was seen would show in its times
    };
    struct Listing {
        std::string key;
        std::uint64_t lastUse = 0;
        std::unordered_map<std::string, SeenFolder> folders;
    };
    static std::string keyOf(const std::vector<KsURL>& urls, std::uint64_t eventID);
    static bool isUnchanged(const Listing& listing);
    Listing* find(const std::string& key) REQUIRES(mutex_);

    Mutex mutex_;
    std::map<std::string, Listing> listings_ GUARDED_BY(mutex_);
    std::uint64_t uses_ GUARDED_BY(mutex_) = 0;
};

}  // namespace cindral
