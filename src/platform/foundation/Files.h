#pragma once

#include <string>

#include "platform/foundation/Data.h"
#include "platform/foundation/Result.h"

/// Folders and whole files, for what the system keeps for itself.
namespace cindral::files {

/// Makes the folder at the absolute path and those that lead to it, each missing one for its owner alone. Errors are of
/// the POSIX domain, with the path in the way.
Result<void> makeFolders(const std::string& path);

/// What a regular file holds, links followed. EFBIG when it is more than `max` bytes; EINVAL for what is no file, which
/// is never opened. POSIX errors.
Result<Bytes> readAll(const std::string& path, std::size_t max);
/// The same of an object that is open as a handle (O_PATH).
Result<Bytes> readAll(int handle, std::size_t max);

/// Puts a file with the bytes, for its owner alone, where the path leads, instead of the one that is there: a reader
/// sees all of the one or all of the other, also after a power cut. The folder exists. Errors are of the POSIX domain,
/// with the path; the file is then what it was, and nothing is left beside it.
Result<void> replace(const std::string& path, ByteView bytes);

}  // namespace cindral::files
