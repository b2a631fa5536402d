#pragma once

#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <optional>

#include "host/DaemonListener.h"
#include "host/http/HttpSite.h"
#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// Serves the document browser to the browsers of this machine: each connection on a thread of its own.
///
/// At most kConnectionsMax are open at a time. For one more, the one goes that has been waiting longest for a request:
/// who says nothing, or says it slowly, keeps nobody out.
///
/// Thread safety: as DaemonListener.
class HttpListener final : public DaemonListener {
public:
    static constexpr std::size_t kConnectionsMax = 128;

    /// Takes a link that lets one browser in, once: the first when the service starts, then another whenever one was
    /// used, by one at a time. Nobody else is told. Null where nobody is to be shown any.
    using Show = std::function<void(const std::string& link)>;
    /// Listens on this machine's own address alone. Port 0 is one that is free. EADDRINUSE where another has it.
    static Result<std::unique_ptr<HttpListener>> make(std::uint16_t port, std::uint64_t uploadBytesMax, Show show);
    /// Stopped before, where it was started.
    ~HttpListener() override;
    HttpListener(const HttpListener&) = delete;
    HttpListener& operator=(const HttpListener&) = delete;

    Result<void> start(const HostProcess& host) override;
    void stop() override;
    void waitUntilStopped() override;

    /// A link that lets one browser in, once. Once started; from any thread.
    std::string makeLink();

private:
    struct Connection;
    HttpListener(UniqueFd socket, std::uint16_t port, std::uint64_t uploadBytesMax, Show show);
    void showLink();
    void accept();
    bool acceptAll();
    void welcome(UniqueFd socket);
    void makeRoom() REQUIRES(mutex_);
    void serve(Connection& connection);
    void setWaiting(Connection& connection, bool isWaiting);

    const UniqueFd socket_;
    const std::uint16_t port_;
    const std::uint64_t uploadBytesMax_;
    const Show show_;
    Mutex showMutex_;
    HttpSessions sessions_;
    UniqueFd stop_;                      ///< constant once started
    std::optional<RpcService> service_;  ///< constant once started
    std::unique_ptr<HttpSite> site_;     ///< constant once started
    DispatchGroup threads_;

    Mutex mutex_;
    Condition changed_;
    std::list<std::shared_ptr<Connection>> connections_ GUARDED_BY(mutex_);
    std::uint64_t turns_ GUARDED_BY(mutex_) = 0;
    bool isStopping_ GUARDED_BY(mutex_) = false;
};

}  // namespace cindral
