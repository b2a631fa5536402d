#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>

#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"

/// Stream sockets of this machine, named by a path of any length. Errors are of the POSIX domain.
namespace cindral::local_socket {

/// Connections that wait to be accepted; one more waits for that.
inline constexpr int kWaitingMax = 4096;
/// Where nothing can be had for another connection, none is accepted for so long, unless one of those that there are ends.
inline constexpr std::chrono::seconds kRespite{1};

/// Listens at the path, in place of whatever socket or link was there, in one step: who connects finds the one or the
/// other. For the owner alone.
Result<UniqueFd> listenAt(const std::string& path);
/// Follows links. Waits where too many others are waiting to be accepted.
Result<UniqueFd> connectTo(const std::string& path);

/// The next connection; none where there is none yet. EINVAL where the socket takes none any more and all have been
/// accepted.
Result<std::optional<UniqueFd>> acceptFrom(int socket);
/// Who was at the other end when it was connected.
struct Peer {
    uid_t user;
    pid_t process;
};
Result<Peer> peerOf(int socket);

}  // namespace cindral::local_socket
