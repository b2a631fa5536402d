#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>

#include "host/JsonRpcServer.h"
#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselProgress.h"

namespace cindral {

/// Tells a client how far its request has come, at most ten times a second, and cancels it when the client asks.
///
/// Much work is told of at once, little only when it takes its time.
///
/// Thread safety: all operations, from any thread.
class ProgressNotifier : public std::enable_shared_from_this<ProgressNotifier> {
public:
    using Clock = std::function<std::chrono::steady_clock::time_point()>;
    static constexpr std::chrono::milliseconds kIntervalMin{100};

    /// Follows the progress for the request's sake, and keeps neither: nothing is told once the request is answered.
    static void follow(const std::shared_ptr<TesselProgress>& progress, const std::shared_ptr<JsonRpcReply>& reply,
                       const Clock& clock = std::chrono::steady_clock::now);

    ProgressNotifier(std::weak_ptr<JsonRpcReply> reply, Clock clock);
    void tell(const TesselProgress::Counts& counts);

private:
    bool isTimeToTell(const TesselProgress::Counts& counts);

    const std::weak_ptr<JsonRpcReply> reply_;
    const Clock clock_;
    Mutex mutex_;
    std::chrono::steady_clock::time_point lastTold_ GUARDED_BY(mutex_);  ///< at first, when it began
    bool hasTold_ GUARDED_BY(mutex_) = false;
};

}  // namespace cindral
