#include "provider/ChangesAhead.h"

#include <cerrno>

namespace cindral {

void ChangesAhead::whenDone(std::function<void()> callBack) {
    {
        const MutexLock lock(mutex_);
        if (!isDone_) {
            callBack_ = std::move(callBack);
            return;
        }
    }
    callBack();
}

bool ChangesAhead::handTo(TesselChangeObserver& observer) {
    std::vector<Call> calls;
    Call end;
    {
        const MutexLock lock(mutex_);
        calls.swap(calls_);
        end.swap(end_);
    }
    if (!end) return false;
    for (const Call& call : calls) call(observer);
    end(observer);
    return true;
}

void ChangesAhead::add(Call call) {
    const MutexLock lock(mutex_);
    calls_.push_back(std::move(call));
}

void ChangesAhead::done(Call end) {
    std::function<void()> callBack;
    {
        const MutexLock lock(mutex_);
        end_ = std::move(end);
        isDone_ = true;
        callBack.swap(callBack_);
    }
    if (callBack) callBack();
}

void ChangesAhead::didUpdateItems(TesselItems items) {
    add([items = std::move(items)](TesselChangeObserver& observer) { observer.didUpdateItems(items); });
}

void ChangesAhead::didDeleteItemsWithIdentifiers(std::vector<TesselItemIdentifier> identifiers) {
    add([identifiers = std::move(identifiers)](TesselChangeObserver& observer) {
        observer.didDeleteItemsWithIdentifiers(identifiers);
    });
}

void ChangesAhead::finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor anchor, bool moreComing) {
    done([anchor = std::move(anchor), moreComing](TesselChangeObserver& observer) {
        observer.finishEnumeratingChangesUpToSyncAnchor(anchor, moreComing);
    });
}

void ChangesAhead::finishEnumeratingWithError(const KsError& error) {
    // Whoever stopped it meant all who ask. What else failed is tried again.
    if (!error.isPosix(ECANCELED)) return done(nullptr);
    done([error](TesselChangeObserver& observer) { observer.finishEnumeratingWithError(error); });
}

}  // namespace cindral
