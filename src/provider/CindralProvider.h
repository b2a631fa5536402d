#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/foundation/Result.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// The provider's factory: what the host loads it through.
///
/// Before the first call the host sets the manager's documentStorageURL, connects the document store, adds the storage
/// to the root directories and gives the application registry its own record.
std::shared_ptr<TesselExtension> makeCindralProvider();

/// Before a provider is made: sets aside what would keep one from starting. Answers the new paths.
Result<std::vector<std::string>> repairCindralProvider(const std::string& applicationSupport);

}  // namespace cindral
