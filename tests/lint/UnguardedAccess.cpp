#include "platform/foundation/Mutex.h"

// Wrong on purpose, and part of no program: the thread-safety check is good for something only as long as it refuses
// this.

namespace cindral {

class Counter {
public:
    void increment() { ++count_; }

private:
    Mutex mutex_;
    int count_ GUARDED_BY(mutex_) = 0;
};

}  // namespace cindral
