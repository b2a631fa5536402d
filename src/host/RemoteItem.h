#pragma once

#include <memory>

#include "host/JsonRpcMessage.h"
#include "platform/foundation/Result.h"
#include "platform/tessel/TesselItem.h"

namespace cindral {

/// An item read back from what ItemWriter wrote: the same again when it is written anew.
///
/// Where the name was not UTF-8, its bytes come from the URL, which holds every name.
///
/// Errors are the host's own: what was read is no item.
Result<std::shared_ptr<const TesselItem>> itemFromJson(const Json& json);

}  // namespace cindral
