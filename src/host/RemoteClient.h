#pragma once

#include <set>
#include <string>

#include "host/DaemonConnection.h"
#include "host/ProviderAccess.h"
#include "host/RemoteProvider.h"
#include "host/RemoteSearch.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// A command's way to the daemon's provider.
///
/// When the daemon goes, every container that is monitored is signalled once more: who then asks for its changes is told.
///
/// Thread safety: all operations, from any thread.
class RemoteClient final : public ProviderAccess {
public:
    /// Takes over the connected socket. What the daemon signals goes to `signals`, which is borrowed for life.
    RemoteClient(UniqueFd socket, SignalDispatcher& signals);

    DaemonConnection& connection() { return connection_; }

    TesselExtension& provider() const override { return provider_; }
    SearchQueries& search() { return search_; }
    Result<ItemsPage> itemsOnPage(const TesselItemIdentifier& container, const TesselPage& page) override;
    Result<std::optional<TesselSyncAnchor>> anchor(const TesselItemIdentifier& container) override;
    Result<ChangesBatch> changesSince(const TesselItemIdentifier& container, const TesselSyncAnchor& anchor) override;
    Result<void> startMonitoring(const TesselItemIdentifier& container) override;
    void stopMonitoring(const TesselItemIdentifier& container) override;

    /// What `status` answers, as JSON text, once the roots have been read or compared.
    Result<std::string> statusText();
    Result<std::string> doctorText();
    /// A link that lets a browser see the documents, once.
    Result<std::string> makeLink();

private:
    void didLoseDaemon();

    SignalDispatcher& signals_;
    Mutex mutex_;
    std::set<TesselItemIdentifier> monitored_ GUARDED_BY(mutex_);
    DaemonConnection connection_;  // Ends first: its thread uses what is above.
    mutable RemoteProvider provider_{connection_};
    RemoteSearch search_{connection_};
};

}  // namespace cindral
