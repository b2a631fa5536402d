#pragma once

#include <sys/types.h>
#include <unistd.h>

#include <functional>
#include <list>
#include <memory>
#include <string>
#include <utility>

#include "host/DaemonListener.h"
#include "host/DaemonSocket.h"
#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// Serves JSON-RPC to the clients of the daemon's socket: each on a thread of its own, which sleeps for as long as its
/// client says nothing, and none of them held up by another.
///
/// Only the person whose daemon it is is served: others are told so, and sent away. So is one client more than
/// kClientsMax.
///
/// A client that has said that it ends soon, a command that somebody has typed, is served to its own end also when the
/// listener stops, for a few seconds: no command fails because its daemon is stopped or replaced.
///
/// Thread safety: as DaemonListener.
class SocketListener final : public DaemonListener {
public:
    static constexpr std::size_t kClientsMax = 1000;

    struct Limits {
        uid_t user = ::geteuid();  ///< who is served
        std::size_t clientsMax = kClientsMax;
    };
    /// What a client is given that asks for a link, which lets a browser in; null where there are none.
    using MakeLink = std::function<Result<std::string>()>;
    explicit SocketListener(DaemonSocket socket, MakeLink makeLink = nullptr)
        : SocketListener(std::move(socket), Limits(), std::move(makeLink)) {}
    SocketListener(DaemonSocket socket, Limits limits, MakeLink makeLink = nullptr);
    /// Stopped before, where it was started.
    ~SocketListener() override;
    SocketListener(const SocketListener&) = delete;
    SocketListener& operator=(const SocketListener&) = delete;

    Result<void> start(const HostProcess& host) override;
    void stop() override;
    void waitUntilStopped() override;

private:
    class Client;
    void accept(const HostProcess& host);
    bool acceptAll(const HostProcess& host);
    void makeDoWithout();
    void welcome(UniqueFd connection, const HostProcess& host);
    const char* whyNot(int connection);
    void serve(const std::shared_ptr<Client>& client, const HostProcess& host);

    DaemonSocket socket_;
    const Limits limits_;
    const MakeLink makeLink_;
    UniqueFd stop_;   ///< constant once started
    UniqueFd spare_;  ///< the accepting thread's
    DispatchGroup threads_;

    Mutex mutex_;
    Condition changed_;
    std::list<std::shared_ptr<Client>> clients_ GUARDED_BY(mutex_);
    bool isStopping_ GUARDED_BY(mutex_) = false;
};

}  // namespace cindral
