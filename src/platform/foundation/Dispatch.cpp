#include "platform/foundation/Dispatch.h"

#include <optional>

#include "platform/foundation/Fatal.h"
#include "platform/foundation/ThreadPool.h"

namespace cindral {
namespace {

using Clock = std::chrono::steady_clock;

/// None when the moment lies beyond what the clock can tell: the wait is then without an end.
std::optional<Clock::time_point> deadlineAfter(Clock::duration timeout) {
    const Clock::time_point now = Clock::now();
    if (timeout > Clock::time_point::max() - now) return std::nullopt;
    return now + timeout;
}

}  // namespace

void DispatchGroup::enter() {
    const MutexLock lock(mutex_);
    ++pending_;
}

void DispatchGroup::leave() {
    const MutexLock lock(mutex_);
    if (pending_ == 0) fatal("a dispatch group is left more often than entered");
    // Under the lock: who waits may destroy the group as soon as it has the lock.
    if (--pending_ == 0) idle_.notifyAll();
}

void DispatchGroup::wait() {
    const ThreadPool::BlockingRegion region;
    const MutexLock lock(mutex_);
    while (pending_ > 0) idle_.wait(mutex_);
}

WaitResult DispatchGroup::wait(Clock::duration timeout) {
    const auto deadline = deadlineAfter(timeout);
    if (!deadline) {
        wait();
        return WaitResult::done;
    }
    const ThreadPool::BlockingRegion region;
    const MutexLock lock(mutex_);
    while (pending_ > 0) {
        if (!idle_.waitUntil(mutex_, *deadline) && pending_ > 0) return WaitResult::timedOut;
    }
    return WaitResult::done;
}

void DispatchSemaphore::signal() {
    const MutexLock lock(mutex_);
    ++count_;
    available_.notifyOne();
}

void DispatchSemaphore::wait() {
    const ThreadPool::BlockingRegion region;
    const MutexLock lock(mutex_);
    while (count_ == 0) available_.wait(mutex_);
    --count_;
}

WaitResult DispatchSemaphore::wait(Clock::duration timeout) {
    const auto deadline = deadlineAfter(timeout);
    if (!deadline) {
        wait();
        return WaitResult::done;
    }
    const ThreadPool::BlockingRegion region;
    const MutexLock lock(mutex_);
    while (count_ == 0) {
        if (!available_.waitUntil(mutex_, *deadline) && count_ == 0) return WaitResult::timedOut;
    }
    --count_;
    return WaitResult::done;
}

}  // namespace cindral
