#pragma once

#include <functional>
#include <memory>
#include <string>

#include "host/LineSink.h"
#include "host/PresentedPaths.h"
#include "host/SearchQueries.h"
#include "host/SignalDispatcher.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

class HostProcess;

/// What a connection is served from. Borrowed for the call.
struct RpcService {
    const std::shared_ptr<TesselExtension>& provider;
    const PresentedPaths& paths;
    SignalDispatcher& signals;
    std::function<std::string()> statusText;
    SearchQueries& search;
    std::function<std::string(bool endsSoon)> hello = [](bool) { return std::string("{}"); };
    std::function<Result<std::string>()> doctorText = [] { return Result<std::string>("{}"); };
    std::function<Result<std::string>()> makeLink = nullptr;  ///< for a browser; null where none is let in
};
/// All that a host has to offer.
RpcService serviceOf(const HostProcess& host);

/// Serves one client on a pair of descriptors until its input ends, or it no longer reads. What the client monitors is
/// told on the same line as the answers, as notifications, until the end of its input.
///
/// At the end of input what is under way is answered before this returns. A client that has stopped reading is no
/// error; output that can't be written for another reason is.
Result<void> serveRpc(int input, int output, const RpcService& service);
/// The same with a place of its own for what the client is to read. `output` is looked at for whether anybody reads;
/// `interrupt` ends the input.
Result<void> serveRpc(int input, int output, const UniqueFd& interrupt, LineSink& answers, const RpcService& service);

}  // namespace cindral
