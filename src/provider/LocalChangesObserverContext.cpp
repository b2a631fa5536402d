#include "provider/LocalChangesObserverContext.h"

#include <utility>

#include "platform/foundation/Log.h"
#include "platform/revisions/RvStorageManager.h"
#include "provider/LocalFileEnumerator.h"

namespace cindral {

LocalChangesObserverContext::LocalChangesObserverContext(std::shared_ptr<TesselChangeObserver> observer,
                                                         std::shared_ptr<LocalFileEnumerator> localFileEnumerator,
                                                         bool shouldUpdateFileIDInPalimp)
    : observer_(std::move(observer)),
      localFileEnumerator_(std::move(localFileEnumerator)),
      shouldUpdateFileIDInPalimp_(shouldUpdateFileIDInPalimp) {}

LocalChangesObserverContext::~LocalChangesObserverContext() = default;

void LocalChangesObserverContext::setFSChangesEnumerator(std::weak_ptr<FSChangesEnumerator> enumerator) {
    const MutexLock lock(mutex_);
    fsChangesEnumerator_ = std::move(enumerator);
}

std::shared_ptr<FSChangesEnumerator> LocalChangesObserverContext::takeFSChangesEnumerator() {
    const MutexLock lock(mutex_);
    return std::exchange(fsChangesEnumerator_, {}).lock();
}

void LocalChangesObserverContext::updateFileIDInPalimp(const TesselItem& item) {
    logDebug("updating fileID in palimp for {}", item.description());
    const KsURL* url = item.fileURL();
    if (url == nullptr) return;
    // Brings the store's record up to date. What it answers, also an error, changes nothing about the update.
    (void)RvStorageManager::defaultManager().permanentStorageForItem(*url, RvStorageManager::AllocateIfNone::no);
}

void LocalChangesObserverContext::didUpdateItems(TesselItems items) {
    if (shouldUpdateFileIDInPalimp_) {
        for (const auto& item : items) updateFileIDInPalimp(*item);
    }
    observer_->didUpdateItems(std::move(items));
}

void LocalChangesObserverContext::didDeleteItemsWithIdentifiers(std::vector<TesselItemIdentifier> identifiers) {
    observer_->didDeleteItemsWithIdentifiers(std::move(identifiers));
}

void LocalChangesObserverContext::finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor anchor, bool moreComing) {
    const auto enumerator = takeFSChangesEnumerator();
    if (!enumerator) return;
    observer_->finishEnumeratingChangesUpToSyncAnchor(std::move(anchor), moreComing);
    localFileEnumerator_->removeEnumerator(enumerator);
}

void LocalChangesObserverContext::finishEnumeratingWithError(const KsError& error) {
    const auto enumerator = takeFSChangesEnumerator();
    if (!enumerator) return;
    observer_->finishEnumeratingWithError(error);
    localFileEnumerator_->removeEnumerator(enumerator);
}

}  // namespace cindral
