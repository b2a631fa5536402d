#include "provider/AppRefresh.h"

#include "platform/foundation/Log.h"
#include "platform/tessel/TesselManager.h"
#include "provider/LocalAppLibraryManager.h"

namespace cindral {
namespace {

void signal(const TesselItemIdentifier& container) {
    logInfo("notify changes on {}", container);
    TesselManager::defaultManager().signalEnumeratorForContainerItemIdentifier(container,
                                                                               [](const std::optional<KsError>&) {});
}

}  // namespace

void refreshApps(const std::function<void()>& refreshed) {
    const LogSection section("pacer event");
    const auto manager = LocalAppLibraryManager::shared();
    bool hasRootChanged = false;
    bool hasWorkingSetChanged = false;
    LocalAppLibraryManager::backgroundQueue().sync([&] {
        hasRootChanged = LocalAppLibraryManager::refreshAppLibraries();
        logDebug("auto-upgrading shared app library manager");
        hasWorkingSetChanged = manager->upgradeFromMainCache(nullptr, /*deleteIndexOfRemovedDomains=*/false);
        // Also when the list is the same: a folder may have been replaced by another of its name.
        manager->publishRoots();
    });
    refreshed();
    if (hasRootChanged) signal(kTesselRootContainerItemIdentifier);
    if (hasWorkingSetChanged) signal(kTesselWorkingSetContainerItemIdentifier);
}

}  // namespace cindral
