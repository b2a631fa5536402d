#pragma once

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/foundation/Data.h"
#include "platform/foundation/KsDate.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// Which object a status is of. Its number alone is given again to another object as soon as it is gone.
struct ObjectIdentity {
    std::uint64_t fileID = 0;
    std::uint64_t device = 0;     ///< st_dev; valid until the next boot only
    std::int64_t birthStamp = 0;  ///< 0 where the file system has none

    friend bool operator==(const ObjectIdentity&, const ObjectIdentity&) = default;
};

/// What one statx says of an object. Never of what a link points to.
struct FileStatus {
    std::uint64_t fileID = 0;
    std::uint64_t device = 0;      ///< st_dev; valid until the next boot only
    std::uint64_t mount = 0;       ///< of which of the process's mounts it was asked; 0 where the kernel doesn't tell
    std::uint64_t size = 0;        ///< bytes
    std::uint64_t attributes = 0;  ///< STATX_ATTR_ bits
    KsDate modificationTime;
    KsDate changeTime;
    std::optional<KsDate> birthTime;
    mode_t mode = 0;
    uid_t owner = 0;
    gid_t group = 0;
    std::uint32_t names = 1;  ///< hard links
    KsDate accessTime;
    dev_t specialDevice = 0;  ///< what a device node stands for

    bool isDirectory() const { return S_ISDIR(mode); }
    bool isRegular() const { return S_ISREG(mode); }
    /// The device as one 32-bit number that is never 0 ("unknown"); valid until the next boot only.
    std::uint32_t deviceID() const;
    /// Birth time as one number, ns since 1970; 0 where the file system has none.
    std::int64_t birthStamp() const;
    /// Of two that exist at one time.
    bool isSameObject(const FileStatus& other) const { return fileID == other.fileID && device == other.device; }
    ObjectIdentity identity() const { return {fileID, device, birthStamp()}; }
};

/// One record of getdents64, as the kernel writes it. `name` ends with a NUL.
struct DirectoryRecord {
    std::uint64_t fileID;
    std::int64_t nextOffset;  ///< where lseek() goes on after this record; opaque
    std::uint16_t length;     ///< bytes to the next record
    std::uint8_t type;        ///< DT_ value; DT_UNKNOWN where the file system doesn't say
    char name[5];             ///< first bytes of the name, which may be longer

    bool isDots() const { return name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0')); }
};

/// What name_to_handle_at answers: an object's name that lasts through renames and ends with the object, a number that
/// is used again included. Equal handles are one object of one file system.
struct FileHandle {
    static constexpr std::size_t kBytesMax = 128;  ///< MAX_HANDLE_SZ
    std::int32_t type = 0;
    std::uint32_t size = 0;
    std::byte bytes[kBytesMax];

    ByteView view() const { return {bytes, size}; }
};

/// System calls: one function a call, same name, same order of arguments. EINTR is retried here and nowhere else;
/// every descriptor is close-on-exec. Errors are of the POSIX domain.
namespace sys {

Result<UniqueFd> open(const char* path, int flags, mode_t mode = 0);
Result<UniqueFd> openat(int directory, const char* name, int flags, mode_t mode = 0);

/// How a path below a directory may be walked: RESOLVE_ bits of openat2.
/// RESOLVE_BENEATH and RESOLVE_NO_MAGICLINKS are always added. A path longer than PATH_MAX is walked in pieces.
Result<UniqueFd> openBeneath(int directory, std::string_view relativePath, int flags, std::uint64_t resolve = 0);

/// Of the entry itself, never of what a link points to. An empty name is the descriptor's own object.
Result<FileStatus> statx(int directory, const char* name);

/// Names of the extended attributes, NUL-terminated one after the other. ENOTSUP is an empty list.
Result<std::string> listxattrat(int directory, const char* name);
/// Whether there is any attribute at all, or an error; one system call and no allocation when there is none.
Result<bool> hasXattrs(int directory, const char* name, std::string& names);
/// Size of the value with an empty buffer, else bytes written. An empty name is the descriptor's own object.
Result<std::size_t> getxattrat(int directory, const char* name, const char* attribute, std::span<std::byte> buffer);

/// Whether the process may write the entry itself (effective identity, links not followed).
Result<bool> isWritable(int directory, const char* name);

/// Whether the process may not list the directory, or not reach what is in it (effective identity, links not followed).
/// False for what is not there.
bool isClosedDirectory(int directory, const char* name);

/// What can be relied on in the file system that holds a directory.
struct FileSystemTraits {
    /// The user of this process, where an owner may write what the mode lets the owner write: on one of this machine's
    /// own file systems (nothing asks a server or a user program), mounted for writing, under a kernel without
    /// mandatory labels. None elsewhere.
    std::optional<uid_t> ownerWhoseModeDecides;
    /// A stamp that was looked at is followed by a distinct one, however soon the next change comes (Linux 6.13, and
    /// file systems that take part). Elsewhere stamps go by the clock's tick.
    bool stampsAreDistinct = false;
};
FileSystemTraits fileSystemTraits(int directory);
/// The answer of isWritable() from the status alone; none where it must be asked for. `owner` as above, of the entry's
/// directory.
///
/// For an owner, access lists say nothing and the mode decides; so a listing of one's own files needs no call for each.
std::optional<bool> isWritableByStatus(const FileStatus& status, std::optional<uid_t> owner);

/// Changes of the entries of watched directories, told without waiting.
///
/// Thread safety: one thread at a time.
class DirectoryWatch {
public:
    /// One change of the entries of a watched directory; 0 when changes were lost and any directory may have changed.
    using Change = std::function<void(int watch)>;

