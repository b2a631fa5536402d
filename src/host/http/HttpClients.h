#pragma once

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>

#include "host/RpcConnection.h"
#include "host/ServedClient.h"
#include "host/http/HttpConnection.h"
#include "host/http/HttpSessions.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// The pages that are open: each is a client of its own, told by its stream of events what happens to what it monitors
/// and to what it has asked for.
///
/// Thread safety: all operations, from any thread.
class HttpClients {
public:
    /// Of one session; one more is refused.
    static constexpr std::size_t kStreamsMax = 64;

    /// `service` is borrowed for life.
    explicit HttpClients(const RpcService& service) : service_(service) {}

    /// Makes a client and tells it everything until it is gone or `stop` can be read. The first event, "connection",
    /// holds the name by which its requests find it. False where there are too many.
    bool stream(HttpConnection& connection, int socket, int stop, const std::shared_ptr<const HttpSession>& session);

    /// The answer to the requests of one message, as JSON text; empty where nothing in it is to be answered.
    ///
    /// `name` is what stream() told the page, empty for requests that need no stream. False where the session has no
    /// such client, or no longer.
    bool answer(const HttpSession& session, std::string_view name, std::string_view message, std::string& answer);

    /// Ends all streams of the session.
    void end(const HttpSession& session);

private:
    class Outlet;
    struct Page {
        std::shared_ptr<const HttpSession> session;
        int socket;  ///< open for as long as the page stands here
        std::shared_ptr<ServedClient> client;
    };
    std::shared_ptr<ServedClient> find(const HttpSession& session, std::string_view name);

    const RpcService& service_;
    Mutex mutex_;
    std::map<std::string, Page, std::less<>> pages_ GUARDED_BY(mutex_);
};

}  // namespace cindral
