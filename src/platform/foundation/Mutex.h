#pragma once

#include <condition_variable>
#include <mutex>

#include "platform/foundation/ThreadAnnotations.h"

namespace cindral {

/// std::mutex with the annotations that let clang check who touches what.
class CAPABILITY("mutex") Mutex {
public:
    void lock() ACQUIRE() { mutex_.lock(); }
    void unlock() RELEASE() { mutex_.unlock(); }
    bool try_lock() TRY_ACQUIRE(true) { return mutex_.try_lock(); }  // NOLINT(readability-identifier-naming)

private:
    std::mutex mutex_;
};

/// Holds a Mutex for a scope.
class SCOPED_CAPABILITY MutexLock {
public:
    explicit MutexLock(Mutex& mutex) ACQUIRE(mutex) : mutex_(mutex) { mutex_.lock(); }
    ~MutexLock() RELEASE() { mutex_.unlock(); }
    MutexLock(const MutexLock&) = delete;
    MutexLock& operator=(const MutexLock&) = delete;

private:
    Mutex& mutex_;
};

/// A condition that is waited for under a Mutex.
class Condition {
public:
    void wait(Mutex& mutex) REQUIRES(mutex) { condition_.wait(mutex); }
    /// False when the deadline passed first.
    template <typename Clock, typename Duration>
    bool waitUntil(Mutex& mutex, const std::chrono::time_point<Clock, Duration>& deadline) REQUIRES(mutex) {
        return condition_.wait_until(mutex, deadline) == std::cv_status::no_timeout;
    }
    void notifyOne() { condition_.notify_one(); }
    void notifyAll() { condition_.notify_all(); }

private:
    std::condition_variable_any condition_;
};

}  // namespace cindral
