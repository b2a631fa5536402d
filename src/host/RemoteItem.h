#pragma once

#include <memory>
#include <optional>

#include "host/JsonRpcMessage.h"
#include "host/ProviderAccess.h"
#include "platform/foundation/Result.h"
#include "platform/tessel/TesselItem.h"

namespace cindral {

/// An item read back from what ItemWriter wrote: the same again when it is written anew.
///
/// Where the name was not UTF-8, its bytes come from the URL, which holds every name.
///
/// Errors are the host's own: what was read is no item.
Result<std::shared_ptr<const TesselItem>> itemFromJson(const Json& json);
/// The "items" of an answer.
Result<TesselItems> itemsFromJson(const Json& answer);
/// The same with its "nextPage".
Result<ItemsPage> itemsPageFromJson(const Json& answer);
/// Base64 that may be null.
Result<std::optional<Bytes>> bytesFromJson(const Json& answer, const char* key);

}  // namespace cindral
