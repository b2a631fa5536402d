#pragma once

#include <cstdint>
#include <list>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/foundation/KsDate.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// Where a scan stood in one directory.
struct DirectoryPosition {
    std::string path;
    std::uint64_t fileID = 0;
    std::uint64_t device = 0;
    KsDate modificationTime;  ///< with the change time: the directory is the same only while both are
    KsDate changeTime;
    std::int64_t options = 0;
    std::int64_t nextOffset = 0;  ///< lseek() position after the last entry consumed
    std::string lastName;         ///< of the last entry consumed: some file systems return it again at that position
};

/// Where a scan stood: the directories from the top one to the innermost, and which of the listed directories the top
/// one is.
struct ListingPosition {
    std::size_t urlIndex = 0;
    std::vector<DirectoryPosition> directories;
};

/// The positions at which recent pages of listings ended, by the number of entries consumed.
///
/// A hint: whoever uses one checks that the directories are what they were. The oldest goes when there are too many.
///
/// Thread safety: all operations, from any thread.
class FSListingPositions {
public:
    static FSListingPositions& shared();

    explicit FSListingPositions(std::size_t capacity) : capacity_(capacity) {}
    void put(const std::string& key, std::uint64_t offset, ListingPosition position);
    std::shared_ptr<const ListingPosition> find(const std::string& key, std::uint64_t offset);
    void removeAll();

private:
    struct Entry {
        std::string key;
        std::shared_ptr<const ListingPosition> position;
    };
    static std::string fullKey(const std::string& key, std::uint64_t offset);

    const std::size_t capacity_;
    Mutex mutex_;
    std::list<Entry> newestFirst_ GUARDED_BY(mutex_);
    std::unordered_map<std::string, std::list<Entry>::iterator> byKey_ GUARDED_BY(mutex_);
};

}  // namespace cindral
