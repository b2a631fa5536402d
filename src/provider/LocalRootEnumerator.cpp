#include "provider/LocalRootEnumerator.h"

#include <utility>

#include "platform/foundation/Log.h"
#include "platform/tessel/TesselManager.h"
#include "provider/LocalAppLibraryManager.h"

namespace cindral {

namespace {

std::vector<KsURL> monitoredRoots() {
    std::vector<KsURL> roots = CdlAppLibraryManager::rootURLsForAppLibraries();
    roots.push_back(TesselManager::defaultManager().documentStorageURL());
    return roots;
}

}  // namespace

std::shared_ptr<LocalRootEnumerator> LocalRootEnumerator::initWithContainer(TesselItemIdentifier container) {
    return std::shared_ptr<LocalRootEnumerator>(new LocalRootEnumerator(std::move(container)));
}

LocalRootEnumerator::LocalRootEnumerator(TesselItemIdentifier container)
    : container_(std::move(container)),
      localFileEnumerator_(LocalFileEnumerator::initWithContainer(container_, monitoredRoots())) {}

void LocalRootEnumerator::enumerateItemsForObserver(std::shared_ptr<TesselEnumerationObserver> observer,
                                                    const TesselPage& page) {
    enumQueue_.async([self = shared_from_this(), observer = std::move(observer), page] {
        const LogSection section("enumerate root items for {}", self->container_);
        if (page == tesselInitialPageSortedByName() || page == tesselInitialPageSortedByDate()) {
            observer->didEnumerateItems({});
            logDebug("discovered {} app-libraries", 0);
        }
        self->localFileEnumerator_->enumerateItemsForObserver(observer, page);
    });
}

void LocalRootEnumerator::enumerateChangesForObserver(std::shared_ptr<TesselChangeObserver> observer,
                                                      const TesselSyncAnchor& anchor) {
    enumQueue_.async([self = shared_from_this(), observer = std::move(observer), anchor] {
        const LogSection section("enumerate root changes for {}", self->container_);
        self->localFileEnumerator_->enumerateChangesForObserver(observer, anchor);
    });
}

void LocalRootEnumerator::currentSyncAnchorWithCompletionHandler(
    std::function<void(std::optional<TesselSyncAnchor>)> completion) {
    localFileEnumerator_->currentSyncAnchorWithCompletionHandler(std::move(completion));
}

void LocalRootEnumerator::start() {
    if (!setRunning(true)) localFileEnumerator_->start();
}

void LocalRootEnumerator::stop() {
    if (setRunning(false)) localFileEnumerator_->stop();
}

bool LocalRootEnumerator::setRunning(bool isRunning) {
    const MutexLock lock(mutex_);
    return std::exchange(isRunning_, isRunning);
}

void LocalRootEnumerator::invalidate() {
    stop();
}

}  // namespace cindral
