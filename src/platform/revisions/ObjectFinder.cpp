#include "platform/revisions/ObjectFinder.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/magic.h>
#include <linux/openat2.h>
#include <sys/vfs.h>

#include <cerrno>
#include <cstring>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/TypeDatabase.h"

namespace cindral {

namespace {

constexpr int kFindFlags = O_PATH | O_NOFOLLOW;

std::string joined(std::string_view folder, std::string_view name) {
    std::string path(folder);
    if (!path.empty()) path += '/';
    path += name;
    return path;
}

/// A handle by which ext4 opens an object by number: its kind for a number and a generation, of which 0 stands for any.
struct NumberHandle {
    // The C library's file_handle ends in a flexible array; this is the same in one piece.
    unsigned size = 8;
    int type = 1;
    std::uint32_t number = 0;
    std::uint32_t generation = 0;
};

Result<UniqueFd> openByNumber(int mountDirectory, FileID fileID) {
    struct statfs fileSystem;
    if (::fstatfs(mountDirectory, &fileSystem) != 0) return KsError::errorWithPOSIXCode();
    if (fileSystem.f_type != EXT4_SUPER_MAGIC || static_cast<std::uint64_t>(fileID) > UINT32_MAX)
        return KsError::posix(EOPNOTSUPP);
    NumberHandle handle;
    handle.number = static_cast<std::uint32_t>(fileID);
    const int fd =
        ::open_by_handle_at(mountDirectory, reinterpret_cast<file_handle*>(&handle), O_PATH | O_NOFOLLOW | O_CLOEXEC);
    if (fd < 0) return KsError::errorWithPOSIXCode();
    return UniqueFd(fd);
}

}  // namespace

ObjectKind objectKindOf(const FileStatus& status, bool isPackage) {
    if (status.isRegular()) return ObjectKind::file;
    if (!status.isDirectory()) return ObjectKind::other;
    return isPackage ? ObjectKind::package : ObjectKind::folder;
}

ObjectFinder::ObjectFinder(const VolumeStore& store, std::uint32_t device) : store_(store) {
    for (auto& root : RootDirectories::shared().all()) {
        if (root->status.deviceID() != device) continue;
        rootIDs_.push_back(FileID{root->status.fileID});
        roots_.push_back(std::move(root));
    }
}

Result<FoundObject> ObjectFinder::check(std::shared_ptr<const RootDirectory> root, std::string relativePath,
                                        FileID fileID) const {
    // No link is part of a path that leads to an object by its parents; one that is there now was put there since.
    const UniqueFd fd = TRY(sys::openBeneath(root->fd.get(), relativePath, kFindFlags, RESOLVE_NO_SYMLINKS));
    const FileStatus status = TRY(sys::statx(fd.get(), ""));
    if (FileID{status.fileID} != fileID || status.device != root->status.device) return KsError::posix(ESTALE);
    return FoundObject{std::move(root), std::move(relativePath), status};
}

Result<FoundObject> ObjectFinder::find(FileID fileID) const {
    Result<FoundObject> found = findByRecords(fileID);
    if (found.ok()) return found;
    found = findByHandle(fileID);
    if (!found.ok() && (found.error().isPosix(ESTALE) || found.error().isPosix(ENOENT))) return KsError::posix(ENOENT);
    return found.ok() ? found : findByReading(fileID);
}

Result<FoundObject> ObjectFinder::findByRecords(FileID fileID) const {
    std::optional<VolumeStore::RecordedPath> recorded = store_.recordedPath(fileID, rootIDs_);
    if (!recorded) return KsError::posix(ENOENT);
    FoundObject found = TRY(check(roots_[recorded->rootIndex], std::move(recorded->path), fileID));
    found.isRecorded = true;
    return found;
}

/// ENOENT and ESTALE say for certain that there is no such object; any other error, that this is no way to find out.
Result<FoundObject> ObjectFinder::findByHandle(FileID fileID) const {
    for (const auto& root : roots_) {
        const UniqueFd fd = TRY(openByNumber(root->fd.get(), fileID));
        const std::string objectPath = TRY(sys::pathOfDescriptor(fd.get()));
        const std::string rootPath = TRY(sys::pathOfDescriptor(root->fd.get()));
        // "/" comes back, without an error, for a file whose directory entry is not cached.
        if (!objectPath.starts_with(rootPath) || objectPath.size() <= rootPath.size() + 1 ||
            objectPath[rootPath.size()] != '/')
            continue;
        Result<FoundObject> found = check(root, objectPath.substr(rootPath.size() + 1), fileID);
        if (found.ok()) return found;
    }
    return KsError::posix(EAGAIN);
}

Result<FoundObject> ObjectFinder::findByReading(FileID fileID) const {
    // One at a time: who asks for many numbers that nothing has must not keep every thread reading.
    static Mutex& reading = *new Mutex;
    const MutexLock lock(reading);
    bool moved = false;
    alignas(8) std::byte buffer[32'768];
    for (const auto& root : roots_) {
        std::vector<std::string> folders{""};
        while (!folders.empty()) {
            const std::string folder = std::move(folders.back());
            folders.pop_back();
            const Result<UniqueFd> fd =
                sys::openDirectoryBeneath(root->fd.get(), folder, RESOLVE_NO_SYMLINKS | RESOLVE_NO_XDEV);
            if (!fd.ok()) continue;  // Gone since, unreadable, or of another device: nothing in it can be told.
            while (true) {
                const Result<std::size_t> size = sys::getdents(fd->get(), buffer);
                if (!size.ok() || *size == 0) break;
                for (std::size_t at = 0; at < *size;) {
                    const auto* entry = reinterpret_cast<const DirectoryRecord*>(buffer + at);
                    at += entry->length;
                    if (entry->isDots()) continue;
                    if (FileID{entry->fileID} == fileID) {
                        Result<FoundObject> found = check(root, joined(folder, entry->name), fileID);
                        if (found.ok()) return found;
                        moved = true;  // Or another object's number, which layered file systems show here.
                    }
                    if (entry->type == DT_DIR || entry->type == DT_UNKNOWN)
                        folders.push_back(joined(folder, entry->name));
                }
            }
        }
    }
    return KsError::posix(moved ? ESTALE : ENOENT);
}

Result<void> ObjectFinder::record(VolumeStore& store, const FoundObject& object) const {
    const std::size_t slash = object.relativePath.rfind('/');
    const bool atTop = slash == std::string::npos;
    const std::string parentPath = atTop ? "" : object.relativePath.substr(0, slash);
    const std::string name = atTop ? object.relativePath : object.relativePath.substr(slash + 1);
    if (name.empty()) return {};  // The root itself ends every chain.
    const UniqueFd parent =
        TRY(sys::openBeneath(object.root->fd.get(), parentPath, O_PATH | O_DIRECTORY, RESOLVE_NO_SYMLINKS));
    const FileStatus parentStatus = TRY(sys::statx(parent.get(), ""));
    TRY(recordFolder(store, parentPath.empty() ? object.root->path : object.root->path + "/" + parentPath,
                     parentStatus));

    ObjectSighting sighting;
    sighting.fileID = FileID{object.status.fileID};
    sighting.birthTime = object.status.birthStamp();
    sighting.parent = FileID{parentStatus.fileID};
    sighting.kind =
        objectKindOf(object.status, object.status.isDirectory() && TypeDatabase::shared().isPackageName(name));
    sighting.name = name;
    return store.identify({&sighting, 1});
}

Result<void> ObjectFinder::recordFolder(VolumeStore& store, const std::string& path, const FileStatus& folder) const {
    const auto root = RootDirectories::shared().rootHolding(path);
    if (!root || path.size() <= root->path.size()) return {};
    const std::string relative = path.substr(root->path.size() + 1);
    const auto recorded = store_.recordedPath(FileID{folder.fileID}, rootIDs_);
    if (recorded && recorded->path == relative && recorded->birthTime == folder.birthStamp() &&
        roots_[recorded->rootIndex] == root)
        return {};

    std::vector<ObjectSighting> sightings;
    FileID parent{root->status.fileID};
    for (std::size_t begin = 0; begin < relative.size();) {
        const std::size_t end = std::min(relative.find('/', begin), relative.size());
        const UniqueFd fd =
            TRY(sys::openBeneath(root->fd.get(), std::string_view(relative).substr(0, end), kFindFlags));
        const FileStatus status = TRY(sys::statx(fd.get(), ""));
        ObjectSighting sighting;
        sighting.fileID = FileID{status.fileID};
        sighting.birthTime = status.birthStamp();
        sighting.parent = parent;
        sighting.name = std::string_view(relative).substr(begin, end - begin);
        sighting.kind =
            objectKindOf(status, status.isDirectory() && TypeDatabase::shared().isPackageName(sighting.name));
        parent = sighting.fileID;
        sightings.push_back(sighting);
        begin = end + 1;
    }
    return store.identify(sightings);
}

}  // namespace cindral
