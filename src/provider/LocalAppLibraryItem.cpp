#include "provider/LocalAppLibraryItem.h"

#include "platform/foundation/Fatal.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/TrashName.h"

namespace cindral {

std::shared_ptr<const LocalAppLibraryItem> LocalAppLibraryItem::initWithBundleProxy(const RoBundleProxy& proxy) {
    if (!proxy.dataContainerURL()) {
        logError("can't create an app library item without a data container URL");
        return nullptr;
    }
    const KsURL documents = proxy.dataContainerURL()->appendingPathComponent("Documents");
    auto item = std::make_shared<LocalAppLibraryItem>(Passkey(), documents);
    Customs customs;
    customs.itemID = proxy.appLibraryIdentifier();
    customs.parentItemID = kTesselRootContainerItemIdentifier;
    customs.filename = proxy.localizedName();
    customs.bundleIdentifier = InternedString(proxy.bundleIdentifier());
    if (!item->build(std::move(customs))) return nullptr;

    for (const std::string_view hidden : {std::string_view("Inbox"), kTrashName}) {
        if (item->childItemCount_.value_or(0) == 0) break;
        if (documents.appendingPathComponent(hidden).status().ok()) --*item->childItemCount_;
    }
    return item;
}

std::shared_ptr<const LocalItem> LocalAppLibraryItem::init() {
    fatal("LocalAppLibraryItem has no init()");
}

std::shared_ptr<const LocalItem> LocalAppLibraryItem::initWithURL(KsURL /*url*/, Customs /*customs*/) {
    fatal(
        "LocalAppLibraryItem has no "
        "init(withURL:customItemID:customParentItemID:customFilename:hasVistorDomainIdentifier:bundleIdentifier:)");
}

}  // namespace cindral
