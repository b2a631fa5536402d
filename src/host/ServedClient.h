#pragma once

#include <span>
#include <string_view>

#include "host/ContainerMonitor.h"
#include "host/JsonRpcServer.h"
#include "host/ProviderClient.h"
#include "host/QueryWatches.h"
#include "host/RpcConnection.h"

namespace cindral {

/// All that is kept for one client of the host: its way to the provider, what it monitors, its requests.
///
/// Ends in order: the requests are answered, then nothing is watched or monitored any more, then the enumerators go.
///
/// Thread safety: one thread receives; see JsonRpcServer.
class ServedClient {
public:
    /// `tell` takes answers and notifications, a line each; any thread, several at a time. The methods named in
    /// `without` are not to be had. `service` is borrowed for life.
    ServedClient(const RpcService& service, JsonRpcServer::Sink tell, std::span<const std::string_view> without = {});

    JsonRpcServer& server() { return server_; }

private:
    const JsonRpcServer::Sink tell_;
    ProviderClient client_;
    ContainerMonitor monitor_;
    QueryWatches watches_;
    JsonRpcServer server_;
};

}  // namespace cindral
