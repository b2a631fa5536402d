#pragma once

#include <functional>
#include <memory>
#include <string>

#include "host/ProviderClient.h"
#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// Begins on a client's next batch of changes while the client still reads the one before: of a long list of changes,
/// half of the time is the client's.
///
/// A batch that was begun ahead is handed out only if nothing has happened since: if the container's anchor is the one
/// that it was before the batch was begun. Otherwise the batch is made anew, so that an answer is never older than its
/// request.
///
/// One batch at most is kept: the one that follows the last answer with more to come.
///
/// Thread safety: all operations, from any thread. Completions run on any thread, once.
class ChangesReadAhead {
public:
    /// `write` makes the text that a client is answered with; any thread, several at a time.
    using Writer = std::function<std::string(const ChangesBatch& changes)>;
    ChangesReadAhead(ProviderClient& client, Writer write) : client_(client), write_(std::move(write)) {}
    /// Waits for the batch that is under way. No request may be.
    ~ChangesReadAhead();
    ChangesReadAhead(const ChangesReadAhead&) = delete;
    ChangesReadAhead& operator=(const ChangesReadAhead&) = delete;

    using Completion = std::function<void(const Result<std::string>& text)>;
    void enumerateChanges(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor, Completion completion);

private:
    class Batch;
    struct Answer {
        std::string text;
        TesselSyncAnchor anchor;
        bool moreComing = false;
    };

    void enumerate(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor,
                   std::function<void(Result<Answer>)> completion);
    void enumerateNow(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor, Completion completion);
    void handOut(const std::shared_ptr<Batch>& batch, Completion completion);
    void answer(const TesselItemIdentifier& container, const Answer& answer, const Completion& completion);
    void begin(const std::shared_ptr<Batch>& batch);
    void finish(const std::shared_ptr<Batch>& batch, Result<Answer> result);
    std::shared_ptr<Batch> take(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor);

    ProviderClient& client_;
    const Writer write_;
    DispatchGroup underWay_;

    Mutex mutex_;
    std::shared_ptr<Batch> next_ GUARDED_BY(mutex_);
};

}  // namespace cindral
