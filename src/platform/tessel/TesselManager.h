#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/KsError.h"
#include "platform/foundation/KsURL.h"
#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselTypes.h"

namespace cindral {

/// The provider's way to its host: where the documents are, "this container changed", "forget these domains".
///
/// One per process. The host sets it up before it makes a provider.
///
/// Thread safety: all operations, from any thread.
class TesselManager {
public:
    using Completion = std::function<void(std::optional<KsError>)>;

    /// What the host does when a provider calls. Called on the provider's threads; each completion is to be called
    /// once.
    class Host {
    public:
        virtual ~Host() = default;
        virtual void signalEnumerator(const TesselItemIdentifier& container, Completion completion) = 0;
        virtual void deleteSearchableItems(const std::vector<std::string>& domains, Completion completion) = 0;
    };

    static TesselManager& defaultManager();

    /// The root of the document storage, as presented. Aborts when the host has not set it.
    KsURL documentStorageURL() const { return *sharedDocumentStorageURL(); }
    /// The same without a copy, for what is asked for every item.
    std::shared_ptr<const KsURL> sharedDocumentStorageURL() const;
    void setDocumentStorageURL(KsURL url);
    /// The folder in which a provider may keep what it knows. Aborts when the host has not set it.
    KsURL applicationSupportURL() const;
    void setApplicationSupportURL(KsURL url);
    /// Whether tags are shared with the file managers of the desktop. Off unless the host says otherwise.
    bool sharesDesktopTags() const { return sharesDesktopTags_.load(std::memory_order_relaxed); }
    void setSharesDesktopTags(bool shares) { sharesDesktopTags_ = shares; }
    /// Null takes the host away: signals are then answered without an error and go nowhere.
    void setHost(std::shared_ptr<Host> host);

    /// The completion may be empty, here and below; the host always gets one that can be called.
    void signalEnumeratorForContainerItemIdentifier(const TesselItemIdentifier& container, Completion completion);
    void deleteSearchableItemsWithDomainIdentifiers(const std::vector<std::string>& domains, Completion completion);

private:
    std::shared_ptr<Host> host() const;

    std::atomic<bool> sharesDesktopTags_ = false;

    mutable Mutex mutex_;
    std::shared_ptr<const KsURL> documentStorageURL_ GUARDED_BY(mutex_);
    std::shared_ptr<const KsURL> applicationSupportURL_ GUARDED_BY(mutex_);
    std::shared_ptr<Host> host_ GUARDED_BY(mutex_);
};

}  // namespace cindral
