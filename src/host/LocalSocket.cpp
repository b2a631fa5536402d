#include "host/LocalSocket.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "platform/foundation/Sys.h"

namespace cindral::local_socket {
namespace {

constexpr mode_t kOwnerOnly = 0600;

/// An address for a path, which may be longer than an address takes: then by way of its folder's descriptor, which must
/// be open for as long as the address is used.
struct Address {
    sockaddr_un address{};
    UniqueFd folder;

    const sockaddr* get() const { return reinterpret_cast<const sockaddr*>(&address); }
};

Result<Address> addressOf(const std::string& path) {
    Address result;
    result.address.sun_family = AF_UNIX;
    std::string shortPath = path;
    if (path.size() >= sizeof result.address.sun_path) {
        const std::size_t slash = path.rfind('/');
        result.folder = TRY(sys::open(path.substr(0, slash + 1).c_str(), O_PATH | O_DIRECTORY));
        shortPath = fmt::format("/proc/self/fd/{}/{}", result.folder.get(), path.substr(slash + 1));
    }
    if (shortPath.size() >= sizeof result.address.sun_path) return KsError::posix(ENAMETOOLONG, path);
    std::memcpy(result.address.sun_path, shortPath.c_str(), shortPath.size() + 1);
    return result;
}

Result<UniqueFd> makeSocket(int flags) {
    UniqueFd made(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | flags, 0));
    if (!made) return KsError::errorWithPOSIXCode();
    return made;
}

}  // namespace

Result<UniqueFd> listenAt(const std::string& path) {
    UniqueFd listening = TRY(makeSocket(SOCK_NONBLOCK));
    const std::string temporary = path + ".new";
    const Address address = TRY(addressOf(temporary));
    ::unlink(temporary.c_str());
    // The mode of the descriptor is that of the name it is given, which nobody else can use for an instant either.
    if (::fchmod(listening.get(), kOwnerOnly) != 0 ||
        ::bind(listening.get(), address.get(), sizeof address.address) != 0 ||
        ::listen(listening.get(), kWaitingMax) != 0 || ::rename(temporary.c_str(), path.c_str()) != 0) {
        const KsError error = KsError::errorWithPOSIXCode().with("path", path);
        ::unlink(temporary.c_str());
        return error;
    }
    return listening;
}

Result<UniqueFd> connectTo(const std::string& path) {
    UniqueFd connected = TRY(makeSocket(0));
    const Address address = TRY(addressOf(path));
    if (::connect(connected.get(), address.get(), sizeof address.address) != 0) return KsError::errorWithPOSIXCode();
    return connected;
}

Result<std::optional<UniqueFd>> acceptFrom(int socket) {
    while (true) {
        UniqueFd accepted(::accept4(socket, nullptr, nullptr, SOCK_CLOEXEC));
        if (accepted) return std::optional(std::move(accepted));
        if (errno == EAGAIN) return std::optional<UniqueFd>();
        if (errno != EINTR && errno != ECONNABORTED) return KsError::errorWithPOSIXCode();
    }
}

Result<Peer> peerOf(int socket) {
    ucred credentials{};
    socklen_t size = sizeof credentials;
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) return KsError::errorWithPOSIXCode();
    return Peer{credentials.uid, credentials.pid};
}

}  // namespace cindral::local_socket
