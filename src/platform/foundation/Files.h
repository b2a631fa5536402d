#pragma once

#include <string>

#include "platform/foundation/Data.h"
#include "platform/foundation/Result.h"

/// Folders and whole files, for what the system keeps for itself.
namespace cindral::files {

/// Makes the folder at the absolute path and those that lead to it, each missing one for its owner alone. Errors are of
/// the POSIX domain, with the path in the way.
Result<void> makeFolders(const std::string& path);

/// Puts a file with the bytes, for its owner alone, where the path leads, instead of the one that is there: a reader
/// sees all of the one or all of the other, also after a power cut. The folder exists. Errors are of the POSIX domain,
/// with the path; the file is then what it was, and nothing is left beside it.
Result<void> replace(const std::string& path, ByteView bytes);

}  // namespace cindral::files
