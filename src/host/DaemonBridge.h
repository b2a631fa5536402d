#pragma once

#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// Passes what is read from `input` on to a daemon's socket, and what the daemon says on to `output`, until the daemon
/// has answered everything after the end of input, or nobody reads `output` any more.
///
/// Errors are the host's own: the daemon went first.
Result<void> bridgeToDaemon(int input, int output, UniqueFd socket);

}  // namespace cindral
