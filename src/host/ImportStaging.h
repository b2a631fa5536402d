#pragma once

#include <memory>

#include "host/PresentedPaths.h"
#include "platform/foundation/Result.h"
#include "platform/tessel/StagingFolder.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// A folder of one operation's own in the storage's temporary folder, as the provider knows it: what is built there is
/// then moved to its place under the name that it is to have, and what is not goes with the folder.
struct ImportStaging {
    std::unique_ptr<StagingFolder> folder;
    TesselItemIdentifier identifier;

    /// Errors are the host's own, with a line for people.
    static Result<ImportStaging> make(TesselExtension& provider, const PresentedPaths& paths);
};

}  // namespace cindral
