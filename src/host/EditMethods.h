#pragma once

#include "host/HostMethods.h"

namespace cindral {

/// The methods of the host interface that change something: edits, the trash, and the user's metadata.
JsonRpcServer::Methods makeEditMethods(const HostMethodsContext& context);

}  // namespace cindral
