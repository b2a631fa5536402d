#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/eventstream/IndexKeeper.h"

// What the parts of IndexKeeper share.

namespace cindral {

/// A folder of the index, open for reading. The descriptor keeps its number from being given to another.
struct IndexKeeper::OpenFolder {
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
    DocumentID document{};
    FileID newcomer{};
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

}  // namespace index_keeper

}  // namespace cindral
