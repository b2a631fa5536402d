#pragma once

#include <functional>
#include <memory>
#include <utility>
#include <vector>

#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselEnumerator.h"
#include "provider/fs/FSChangeToken.h"

namespace cindral {

/// The batch of changes that comes after the one a client was given, enumerated while it still reads that one.
///
/// Whoever asks from the token later may be given the batch instead of one of its own for as long as nothing has
/// happened since the enumeration began: it would find the same.
///
/// Thread safety: all operations, from any thread.
class ChangesAhead : public TesselChangeObserver {
public:
    /// `currentEventID` is that of the moment at which the enumeration is begun.
    ChangesAhead(FSChangeToken since, std::uint64_t currentEventID)
        : since_(std::move(since)), currentEventID_(currentEventID) {}

    const FSChangeToken& since() const { return since_; }
    std::uint64_t currentEventID() const { return currentEventID_; }

    /// Calls back once the enumeration has ended, at once where it has. To be called once.
    void whenDone(std::function<void()> callBack);
    /// Ends the observer with what was found. False where that was an error that says nothing to others, and the
    /// observer is as it was. To be called once, when done.
    bool handTo(TesselChangeObserver& observer);

    void didUpdateItems(TesselItems items) override;
    void didDeleteItemsWithIdentifiers(std::vector<TesselItemIdentifier> identifiers) override;
    void finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor anchor, bool moreComing) override;
    void finishEnumeratingWithError(const KsError& error) override;

private:
    /// A call of an observer's, to be made again.
    using Call = std::function<void(TesselChangeObserver&)>;
    void add(Call call);
    void done(Call end);

    const FSChangeToken since_;
    const std::uint64_t currentEventID_;

    Mutex mutex_;
    std::vector<Call> calls_ GUARDED_BY(mutex_);
    Call end_ GUARDED_BY(mutex_);
    bool isDone_ GUARDED_BY(mutex_) = false;
    std::function<void()> callBack_ GUARDED_BY(mutex_);
};

}  // namespace cindral
