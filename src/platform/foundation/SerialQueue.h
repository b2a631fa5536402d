#pragma once

#include <functional>
#include <memory>
#include <string>

#include "platform/foundation/ThreadAnnotations.h"

namespace cindral {

/// Runs tasks one at a time, in the order in which they came.
///
/// Queues share a small pool of threads; a queue without tasks costs none. While a thread of the pool runs a task, it
/// bears the queue's label as its name (cut to the kernel's 15 bytes); sync() runs its task on the caller's thread,
/// once it is its turn. The pool grows when its threads block in sync() or in a wait of DispatchGroup or
/// DispatchSemaphore, so that waiting for another queue never starves it.
///
/// An exception that leaves a task ends the process.
///
/// Destroying a queue waits for the tasks that were put on it, unless it is destroyed by one of its own tasks, which
/// then is its last: tasks behind it are dropped. Nobody may use a queue that is being destroyed but its own tasks.
///
/// Thread safety: all operations, from any thread.
class CAPABILITY("serial queue") SerialQueue {
public:
    using Task = std::function<void()>;

    explicit SerialQueue(std::string label);
    ~SerialQueue();
    SerialQueue(const SerialQueue&) = delete;
    SerialQueue& operator=(const SerialQueue&) = delete;

    const std::string& label() const;
    void async(Task task);
    /// Runs the task on the queue and returns when it is done. Aborts with a message when called from a task of this
    /// queue: it would wait for itself.
    void sync(const Task& task);
    /// Whether the caller is a task of this queue, also where that task has entered another queue with sync().
    bool isCurrent() const;
    /// Aborts unless the caller is a task of this queue. The first line of a task.
    void assertCurrent() const ASSERT_CAPABILITY(this);

    /// The queue of the process's main work: what must not run on the thread that lets go of an object.
    static SerialQueue& main();

    struct State;

private:
    std::shared_ptr<State> state_;
};

/// Runs the task on a thread of the shared pool, beside others.
void dispatchAsync(std::function<void()> task);

}  // namespace cindral
