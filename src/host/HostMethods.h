#pragma once

#include <functional>
#include <string>

#include "host/ContainerMonitor.h"
#include "host/JsonRpcServer.h"
#include "host/PresentedPaths.h"
#include "host/ProviderClient.h"
#include "host/QueryWatches.h"

namespace cindral {

/// What the methods of one client work with. Borrowed for as long as a method may run.
struct HostMethodsContext {
    ProviderClient& client;
    ContainerMonitor& monitor;
    const PresentedPaths& paths;
    std::function<std::string()> statusText;  ///< as JSON
    SearchQueries& search;
    QueryWatches& watches;
    /// What the host says of itself, as JSON; told whether the client ends soon, and by itself.
    std::function<std::string(bool endsSoon)> hello;
    /// A link that lets a browser in; null where none is let in.
    std::function<Result<std::string>()> makeLink;
};

/// The methods of the host interface, for one client.
JsonRpcServer::Methods makeHostMethods(const HostMethodsContext& context);

/// Answers with what a provider refused: its domain and code, and the named texts, paths as clients know them.
void answerWithError(JsonRpcReply& reply, const KsError& error, const PresentedPaths& paths);
void answerItem(JsonRpcReply& reply, const Result<std::shared_ptr<const TesselItem>>& item,
                const PresentedPaths& paths);

}  // namespace cindral
