#pragma once

#include "host/HostMethods.h"

namespace cindral {

/// The methods that ask across folders: search, recents, taggedItems, favorites, trashedItems, sortedItems, tags,
/// watchQuery, unwatchQuery.
JsonRpcServer::Methods makeSearchMethods(const HostMethodsContext& context);

}  // namespace cindral
