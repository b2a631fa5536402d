#pragma once

#include <string>

#include "host/HostEnvironment.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// The socket that a daemon listens on for its state folder.
///
/// It is in the runtime folder, $XDG_RUNTIME_DIR/cindral/HASH.sock, HASH being that of the state folder's real path, and
/// STATE/socket is a link to it, so that who knows the state folder alone finds it. Where there is no runtime folder that
/// is its owner's alone, STATE/socket is the socket itself.
///
/// Thread safety: for one thread at a time.
class DaemonSocket {
public:
    /// Listens, in place of what an earlier daemon may have left behind. To be called by who holds the lock of the
    /// state's store.
    static Result<DaemonSocket> listenFor(const std::string& realState, const HostEnvironment& environment);
    /// Takes over a socket that the service manager listens on, wherever it is, and points STATE/socket to it.
    static Result<DaemonSocket> adopt(UniqueFd socket, const std::string& realState);
    /// Takes the names away, unless the service manager goes on listening.
    ~DaemonSocket();
    DaemonSocket(DaemonSocket&& other) noexcept = default;
    DaemonSocket& operator=(DaemonSocket&&) = delete;

    int descriptor() const { return socket_.get(); }
    /// No more connections are taken; those that are waiting can still be accepted. Where the service manager goes on
    /// listening, they wait for the next daemon instead.
    void close();

    /// The path by which a state folder's daemon is found.
    static std::string linkIn(const std::string& state);

private:
    DaemonSocket(UniqueFd socket, std::string path, std::string link, bool isOwn)
        : socket_(std::move(socket)), path_(std::move(path)), link_(std::move(link)), isOwn_(isOwn) {}
    void removeNames();

    UniqueFd socket_;
    std::string path_;  ///< of the socket itself
    std::string link_;  ///< the same where there is no link
    bool isOwn_;
};

}  // namespace cindral
