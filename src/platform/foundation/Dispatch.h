#pragma once

#include <chrono>
#include <cstdint>

#include "platform/foundation/Mutex.h"

namespace cindral {

enum class WaitResult { done, timedOut };

/// Counts work that is under way, and waits for its end.
///
/// Thread safety: all operations. leave() beyond enter() aborts.
class DispatchGroup {
public:
    void enter();
    void leave();
    void wait();
    WaitResult wait(std::chrono::steady_clock::duration timeout);

private:
    Mutex mutex_;
    Condition idle_;
    std::uint64_t pending_ GUARDED_BY(mutex_) = 0;
};

/// A counting semaphore.
///
/// Thread safety: all operations.
class DispatchSemaphore {
public:
    explicit DispatchSemaphore(std::uint64_t count) : count_(count) {}
    void signal();
    void wait();
    WaitResult wait(std::chrono::steady_clock::duration timeout);

private:
    Mutex mutex_;
    Condition available_;
    std::uint64_t count_ GUARDED_BY(mutex_);
};

}  // namespace cindral