    /// Watches the open directory; a directory that is watched already has the same number. ENOSPC at the user's limit.
    Result<int> add(int directory);
    void remove(int watch);
    /// Calls back for every change since the last call. POSIX error when it can't be told.
    Result<void> drain(const Change& change);

private:
    UniqueFd fd_;
};

/// Bytes read; 0 at the end. EAGAIN where there is nothing yet and the descriptor does not wait.
Result<std::size_t> read(int fd, std::span<std::byte> buffer);
/// Bytes that can be read without waiting (FIONREAD). What a fanotify group answers is 24 for each event, whatever its
/// length.
Result<std::uint64_t> readableBytes(int fd);

Result<UniqueFd> inotify_init1(int flags);
/// Watches the open object itself: no path is walked, so that nothing else can take its place on the way.
Result<int> inotify_add_watch(int instance, int object, std::uint32_t mask);
Result<void> inotify_rm_watch(int instance, int watch);

Result<UniqueFd> fanotify_init(unsigned flags, unsigned eventFlags);
/// Marks the open object, its mount or its file system, as the flags say.
Result<void> fanotify_mark(int group, unsigned flags, std::uint64_t mask, int object);

/// An empty name with AT_EMPTY_PATH is the descriptor's own object.
Result<FileHandle> name_to_handle_at(int directory, const char* name, int flags);
/// `mount` is open for reading, anywhere on the file system. ESTALE when the object is gone; EPERM without
/// CAP_DAC_READ_SEARCH.
Result<UniqueFd> open_by_handle_at(int mount, const FileHandle& handle, int flags);
/// The number that fanotify tells file systems apart by (f_fsid); 0 where there is none.
Result<std::uint64_t> fileSystemID(int fd);
/// Another descriptor of what is open.
Result<UniqueFd> duplicate(int fd);

/// Reads from a regular file without touching its access time. EPERM where the process may not ask for that;
/// ENXIO for anything but a regular file, which is never opened.
Result<Bytes> readBeginning(int directory, const char* name, std::size_t count);

/// Opens a directory to be listed, leaving its access time alone where the process may. `name` "" is not allowed; "."
/// is the directory itself.
Result<UniqueFd> openDirectoryForReading(int directory, const char* name, int extraFlags = 0);
/// The same for a directory at a path below another; a final link is refused.
Result<UniqueFd> openDirectoryBeneath(int directory, std::string_view relativePath, std::uint64_t resolve = 0);
/// Where a link of /proc/self/fd leads: the path of an open descriptor as the kernel knows it; "/" or a path with "
/// (deleted)" where it knows none. Check what comes back.
Result<std::string> pathOfDescriptor(int fd);
/// Fills the buffer with DirectoryRecords; 0 at the end.
Result<std::size_t> getdents(int directory, std::span<std::byte> buffer);

/// Entries that a directory holds, "." and ".." not counted, counting no further than `max`.
Result<std::uint64_t> countEntries(int directory, const char* name, std::uint64_t max);

}  // namespace sys

}  // namespace cindral
