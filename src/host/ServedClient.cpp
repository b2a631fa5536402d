#include "host/ServedClient.h"

#include <string>
#include <utility>

#include "host/HostMethods.h"
#include "host/JsonText.h"

namespace cindral {
namespace {

/// The notification that something in a container has changed.
std::string signalLine(const TesselItemIdentifier& container) {
    std::string line = R"({"jsonrpc":"2.0","method":"signal","params":{"container":)";
    appendJsonString(line, container);
    return line + "}}\n";
}

/// The notification that a watched query's answer may be another.
std::string queryLine(std::uint64_t watch) {
    std::string line = R"({"jsonrpc":"2.0","method":"queryChanged","params":{"watch":)";
    appendJsonNumber(line, watch);
    return line + "}}\n";
}

JsonRpcServer::Methods methodsWithout(JsonRpcServer::Methods methods, std::span<const std::string_view> without) {
    for (const std::string_view name : without) methods.erase(std::string(name));
    return methods;
}

}  // namespace

ServedClient::ServedClient(const RpcService& service, JsonRpcServer::Sink tell,
                           std::span<const std::string_view> without)
    : tell_(std::move(tell)),
      client_(service.provider),
      monitor_(client_, service.signals,
               [this](const TesselItemIdentifier& container) { tell_(signalLine(container)); }),
      watches_(service.search, [this](std::uint64_t watch) { tell_(queryLine(watch)); }),
      server_(methodsWithout(makeHostMethods({client_, monitor_, service.paths, service.statusText, service.search,
                                              watches_, service.hello, service.doctorText, service.makeLink}),
                             without),
              tell_) {}

}  // namespace cindral
