#include "platform/foundation/ThreadPool.h"

#include <pthread.h>
#include <signal.h>

#include <algorithm>
#include <cstring>
#include <system_error>
#include <thread>
#include <utility>

#include "platform/foundation/Fatal.h"
#include "platform/foundation/Log.h"

namespace cindral {
namespace {

constexpr std::size_t kThreadNameBytesMax = 15;

thread_local bool isPoolThread = false;
thread_local char currentName[kThreadNameBytesMax + 1] = "";

// Signals sent to the process are for the host's own threads; those that a thread brings upon itself must reach it.
sigset_t signalsForOthers() {
    sigset_t signals;
    ::sigfillset(&signals);
    for (const int own : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT, SIGTRAP, SIGSYS}) ::sigdelset(&signals, own);
    return signals;
}

void nameThread(std::string_view name) {
    name = name.substr(0, kThreadNameBytesMax);
    // A system call less where one queue comes after itself.
    if (name == currentName) return;
    std::memcpy(currentName, name.data(), name.size());
    currentName[name.size()] = '\0';
    ::pthread_setname_np(::pthread_self(), currentName);
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
    const sigset_t blocked = signalsForOthers();
    sigset_t before;
    ::pthread_sigmask(SIG_SETMASK, &blocked, &before);
    int error = 0;
    try {
        std::thread([this] { run(); }).detach();
    } catch (const std::system_error& failure) {
        error = failure.code().value();
    }
    ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
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
    if (isPoolThread) ThreadPool::shared().willBlock();
}

ThreadPool::BlockingRegion::~BlockingRegion() {
    if (isPoolThread) ThreadPool::shared().didBlock();
}

}  // namespace cindral
