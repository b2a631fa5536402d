#pragma once

#include <memory>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/tessel/TesselEnumerator.h"
#include "provider/LocalFileEnumerator.h"

namespace cindral {

/// Lists the root, the working set or all directories: the files under the document storage and under every app
/// library's root.
///
/// Thread safety: all operations, from any thread. Listings return at once and are worked on one at a time, in the
/// order of the calls.
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

private:
    explicit LocalRootEnumerator(TesselItemIdentifier container);
    /// Answers what it was before.
    bool setRunning(bool isRunning);

    const TesselItemIdentifier container_;
    const std::shared_ptr<LocalFileEnumerator> localFileEnumerator_;
    Mutex mutex_;
    bool isRunning_ GUARDED_BY(mutex_) = false;
    SerialQueue enumQueue_{"cindral.root-enumerator.queue"};  // Last: its tasks use what stands above.
};

}  // namespace cindral
