#include "platform/foundation/SharedTimer.h"

#include <fmt/format.h>

#include <utility>

#include "platform/foundation/BackgroundThread.h"
#include "platform/foundation/Fatal.h"
#include "platform/foundation/Log.h"

namespace cindral {

SharedTimer& SharedTimer::shared() {
    static SharedTimer& timer = *new SharedTimer;
    return timer;
}

SharedTimer::SharedTimer() {
    // Without the thread nothing would ever be called back: signals to clients would be lost silently.
    if (const int error = startBackgroundThread([this] { run(); }); error != 0)
        fatal(fmt::format("can't start the timer's thread; {}", errnoText(error)));
}

void SharedTimer::callAt(TimePoint moment, std::function<void()> callback) {
    const MutexLock lock(mutex_);
    const auto added = pending_.emplace(moment, std::move(callback));
    if (added == pending_.begin()) changed_.notifyOne();
}

void SharedTimer::run() {
    nameCurrentThread("cindral.timer");
    while (true) {
        std::function<void()> callback;
        {
            const MutexLock lock(mutex_);
            while (pending_.empty() || pending_.begin()->first > std::chrono::steady_clock::now()) {
                if (pending_.empty()) {
                    changed_.wait(mutex_);
                } else {
                    changed_.waitUntil(mutex_, TimePoint(pending_.begin()->first));
                }
            }
            callback = std::move(pending_.begin()->second);
            pending_.erase(pending_.begin());
        }
        callback();
    }
}

}  // namespace cindral
