#pragma once

#include <memory>

#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselEnumerator.h"

namespace cindral {

class FSChangesEnumerator;
class LocalFileEnumerator;

/// Stands between one change enumeration and the host's observer: passes everything on, and takes the enumeration out
/// of its enumerator when it ends.
///
/// The first end is passed on, and only while the change enumeration exists; what comes after it reaches nobody.
///
/// Thread safety: setFSChangesEnumerator() and the two ends, from any thread. Called on the event reader's queue.
class LocalChangesObserverContext : public TesselChangeObserver {
public:
    LocalChangesObserverContext(std::shared_ptr<TesselChangeObserver> observer,
                                std::shared_ptr<LocalFileEnumerator> localFileEnumerator,
                                bool shouldUpdateFileIDInPalimp);
    ~LocalChangesObserverContext() override;

    /// Once, after the change enumeration was made with this context.
    void setFSChangesEnumerator(std::weak_ptr<FSChangesEnumerator> enumerator);

    void didUpdateItems(TesselItems items) override;
    void didDeleteItemsWithIdentifiers(std::vector<TesselItemIdentifier> identifiers) override;
    void finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor anchor, bool moreComing) override;
    void finishEnumeratingWithError(const KsError& error) override;

private:
    /// The change enumeration, for the first who asks and while it exists.
    std::shared_ptr<FSChangesEnumerator> takeFSChangesEnumerator();
    static void updateFileIDInPalimp(const TesselItem& item);

    const std::shared_ptr<TesselChangeObserver> observer_;
    const std::shared_ptr<LocalFileEnumerator> localFileEnumerator_;
    const bool shouldUpdateFileIDInPalimp_;

    Mutex mutex_;
    std::weak_ptr<FSChangesEnumerator> fsChangesEnumerator_ GUARDED_BY(mutex_);
};

}  // namespace cindral
