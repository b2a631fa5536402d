#pragma once

#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>

#include "platform/foundation/Data.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/Sys.h"

/// The system calls that change something: as those of Sys.h, one function a call, same name, same order of arguments.
/// EINTR is retried here; errors are of the POSIX domain. Names are of entries of open directories: nothing here walks
/// a path.
namespace cindral::sys {

Result<void> renameat2(int directory, const char* name, int newDirectory, const char* newName, unsigned flags);
Result<void> linkat(int directory, const char* name, int newDirectory, const char* newName, int flags = 0);
/// Gives an open file (also one that has no name yet) a name. EEXIST where the name is taken.
Result<void> linkDescriptor(int fd, int directory, const char* name);
Result<void> unlinkat(int directory, const char* name, int flags = 0);
Result<void> mkdirat(int directory, const char* name, mode_t mode);
Result<void> mknodat(int directory, const char* name, mode_t mode, dev_t device);
Result<void> symlinkat(const std::string& target, int directory, const char* name);
Result<std::string> readlinkat(int directory, const char* name);

/// Of the entry itself, never of what a link points to.
Result<void> utimensat(int directory, const char* name, const KsDate& accessTime, const KsDate& modificationTime);
Result<void> futimens(int fd, const KsDate& accessTime, const KsDate& modificationTime);
/// This and the next two take any descriptor, O_PATH included.
Result<void> fchmod(int fd, mode_t mode);
/// `name` with its namespace ("user.…").
Result<void> fsetxattr(int fd, const char* name, ByteView value);
/// ENODATA where there is no such attribute.
Result<void> fremovexattr(int fd, const char* name);

/// Makes one file share the other's data, where the file system can. EOPNOTSUPP, EXDEV, EINVAL or ENOTTY where not.
Result<void> ficlone(int target, int source);
/// Bytes copied, in the kernel; 0 at the end of the source.
Result<std::size_t> copy_file_range(int source, std::uint64_t sourceOffset, int target,  // NOLINT(*-naming)
                                    std::uint64_t targetOffset, std::size_t size);
Result<std::size_t> pread(int fd, std::span<std::byte> buffer, std::uint64_t offset);
/// Writes all of it.
Result<void> pwrite(int fd, ByteView bytes, std::uint64_t offset);
/// SEEK_DATA or SEEK_HOLE; ENXIO where there is no more data.
Result<std::uint64_t> lseek(int fd, std::uint64_t offset, int whence);
Result<void> ftruncate(int fd, std::uint64_t size);
/// Until everything written to the descriptor's file system is on the disk.
Result<void> syncfs(int fd);
/// EWOULDBLOCK where somebody else has it.
Result<void> flock(int fd, int operation);

/// Opens the contents of an object that is held by an O_PATH descriptor and known to be a regular file or a directory.
Result<UniqueFd> reopen(int fd, int flags);

}  // namespace cindral::sys
