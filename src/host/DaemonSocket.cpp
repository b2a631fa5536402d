#include "host/DaemonSocket.h"

#include <fmt/format.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <optional>

#include "host/LocalSocket.h"
#include "host/StorageFolders.h"

namespace cindral {
namespace {

/// Where the socket is to be; none without a folder that is ours alone.
std::optional<std::string> runtimePath(const std::string& realState, const HostEnvironment& environment) {
    if (environment.runtimeFolder.empty()) return std::nullopt;
    const std::string folder = environment.runtimeFolder + "/cindral";
    if (!storage_folders::makePrivateFolder(folder).ok()) return std::nullopt;
    return fmt::format("{}/{:016x}.sock", folder, storage_folders::fingerprint(realState));
}

/// The path that the socket was bound to; empty for one that has none.
std::string boundPath(int socket) {
    sockaddr_un address{};
    socklen_t size = sizeof address;
    if (::getsockname(socket, reinterpret_cast<sockaddr*>(&address), &size) != 0) return "";
    return address.sun_path[0] == '/' ? address.sun_path : "";
}

}  // namespace

std::string DaemonSocket::linkIn(const std::string& state) {
    return state + "/socket";
}

Result<DaemonSocket> DaemonSocket::listenFor(const std::string& realState, const HostEnvironment& environment) {
    const std::string link = linkIn(realState);
    const auto path = runtimePath(realState, environment);
    if (!path) return DaemonSocket(TRY(local_socket::listenAt(link)), link, link, /*isOwn=*/true);
    DaemonSocket made(TRY(local_socket::listenAt(*path)), *path, link, /*isOwn=*/true);
    TRY(storage_folders::replaceLink(link, *path));
    return made;
}

Result<DaemonSocket> DaemonSocket::adopt(UniqueFd socket, const std::string& realState) {
    const std::string link = linkIn(realState);
    std::string path = boundPath(socket.get());
    if (!path.empty() && path != link) TRY(storage_folders::replaceLink(link, path));
    return DaemonSocket(std::move(socket), std::move(path), link, /*isOwn=*/false);
}

DaemonSocket::~DaemonSocket() {
    if (socket_) close();
}

void DaemonSocket::close() {
    if (!isOwn_) return;
    removeNames();
    // Who has found the name before is refused from now on, and knows that nobody is there.
    ::shutdown(socket_.get(), SHUT_RD);
}

void DaemonSocket::removeNames() {
    if (path_.empty()) return;
    if (link_ != path_ && storage_folders::targetOf(link_) == path_) ::unlink(link_.c_str());
    ::unlink(path_.c_str());
    path_.clear();
}

}  // namespace cindral
