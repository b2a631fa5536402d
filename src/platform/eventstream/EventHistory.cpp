#include "platform/eventstream/EventHistory.h"

#include <utility>

#include "platform/foundation/Mutex.h"

namespace cindral {

namespace {

struct SharedHistory {
    Mutex mutex;
    std::shared_ptr<EventHistory> history GUARDED_BY(mutex);
};

SharedHistory& sharedHistory() {
    // Never destroyed: work that ends with the process may still ask.
    static SharedHistory& shared = *new SharedHistory;
    return shared;
}

}  // namespace

std::shared_ptr<EventHistory> EventHistory::shared() {
    SharedHistory& shared = sharedHistory();
    const MutexLock lock(shared.mutex);
    return shared.history;
}

void EventHistory::setShared(std::shared_ptr<EventHistory> history) {
    SharedHistory& shared = sharedHistory();
    {
        const MutexLock lock(shared.mutex);
        shared.history.swap(history);
    }
    // The one before goes without the lock.
    history.reset();
}

}  // namespace cindral
