#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/Result.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// An object and where it is now.
struct FoundObject {
    std::shared_ptr<const RootDirectory> root;
    std::string relativePath;  ///< empty for the root itself
    FileStatus status;
    bool isRecorded = false;  ///< it is where the records say

    std::string path() const { return relativePath.empty() ? root->path : root->path + "/" + relativePath; }
};

/// Finds an object by its file number: the store's records first, then the file system itself.
///
/// A path is handed out only after the object at it was seen to have the number. In order: the recorded parents (about
/// a microsecond, and one look); a file handle, where the process may open one by number alone; reading the folders
/// below the roots, which costs what the tree costs and is how an object is found that was moved by others since it was
/// last seen.
///
/// Thread safety: all operations, from any thread.
class ObjectFinder {
public:
    /// `store` is borrowed for life. Only roots of the device are looked at.
    ObjectFinder(const VolumeStore& store, std::uint32_t device);

    /// What was found where the records did not have it is to be recorded: record().
    ///
    /// ENOENT when nothing below the roots has the number; ESTALE when it was found and had moved again before it could
    /// be checked.
    Result<FoundObject> find(FileID fileID) const;

    /// Records where a folder is, and every folder above it, unless the store knows already. For folders outside of the
    /// roots nothing is done.
    Result<void> recordFolder(VolumeStore& store, const std::string& path, const FileStatus& status) const;
    Result<void> record(VolumeStore& store, const FoundObject& object) const;

    /// Where the records say, if the object is there; any error otherwise.
    Result<FoundObject> findByRecords(FileID fileID) const;

private:
    Result<FoundObject> findByHandle(FileID fileID) const;
    Result<FoundObject> findByReading(FileID fileID) const;
    Result<FoundObject> check(std::shared_ptr<const RootDirectory> root, std::string relativePath, FileID fileID) const;
    const VolumeStore& store_;
    std::vector<std::shared_ptr<const RootDirectory>> roots_;
    std::vector<FileID> rootIDs_;  ///< of roots_, in the same order
};

/// What a listing says of an object, for the store.
ObjectKind objectKindOf(const FileStatus& status, bool isPackage);

}  // namespace cindral
