#include "host/RemoteClient.h"

#include <utility>

#include "host/RemoteError.h"
#include "host/RemoteItem.h"
#include "platform/foundation/Base64.h"

namespace cindral {
namespace {

using Params = DaemonConnection::Params;

/// The initial pages are known by name: what they are made of is each process's own affair.
Params pageParams(const TesselItemIdentifier& container, const TesselPage& page) {
    Params params;
    params.add("container", container);
    if (page == tesselInitialPageSortedByName()) return params.add("sort", "name");
    if (page == tesselInitialPageSortedByDate()) return params.add("sort", "date");
    return params.add("page", base64Encode(page));
}

const Json* listIn(const Json& answer, const char* key) {
    const auto found = answer.find(key);
    return found != answer.end() && found->is_array() ? &*found : nullptr;
}

bool isEntry(const Json& entry) {
    return entry.is_array() && entry.size() == 2 && entry[0].is_string() && entry[1].is_string();
}

}  // namespace

RemoteClient::RemoteClient(UniqueFd socket, SignalDispatcher& signals)
    : signals_(signals), connection_(std::move(socket), signals, [this] { didLoseDaemon(); }) {}

void RemoteClient::didLoseDaemon() {
    std::set<TesselItemIdentifier> monitored;
    {
        const MutexLock lock(mutex_);
        monitored = monitored_;
    }
    for (const auto& container : monitored) signals_.signalEnumerator(container, nullptr);
}

Result<ItemsPage> RemoteClient::itemsOnPage(const TesselItemIdentifier& container, const TesselPage& page) {
    return itemsPageFromJson(TRY(connection_.call("enumerateItems", pageParams(container, page))));
}

Result<std::optional<TesselSyncAnchor>> RemoteClient::anchor(const TesselItemIdentifier& container) {
    return bytesFromJson(TRY(connection_.call("currentSyncAnchor", Params().add("container", container))), "anchor");
}

Result<ChangesBatch> RemoteClient::changesSince(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor) {
    const Json answer = TRY(
        connection_.call("enumerateChanges", Params().add("container", container).add("anchor", base64Encode(anchor))));
    const Json* updated = listIn(answer, "updated");
    const Json* log = listIn(answer, "log");
    auto next = TRY(bytesFromJson(answer, "anchor"));
    if (updated == nullptr || log == nullptr || !next) return unreadableAnswer();
    ChangesBatch batch;
    batch.anchor = *std::move(next);
    batch.moreComing = answer.value("moreComing", false);
    std::size_t updates = 0;
    for (const Json& entry : *log) {
        if (!isEntry(entry)) return unreadableAnswer();
        ChangesBatch::Entry& added = batch.log.emplace_back();
        added.identifier = entry[1].get<std::string>();
        if (entry[0] != "u") continue;
        if (updates == updated->size()) return unreadableAnswer();
        added.item = TRY(itemFromJson((*updated)[updates++]));
    }
    return batch;
}

Result<void> RemoteClient::startMonitoring(const TesselItemIdentifier& container) {
    {
        const MutexLock lock(mutex_);
        monitored_.insert(container);
    }
    auto started = connection_.call("startMonitoring", Params().add("container", container));
    if (started.ok()) return {};
    const MutexLock lock(mutex_);
    monitored_.erase(container);
    return std::move(started).error();
}

void RemoteClient::stopMonitoring(const TesselItemIdentifier& container) {
    {
        const MutexLock lock(mutex_);
        monitored_.erase(container);
    }
    (void)connection_.call("stopMonitoring", Params().add("container", container));
}

Result<std::string> RemoteClient::statusText() {
    // An anchor of everything waits for the first look at the roots; the status doesn't.
    TRY(anchor(kTesselWorkingSetContainerItemIdentifier));
    return connection_.callForText("status", Params());
}

Result<std::string> RemoteClient::doctorText() {
    return connection_.callForText("doctor", Params());
}

Result<std::string> RemoteClient::makeLink() {
    const Json answer = TRY(connection_.call("makeLink", Params()));
    const auto url = answer.find("url");
    if (url == answer.end() || !url->is_string()) return unreadableAnswer();
    return url->get<std::string>();
}

}  // namespace cindral
