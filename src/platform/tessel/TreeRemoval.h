#pragma once

#include <string>

#include "platform/foundation/Result.h"
#include "platform/foundation/Sys.h"
#include "platform/tessel/TesselProgress.h"

namespace cindral {

/// Whether everything below the folder may be removed, looking at all of it and changing nothing; counts it.
///
/// Errors with the "path" of what stands in the way: EACCES a folder that may not be written, EPERM something that is
/// not to be changed or is somebody else's, EBUSY something mounted there; ECANCELED when the progress was cancelled
/// meanwhile.
Result<void> checkTreeIsRemovable(int directory, const char* name, const std::string& path, TesselProgress& progress);

/// Removes the entry and everything below it, following nothing. What is gone already is no error. An error leaves the
/// rest where it is. `progress` may be null; whether it was cancelled is not asked.
///
/// For what is out of sight already: the modes of the process's own folders are not asked, and changed where they stand
/// in the way.
Result<void> removeTree(int directory, const char* name, const std::string& path, TesselProgress* progress);

}  // namespace cindral
