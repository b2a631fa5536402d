#include "platform/tessel/TSPacer.h"

#include <optional>
#include <utility>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/foundation/SharedTimer.h"

namespace cindral {

using TimePoint = std::chrono::steady_clock::time_point;

struct TSPacer::State : std::enable_shared_from_this<State> {
    State(std::string itsName, SerialQueue& itsQueue, std::chrono::milliseconds interval, Clock itsClock,
          Timer itsTimer)
        : name(std::move(itsName)),
          queue(itsQueue),
          minFireInterval(interval),
          clock(std::move(itsClock)),
          timer(std::move(itsTimer)) {}

    const std::string name;
    SerialQueue& queue;
    const std::chrono::milliseconds minFireInterval;
    const Clock clock;
    const Timer timer;

    Mutex mutex;
    std::shared_ptr<const std::function<void()>> block GUARDED_BY(mutex);
    std::optional<TimePoint> lastEvent GUARDED_BY(mutex);  ///< when the last event began
    bool isSuspended GUARDED_BY(mutex) = true;
    bool isPending GUARDED_BY(mutex) = false;
    bool isOnQueue GUARDED_BY(mutex) = false;     ///< an event was put on the queue and has not begun
    bool isTimerAsked GUARDED_BY(mutex) = false;  ///< and has not called back
    bool hasEnded GUARDED_BY(mutex) = false;

    /// After every change of what mayFire() looks at. The moment to ask the timer for, if there is one.
    std::optional<TimePoint> putOnQueueIfDue() REQUIRES(mutex) {
        if (!mayFire() || isOnQueue) return std::nullopt;
        if (lastEvent && clock() < *lastEvent + minFireInterval) {
            if (std::exchange(isTimerAsked, true)) return std::nullopt;
            return *lastEvent + minFireInterval;
        }
        isOnQueue = true;
        // Under the lock: once the pacer has ended, the queue may go too.
        queue.async([self = shared_from_this()] { self->fire(); });
        return std::nullopt;
    }

    /// Outside the lock: a timer may call back at once.
    void askTimer(std::optional<TimePoint> moment) EXCLUDES(mutex) {
        if (moment) timer(*moment, [weak = weak_from_this()] { onTimer(weak); });
    }

    bool mayFire() const REQUIRES(mutex) { return isPending && !isSuspended && !hasEnded && block != nullptr; }

    void fire() EXCLUDES(mutex) {
        std::shared_ptr<const std::function<void()>> event;
        {
            const MutexLock lock(mutex);
            isOnQueue = false;
            if (!mayFire()) return;
            // Before the event: what is signalled from here on may have come too late for it.
            isPending = false;
            lastEvent = clock();
            event = block;
        }
        (*event)();
    }

    static void onTimer(const std::weak_ptr<State>& weak) {
        const auto self = weak.lock();
        if (self == nullptr) return;
        std::optional<TimePoint> moment;
        {
            const MutexLock lock(self->mutex);
            self->isTimerAsked = false;
            moment = self->putOnQueueIfDue();
        }
        self->askTimer(moment);
    }
};

TSPacer::TSPacer(std::string name, SerialQueue& queue, std::chrono::milliseconds minFireInterval)
    : TSPacer(std::move(name), queue, minFireInterval, std::chrono::steady_clock::now,
              [](TimePoint moment, std::function<void()> callback) {
                  SharedTimer::shared().callAt(moment, std::move(callback));
              }) {}

TSPacer::TSPacer(std::string name, SerialQueue& queue, std::chrono::milliseconds minFireInterval, Clock clock,
                 Timer timer)
    : state_(std::make_shared<State>(std::move(name), queue, minFireInterval, std::move(clock), std::move(timer))) {}

TSPacer::~TSPacer() {
    std::shared_ptr<const std::function<void()>> block;  // What it holds goes after the lock.
    const MutexLock lock(state_->mutex);
    state_->hasEnded = true;
    state_->block.swap(block);
}

const std::string& TSPacer::name() const {
    return state_->name;
}

void TSPacer::setEventBlock(std::function<void()> block) {
    auto shared = block ? std::make_shared<const std::function<void()>>(std::move(block)) : nullptr;
    std::optional<TimePoint> moment;
    {
        const MutexLock lock(state_->mutex);
        state_->block.swap(shared);
        moment = state_->putOnQueueIfDue();
    }
    state_->askTimer(moment);
}

void TSPacer::resume() {
    std::optional<TimePoint> moment;
    {
        const MutexLock lock(state_->mutex);
        state_->isSuspended = false;
        moment = state_->putOnQueueIfDue();
    }
    state_->askTimer(moment);
}

void TSPacer::suspend() {
    const MutexLock lock(state_->mutex);
    state_->isSuspended = true;
}

void TSPacer::signal() {
    std::optional<TimePoint> moment;
    {
        const MutexLock lock(state_->mutex);
        state_->isPending = true;
        moment = state_->putOnQueueIfDue();
    }
    state_->askTimer(moment);
}

bool TSPacer::isSignalPending() const {
    const MutexLock lock(state_->mutex);
    return state_->isPending;
}

}  // namespace cindral
