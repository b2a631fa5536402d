#pragma once

#include <functional>
#include <memory>
#include <span>
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
    std::function<Result<std::string>()> doctorText;  ///< as JSON
    /// A link that lets a browser in; null where none is let in.
    std::function<Result<std::string>()> makeLink;
};

/// A method by its name, and what carries it out: it answers by the reply, at once or later.
struct HostMethod {
    const char* name;
    void (*handler)(const HostMethodsContext& context, const nlohmann::json& params,
                    const std::shared_ptr<JsonRpcReply>& reply);
};
/// The methods with what they work on.
JsonRpcServer::Methods bindHostMethods(const HostMethodsContext& context, std::span<const HostMethod> handlers);

/// The methods of the host interface, for one client.
JsonRpcServer::Methods makeHostMethods(const HostMethodsContext& context);

/// Answers with what a provider refused: its domain and code, and the named texts, paths as clients know them.
void answerWithError(JsonRpcReply& reply, const KsError& error, const PresentedPaths& paths);
void answerItem(JsonRpcReply& reply, const Result<std::shared_ptr<const TesselItem>>& item,
                const PresentedPaths& paths);

}  // namespace cindral
