#include "host/ChangesReadAhead.h"

#include <cerrno>
#include <optional>
#include <utility>

#include "platform/foundation/SerialQueue.h"

namespace cindral {

/// A batch that was begun, or is to be, before anybody asked for it.
class ChangesReadAhead::Batch {
public:
    Batch(TesselItemIdentifier container, TesselSyncAnchor from)
        : container(std::move(container)), from(std::move(from)) {}

    const TesselItemIdentifier container;
    const TesselSyncAnchor from;
    /// The container's before the batch was begun. Written before the end, read behind it.
    TesselSyncAnchor present;

    void finish(Result<Answer> result) {
        std::function<void()> waiting;
        {
            const MutexLock lock(mutex_);
            result_ = std::move(result);
            waiting.swap(waiting_);
        }
        if (waiting) waiting();
    }
    /// Calls at once what is to come behind the end, or when that comes.
    void whenFinished(std::function<void()> next) {
        {
            const MutexLock lock(mutex_);
            if (!result_) {
                waiting_ = std::move(next);
                return;
            }
        }
        next();
    }
    /// Behind the end.
    const Result<Answer>& result() const {
        const MutexLock lock(mutex_);
        return *result_;
    }

private:
    mutable Mutex mutex_;
    std::optional<Result<Answer>> result_ GUARDED_BY(mutex_);
    std::function<void()> waiting_ GUARDED_BY(mutex_);
};

ChangesReadAhead::~ChangesReadAhead() {
    underWay_.wait();
}

void ChangesReadAhead::enumerateChanges(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor,
                                        Completion completion) {
    if (const auto batch = take(container, anchor)) {
        batch->whenFinished(
            [this, batch, completion = std::move(completion)]() mutable { handOut(batch, std::move(completion)); });
    } else {
        enumerateNow(container, anchor, std::move(completion));
    }
}

/// What nobody has asked for by now is not wanted any more.
std::shared_ptr<ChangesReadAhead::Batch> ChangesReadAhead::take(const TesselItemIdentifier& container,
                                                                const TesselSyncAnchor& anchor) {
    std::shared_ptr<Batch> batch;
    {
        const MutexLock lock(mutex_);
        batch.swap(next_);
    }
    return batch && batch->container == container && batch->from == anchor ? batch : nullptr;
}

void ChangesReadAhead::enumerate(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor,
                                 std::function<void(Result<Answer>)> completion) {
    client_.enumerateChanges(container, anchor,
                             [this, completion = std::move(completion)](Result<ChangesBatch> changes) {
                                 if (!changes.ok()) return completion(std::move(changes).error());
                                 completion(Answer{write_(*changes), std::move(changes->anchor), changes->moreComing});
                             });
}

void ChangesReadAhead::enumerateNow(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor,
                                    Completion completion) {
    enumerate(container, anchor, [this, container, completion = std::move(completion)](const Result<Answer>& result) {
        if (!result.ok()) return completion(result.error());
        answer(container, *result, completion);
    });
}

void ChangesReadAhead::handOut(const std::shared_ptr<Batch>& batch, Completion completion) {
    // An error is not remembered either: asked now, the answer may be another.
    if (!batch->result().ok()) return enumerateNow(batch->container, batch->from, std::move(completion));
    client_.currentSyncAnchor(batch->container, [this, batch, completion = std::move(completion)](
                                                    const Result<std::optional<TesselSyncAnchor>>& anchor) mutable {
        if (anchor.ok() && *anchor == batch->present) {
            answer(batch->container, *batch->result(), completion);
        } else {
            enumerateNow(batch->container, batch->from, std::move(completion));
        }
    });
}

void ChangesReadAhead::answer(const TesselItemIdentifier& container, const Answer& answer,
                              const Completion& completion) {
    if (!answer.moreComing) return completion(answer.text);
    const auto next = std::make_shared<Batch>(container, answer.anchor);
    underWay_.enter();
    {
        // Before the answer: the client may be back at once.
        const MutexLock lock(mutex_);
        next_ = next;
    }
    completion(answer.text);
    // This may be a thread on which a provider's queue has its turn.
    dispatchAsync([this, next] { begin(next); });
}

void ChangesReadAhead::begin(const std::shared_ptr<Batch>& batch) {
    client_.currentSyncAnchor(batch->container, [this, batch](const Result<std::optional<TesselSyncAnchor>>& anchor) {
        if (!anchor.ok()) return finish(batch, anchor.error());
        if (!*anchor) return finish(batch, KsError::posix(ENOTSUP));
        batch->present = **anchor;
        enumerate(batch->container, batch->from,
                  [this, batch](Result<Answer> result) { finish(batch, std::move(result)); });
    });
}

void ChangesReadAhead::finish(const std::shared_ptr<Batch>& batch, Result<Answer> result) {
    batch->finish(std::move(result));
    underWay_.leave();
}

}  // namespace cindral
