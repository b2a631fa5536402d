#pragma once

#include <memory>

#include "host/JsonRpcServer.h"
#include "host/ProgressPace.h"
#include "platform/tessel/TesselProgress.h"

namespace cindral {

/// Tells a client how far its request has come, at the pace of ProgressPace, and cancels it when the client asks.
///
/// Thread safety: all operations, from any thread.
class ProgressNotifier : public std::enable_shared_from_this<ProgressNotifier> {
public:
    /// Follows the progress for the request's sake, and keeps neither: nothing is told once the request is answered.
    static void follow(const std::shared_ptr<TesselProgress>& progress, const std::shared_ptr<JsonRpcReply>& reply,
                       const ProgressPace::Clock& clock = std::chrono::steady_clock::now);

    ProgressNotifier(std::weak_ptr<JsonRpcReply> reply, ProgressPace::Clock clock);
    void tell(const TesselProgress::Counts& counts);

private:
    const std::weak_ptr<JsonRpcReply> reply_;
    ProgressPace pace_;
};

}  // namespace cindral
