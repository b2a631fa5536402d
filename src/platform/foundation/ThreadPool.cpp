#include "platform/foundation/ThreadPool.h"

#include <algorithm>
#include <string>
#include <thread>
#include <utility>

#include "platform/foundation/BackgroundThread.h"
#include "platform/foundation/Fatal.h"
#include "platform/foundation/Log.h"

namespace cindral {
namespace {

thread_local bool isPoolThread = false;
thread_local int blockingDepth = 0;

void nameThread(std::string_view name) {
    // Saves a system call where one queue comes after itself. Names that are equal as far as the kernel shows them may
    // differ here.
    static thread_local std::string currentName;
    if (name == currentName) return;
    currentName = name;
    nameCurrentThread(name);
}

}  // namespace

ThreadPool::ThreadPool() : runningMax_(std::max<std::size_t>(2, std::thread::hardware_concurrency())) {}

ThreadPool& ThreadPool::shared() {
    static ThreadPool& pool = *new ThreadPool;
    return pool;
}

void ThreadPool::submit(Job job, std::string_view name) {
    bool startsOne = false;
    {
        const MutexLock lock(mutex_);
        ready_.push_back({std::move(job), name});
        startsOne = wakeOneIfNeeded();
    }
    if (startsOne) startThread();
}

/// True when the caller is to start a thread, which is counted already.
bool ThreadPool::wakeOneIfNeeded() {
    if (ready_.empty() || running_ >= runningMax_) return false;
    if (parked_ > 0) {
        --parked_;
        ++running_;
        ++wakeUps_;
        woken_.notifyOne();
        return false;
    }
    if (threads_ >= kThreadsMax) return false;
    ++threads_;
    ++running_;
    return true;
}

void ThreadPool::startThread() {
    const int error = startBackgroundThread([this] { run(); });
    if (error == 0) return;

    bool isAlone = false;
    {
        const MutexLock lock(mutex_);
        --threads_;
        --running_;
        isAlone = threads_ == 0;
    }
    const std::string message = fmt::format("can't start a thread; {}", errnoText(error));
    if (isAlone) fatal(message);
    // The job is run by one of the others once that is free.
    logError("{}", message);
}

void ThreadPool::run() noexcept {
    isPoolThread = true;
    while (true) {
        Work work;
        if (!takeWork(work)) return;
        nameThread(work.name);
        work.job();
    }
}

/// False when the thread is to end.
bool ThreadPool::takeWork(Work& work) {
    const MutexLock lock(mutex_);
    // More than runningMax_ run when blocked ones came back: the others see to the jobs then.
    while (ready_.empty() || running_ > runningMax_) {
        if (!parkUntilWoken()) return false;
    }
    work = std::move(ready_.front());
    ready_.pop_front();
    return true;
}

bool ThreadPool::parkUntilWoken() {
    --running_;
    if (parked_ >= runningMax_) {
        --threads_;
        return false;
    }
    nameThread(kThreadName);
    ++parked_;
    while (wakeUps_ == 0) woken_.wait(mutex_);
    --wakeUps_;
    return true;
}

void ThreadPool::willBlock() {
    bool startsOne = false;
    {
        const MutexLock lock(mutex_);
        --running_;
        startsOne = wakeOneIfNeeded();
    }
    if (startsOne) startThread();
}

void ThreadPool::didBlock() {
    const MutexLock lock(mutex_);
    ++running_;
}

ThreadPool::BlockingRegion::BlockingRegion() {
    if (isPoolThread && blockingDepth++ == 0) ThreadPool::shared().willBlock();
}

ThreadPool::BlockingRegion::~BlockingRegion() {
    if (isPoolThread && --blockingDepth == 0) ThreadPool::shared().didBlock();
}

}  // namespace cindral
