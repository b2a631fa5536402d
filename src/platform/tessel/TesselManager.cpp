#include "platform/tessel/TesselManager.h"

#include <utility>

#include "platform/foundation/Fatal.h"

namespace cindral {

TesselManager& TesselManager::defaultManager() {
    static TesselManager& manager = *new TesselManager;
    return manager;
}

std::shared_ptr<const KsURL> TesselManager::sharedDocumentStorageURL() const {
    const MutexLock lock(mutex_);
    if (!documentStorageURL_) fatal("the document storage was asked for before the host has set it");
    return documentStorageURL_;
}

void TesselManager::setDocumentStorageURL(KsURL url) {
    auto shared = std::make_shared<const KsURL>(std::move(url));
    const MutexLock lock(mutex_);
    documentStorageURL_.swap(shared);
}

KsURL TesselManager::applicationSupportURL() const {
    const MutexLock lock(mutex_);
    if (!applicationSupportURL_) fatal("the application-support folder was asked for before the host has set it");
    return *applicationSupportURL_;
}

void TesselManager::setApplicationSupportURL(KsURL url) {
    auto shared = std::make_shared<const KsURL>(std::move(url));
    const MutexLock lock(mutex_);
    applicationSupportURL_.swap(shared);
}

void TesselManager::setHost(std::shared_ptr<Host> host) {
    // The host that was there goes after the lock: its end may call in here.
    const MutexLock lock(mutex_);
    host_.swap(host);
}

std::shared_ptr<TesselManager::Host> TesselManager::host() const {
    const MutexLock lock(mutex_);
    return host_;
}

void TesselManager::signalEnumeratorForContainerItemIdentifier(const TesselItemIdentifier& container,
                                                               Completion completion) {
    if (!completion) completion = [](const std::optional<KsError>&) {};
    if (const auto present = host()) {
        present->signalEnumerator(container, std::move(completion));
    } else {
        completion(std::nullopt);
    }
}

void TesselManager::deleteSearchableItemsWithDomainIdentifiers(const std::vector<std::string>& domains,
                                                               Completion completion) {
    if (!completion) completion = [](const std::optional<KsError>&) {};
    if (const auto present = host()) {
        present->deleteSearchableItems(domains, std::move(completion));
    } else {
        completion(std::nullopt);
    }
}

}  // namespace cindral
