#pragma once

#include <chrono>
#include <functional>
#include <map>

#include "platform/foundation/Mutex.h"

namespace cindral {

/// Calls back at given moments, on one thread that all share and that sleeps until the next of them; without any, it is
/// not woken up.
///
/// Lives as long as the process.
///
/// Thread safety: all operations, from any thread.
class SharedTimer {
public:
    using TimePoint = std::chrono::steady_clock::time_point;

    static SharedTimer& shared();

    /// Calls back once at or after the moment; in the order of the moments, then of the calls. The callback holds up
    /// all others: it only passes on, to a queue.
    void callAt(TimePoint moment, std::function<void()> callback);

private:
    SharedTimer();
    void run();

    Mutex mutex_;
    Condition changed_;
    std::multimap<TimePoint, std::function<void()>> pending_ GUARDED_BY(mutex_);
};

}  // namespace cindral
