#pragma once

#include <cstddef>
#include <deque>
#include <functional>
#include <string_view>

#include "platform/foundation/Mutex.h"

namespace cindral {

/// The threads that all queues share.
///
/// As many jobs run at once as the machine has processors, at least two. A job that waits inside a BlockingRegion does
/// not count, so that another takes its place; there are never more than kThreadsMax threads, far above what waits at
/// once in practice. Threads without work sleep until there is some, and go when there are more of them than
/// processors.
///
/// Lives as long as the process: threads may still run while static objects are destroyed.
///
/// Thread safety: all operations, from any thread.
class ThreadPool {
public:
    static constexpr std::size_t kThreadsMax = 512;
    using Job = std::function<void()>;

    static ThreadPool& shared();

    /// The name of a thread that runs nothing in particular.
    static constexpr std::string_view kThreadName = "cindral.pool";

    /// Jobs begin in the order in which they came. An exception that leaves a job ends the process.
    /// Meanwhile the thread bears the name, cut to the kernel's 15 bytes; its text must live as long as the job.
    void submit(Job job, std::string_view name = kThreadName);

    /// Around a wait for another thread: meanwhile a job that is ready may run in the caller's place.
    /// Within another one it changes nothing. Costs nothing on threads that are not the pool's.
    class BlockingRegion {
    public:
        BlockingRegion();
        ~BlockingRegion();
        BlockingRegion(const BlockingRegion&) = delete;
        BlockingRegion& operator=(const BlockingRegion&) = delete;
    };

private:
    struct Work {
        Job job;
        std::string_view name;
    };

    ThreadPool();
    void startThread();
    void run() noexcept;
    bool takeWork(Work& work);
    bool wakeOneIfNeeded() REQUIRES(mutex_);
    bool parkUntilWoken() REQUIRES(mutex_);
    void willBlock();
    void didBlock();

    const std::size_t runningMax_;

    Mutex mutex_;
    Condition woken_;
    std::deque<Work> ready_ GUARDED_BY(mutex_);
    // Every thread is one of running, parked or blocked. One that was chosen to run counts as running before it has
    // woken up: otherwise two jobs in quick succession would both count on the same sleeper.
    std::size_t threads_ GUARDED_BY(mutex_) = 0;
    std::size_t running_ GUARDED_BY(mutex_) = 0;
    std::size_t parked_ GUARDED_BY(mutex_) = 0;
    std::size_t wakeUps_ GUARDED_BY(mutex_) = 0;  ///< given to parked threads, not yet taken by one
};

}  // namespace cindral
