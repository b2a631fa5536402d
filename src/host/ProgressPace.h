#pragma once

#include <chrono>
#include <functional>

#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselProgress.h"

namespace cindral {

/// When somebody is to be told how far an operation has come: much work at once, little only when it takes its time,
/// and then at most ten times a second.
///
/// Thread safety: all operations, from any thread.
class ProgressPace {
public:
    using Clock = std::function<std::chrono::steady_clock::time_point()>;
    static constexpr std::chrono::milliseconds kIntervalMin{100};

    explicit ProgressPace(Clock clock = std::chrono::steady_clock::now);

    /// Whether to tell now. Who was told yes is expected to.
    bool isTimeToTell(const TesselProgress::Counts& counts);

private:
    const Clock clock_;
    Mutex mutex_;
    std::chrono::steady_clock::time_point lastTold_ GUARDED_BY(mutex_);  ///< at first, when it began
    bool hasTold_ GUARDED_BY(mutex_) = false;
};

}  // namespace cindral
