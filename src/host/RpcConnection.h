#pragma once

#include <functional>
#include <memory>
#include <string>

#include "host/PresentedPaths.h"
#include "platform/foundation/Result.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// Serves one client on a pair of descriptors until its input ends, or it no longer reads.
///
/// At the end of input what is under way is answered before this returns. A client that has stopped reading is no
/// error; output that can't be written for another reason is.
Result<void> serveRpc(int input, int output, const std::shared_ptr<TesselExtension>& provider,
                      const PresentedPaths& paths, const std::function<std::string()>& statusText);

}  // namespace cindral
