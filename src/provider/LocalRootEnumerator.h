#pragma once

#include <memory>
#include <vector>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/tessel/TesselEnumerator.h"
#include "provider/LocalAppLibraryManager.h"
#include "provider/LocalFileEnumerator.h"

namespace cindral {

/// Lists the root, the working set or all directories: the app libraries, then the files under every app library's root
/// and under the document storage.
///
/// The app libraries are those of a manager of its own, which is brought up to the newest list by a request for changes,
/// never by a listing. The anchor says which version of the list the client was told of; one of a version that the
/// manager is not at has expired. A page has expired when the list is another one than when the listing began.
///
/// Thread safety: all operations, from any thread. Listings and requests for changes return at once and are worked on
/// one at a time, in the order of the calls.
class LocalRootEnumerator : public TesselEnumerator, public std::enable_shared_from_this<LocalRootEnumerator> {
public:
    static std::shared_ptr<LocalRootEnumerator> initWithContainer(TesselItemIdentifier container);

    void enumerateItemsForObserver(std::shared_ptr<TesselEnumerationObserver> observer,
                                   const TesselPage& page) override;
    void enumerateChangesForObserver(std::shared_ptr<TesselChangeObserver> observer,
                                     const TesselSyncAnchor& anchor) override;
    void currentSyncAnchorWithCompletionHandler(
        std::function<void(std::optional<TesselSyncAnchor>)> completion) override;
    void start() override;
    void stop() override;
    void invalidate() override;

    const TesselItemIdentifier& container() const { return container_; }
    const std::shared_ptr<LocalAppLibraryManager>& appLibraryManager() const { return appLibraryManager_; }
    /// Another one after the list of roots has changed.
    std::shared_ptr<LocalFileEnumerator> localFileEnumerator() const;
    bool isRunning() const;
    const SerialQueue& enumQueue() const { return enumQueue_; }

private:
    explicit LocalRootEnumerator(TesselItemIdentifier container);
    bool isWorkingSet() const { return container_ == kTesselWorkingSetContainerItemIdentifier; }
    std::vector<KsURL> monitoredRoots() const;

    void listItems(const std::shared_ptr<TesselEnumerationObserver>& observer, const TesselPage& page);
    void listChanges(const std::shared_ptr<TesselChangeObserver>& observer, const TesselSyncAnchor& anchor);
    /// False when the observer has been finished.
    bool notifyAppLibraryChanges(TesselChangeObserver& observer, FSChangeToken& token);
    bool sendAllKnown(TesselChangeObserver& observer, FSChangeToken& token);
    bool sendNews(TesselChangeObserver& observer, FSChangeToken& token);
    bool upgrade(TesselChangeObserver* observer);
    bool takeNewerList(TesselChangeObserver* observer);
    void updateMonitoredRoots();
    bool sendContents(TesselChangeObserver& observer, const std::vector<KsURL>& roots) const;
    bool sendDepartures(TesselChangeObserver& observer, const std::vector<KsURL>& roots, std::uint64_t since) const;
    bool isCurrentAndRunning(const std::shared_ptr<LocalFileEnumerator>& enumerator) const;

    // Constant after construction.
    const TesselItemIdentifier container_;
    const std::shared_ptr<LocalAppLibraryManager> appLibraryManager_;

    mutable Mutex mutex_;
    std::shared_ptr<LocalFileEnumerator> localFileEnumerator_ GUARDED_BY(mutex_);
    bool isRunning_ GUARDED_BY(mutex_) = false;

    SerialQueue enumQueue_{"cindral.root-enumerator.queue"};  // Last: its tasks use what stands above.
};

}  // namespace cindral
