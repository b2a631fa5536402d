#include "platform/foundation/SerialQueue.h"

#include <fmt/format.h>

#include <deque>
#include <string_view>
#include <utility>

#include "platform/foundation/Fatal.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/ThreadPool.h"

namespace cindral {
namespace {

/// Tasks that a thread runs of one queue before other queues get their turn.
constexpr int kTasksPerTurnMax = 64;

}  // namespace

struct SerialQueue::State {
    /// A thread that waits in sync() for its turn. Protected by the mutex; lives on that thread's stack.
    struct Waiter {
        Condition turn;
        bool hasTurn = false;
    };
    struct Entry {
        Task task;
        Waiter* waiter = nullptr;  ///< instead of a task
    };

    explicit State(std::string name) : label(std::move(name)) {}

    const std::string label;
    Mutex mutex;
    Condition idle;
    /// Some thread has the queue or has been asked to take it; without that, there are no entries.
    bool isTaken GUARDED_BY(mutex) = false;
    std::deque<Entry> entries GUARDED_BY(mutex);

    /// Passes the queue on. True when a task is next: the caller still has the queue, and must run it or have it run.
    bool passOn() REQUIRES(mutex) {
        if (entries.empty()) {
            isTaken = false;
            idle.notifyAll();
            return false;
        }
        Waiter* const waiter = entries.front().waiter;
        if (waiter == nullptr) return true;
        entries.pop_front();
        waiter->hasTurn = true;
        waiter->turn.notifyOne();
        return false;
    }

    bool takeTask(Task& task) EXCLUDES(mutex) {
        const MutexLock lock(mutex);
        if (!passOn()) return false;
        task = std::move(entries.front().task);
        entries.pop_front();
        return true;
    }
};

namespace {

/// The queues whose tasks the thread is in, innermost first: more than one where a task entered another queue with
/// sync().
struct Frame {
    const SerialQueue::State* state;
    const Frame* outer;
};
thread_local const Frame* innermost = nullptr;

class FrameScope {
public:
    explicit FrameScope(const SerialQueue::State& state) : frame_{&state, innermost} { innermost = &frame_; }
    ~FrameScope() { innermost = frame_.outer; }
    FrameScope(const FrameScope&) = delete;
    FrameScope& operator=(const FrameScope&) = delete;

private:
    Frame frame_;
};

bool isInside(const SerialQueue::State& state) {
    for (const Frame* frame = innermost; frame != nullptr; frame = frame->outer) {
        if (frame->state == &state) return true;
    }
    return false;
}

/// An exception that leaves a task ends the process: nobody is there to take it.
void run(const SerialQueue::Task& task) noexcept {
    task();
}

void drain(const std::shared_ptr<SerialQueue::State>& state);

void scheduleDrain(std::shared_ptr<SerialQueue::State> state) {
    const std::string_view label = state->label;  // Lives with the job.
    ThreadPool::shared().submit([state = std::move(state)] { drain(state); }, label);
}

void drain(const std::shared_ptr<SerialQueue::State>& state) {
    for (int i = 0; i < kTasksPerTurnMax; ++i) {
        // Inside the frame also when the task is destroyed: what it held may be the last reference to the queue's
        // owner.
        const FrameScope frame(*state);
        SerialQueue::Task task;
        if (!state->takeTask(task)) return;
        run(task);
    }
    scheduleDrain(state);
}

}  // namespace

SerialQueue::SerialQueue(std::string label) : state_(std::make_shared<State>(std::move(label))) {}

SerialQueue::~SerialQueue() {
    std::deque<State::Entry> dropped;
    if (isInside(*state_)) {
        const MutexLock lock(state_->mutex);
        dropped.swap(state_->entries);
        for (const State::Entry& entry : dropped) {
            if (entry.waiter != nullptr)
                fatal(fmt::format("queue \"{}\" is destroyed while a thread waits to enter it", state_->label));
        }
        return;
    }
    const ThreadPool::BlockingRegion region;
    const MutexLock lock(state_->mutex);
    while (state_->isTaken) state_->idle.wait(state_->mutex);
}

const std::string& SerialQueue::label() const {
    return state_->label;
}

void SerialQueue::async(Task task) {
    {
        const MutexLock lock(state_->mutex);
        state_->entries.push_back({std::move(task), nullptr});
        if (std::exchange(state_->isTaken, true)) return;
    }
    scheduleDrain(state_);
}

void SerialQueue::sync(const Task& task) {
    if (isCurrent()) fatal(fmt::format("queue \"{}\" is entered synchronously from one of its own tasks", label()));
    // The task may destroy the queue.
    const std::shared_ptr<State> state = state_;
    State::Waiter waiter;
    bool mustWait = false;
    {
        const MutexLock lock(state->mutex);
        mustWait = std::exchange(state->isTaken, true);
        if (mustWait) state->entries.push_back({nullptr, &waiter});
    }
    if (mustWait) {
        const ThreadPool::BlockingRegion region;
        const MutexLock lock(state->mutex);
        while (!waiter.hasTurn) waiter.turn.wait(state->mutex);
    }
    {
        const FrameScope frame(*state);
        run(task);
    }
    bool hasTask = false;
    {
        const MutexLock lock(state->mutex);
        hasTask = state->passOn();
    }
    if (hasTask) scheduleDrain(state);
}

bool SerialQueue::isCurrent() const {
    return isInside(*state_);
}

void SerialQueue::assertCurrent() const {
    if (!isCurrent()) fatal(fmt::format("not on queue \"{}\"", label()));
}

SerialQueue& SerialQueue::main() {
    static SerialQueue& queue = *new SerialQueue("main");
    return queue;
}

void dispatchAsync(std::function<void()> task) {
    ThreadPool::shared().submit(std::move(task));
}

}  // namespace cindral
