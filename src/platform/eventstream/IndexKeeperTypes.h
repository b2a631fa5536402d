#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/eventstream/IndexKeeper.h"

// What the parts of IndexKeeper share.

namespace cindral {

/// A folder of the index, open for reading. The descriptor keeps its number from being given to another.
struct IndexKeeper::OpenFolder : std::enable_shared_from_this<OpenFolder> {
    UniqueFd fd;
    FileID fileID{};
    std::string path;  ///< below the root, as of when it was opened
    const Root* root = nullptr;
    bool stampsAreDistinct = false;
};

struct IndexKeeper::Known {
    IndexedObject object;  ///< without the name
    std::string name;

    bool isFolder() const { return object.kind == ObjectKind::folder || object.kind == ObjectKind::package; }
    bool isSame(FileID fileID, std::int64_t birthTime) const {
        return object.fileID == fileID && object.birthTime == birthTime;
    }
    bool isAt(FileID parent, std::string_view at) const { return object.parent == parent && name == at; }
};

struct IndexKeeper::BatchEntry {
    const char* name = nullptr;  ///< in the batch's `names`
    bool mayBeFolder = false;
    bool isEntered = false;  ///< a folder that the walk comes to by itself
    bool isMatched = false;  ///< the index has it as it is
    bool isSeen = false;     ///< `status` is of it; else it is gone, or not ours to look at
    FileStatus status = {};
};

/// Entries of a folder as they were just read, some of them or all.
struct IndexKeeper::Batch {
    std::shared_ptr<OpenFolder> folder;  ///< null when it can't be opened
    Subfolder place;                     ///< of a folder that can't be opened
    std::optional<KsError> error;        ///< why it can't be opened, or not read any further
    Result<void> watched;                ///< with the first of a folder
    bool isFirst = false;
    bool isLast = false;
    bool sawAll = true;  ///< false when an entry could not be looked at
    std::vector<BatchEntry> entries;
    std::unique_ptr<std::byte[]> names;
};

/// What was found of a folder so far.
struct IndexKeeper::Comparison {
    std::uint64_t recorded = 0;            ///< entries that the index has in it
    std::uint64_t recordedHere = 0;        ///< of those that were seen
    std::vector<std::uint64_t> seen = {};  ///< file IDs of all of them
    std::vector<FileID> fileIDs = {};      ///< of the batch
    bool sawAll = true;
};

struct IndexKeeper::Departure {
    FileID parent{};
    std::string name;
    FileID fileID{};
    std::int64_t birthTime = 0;
    std::uint64_t round = 0;
};

struct IndexKeeper::Replacement {
    FileID parent{};
    std::string name;
    FileID newcomer{};
};

struct IndexKeeper::Vacancy {
    FileID parent{};
    std::string name;
    DocumentID document{};
    std::int64_t birthOfParent = 0;
};

struct IndexKeeper::Context {
    FileID root{};
    bool isInTrash = false;
    std::vector<FileID> packages;  ///< those that the folder is or lies in

    /// Whether what is in the one folder shows otherwise in the other.
    bool differsFrom(const Context& other) const {
        return root != other.root || isInTrash != other.isInTrash || packages.empty() != other.packages.empty();
    }
};

namespace index_keeper {

/// Folders from one to its root, at most: while folders are on their way to their places, the index may have one below
/// another and that one below it.
inline constexpr std::size_t kLevelsMax = 4'096;

/// A time as the index has it: never 0, which says that nobody looked.
inline std::int64_t stampOf(const KsDate& time) {
    const auto stamp =
        static_cast<std::int64_t>(static_cast<std::uint64_t>(time.seconds) * 1'000'000'000 + time.nanoseconds);
    return stamp == 0 ? -1 : stamp;
}
inline std::uint64_t sizeOf(const FileStatus& status) {
    return status.isDirectory() ? 0 : status.size;
}
ObjectKind kindOf(const FileStatus& status, std::string_view name);
/// A path below a root; the root's own is empty.
std::string joined(std::string_view folder, std::string_view name);

}  // namespace index_keeper

}  // namespace cindral
