#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// The record of one installed application, or of the provider itself.
///
/// Thread safety: immutable.
class RoBundleProxy {
public:
    struct Values {
        std::string bundleIdentifier;
        std::optional<KsURL> dataContainerURL;
        std::string localizedName;
    };
    explicit RoBundleProxy(Values values) : values_(std::move(values)) {}
    virtual ~RoBundleProxy() = default;

    const std::string& bundleIdentifier() const { return values_.bundleIdentifier; }
    const std::optional<KsURL>& dataContainerURL() const { return values_.dataContainerURL; }
    /// The application's display name for the preferred localisations of the process.
    const std::string& localizedName() const { return values_.localizedName; }
    std::string description() const;

    /// The record of the installed application with that identifier, or null.
    static std::shared_ptr<const RoBundleProxy> bundleProxyForIdentifier(const std::string& bundleIdentifier);
    /// The record of the installed application whose data container, or the Documents folder in it, is at the URL; or
    /// null.
    static std::shared_ptr<const RoBundleProxy> proxyAt(const KsURL& url);
    /// The record whose data container is at the URL or above it, by whole components, the provider's own among them;
    /// or null. Null for a path with a ".." in it below the container: what that names is not for text to say. Cheap:
    /// asked for each listed item.
    static std::shared_ptr<const RoBundleProxy> proxyWithContaining(const KsURL& url);

private:
    Values values_;
};

/// An installed application.
class RoApplicationProxy : public RoBundleProxy {
public:
    using RoBundleProxy::RoBundleProxy;
};

/// The registry of installed applications.
///
/// No source of applications is connected: it knows the provider's own record alone, and answers "none" for every other
/// question.
///
/// Thread safety: all operations, from any thread.
class RoApplicationWorkspace {
public:
    static RoApplicationWorkspace& defaultWorkspace();

    /// The record for the provider itself, whose data container holds the storage; null when there is none.
    /// Set by the host, before a provider is made.
    void setOwnRecord(std::shared_ptr<const RoBundleProxy> record);
    std::shared_ptr<const RoBundleProxy> ownRecord() const;
    /// What RoBundleProxy::proxyWithContaining() answers.
    std::shared_ptr<const RoBundleProxy> recordContaining(const KsURL& url) const;

    using Block = std::function<void(const std::shared_ptr<const RoBundleProxy>&)>;
    /// Calls the block for each installed application of the type (0 user-installed, 2 system-wide and other), in a
    /// stable order.
    void enumerateApplicationsOfType(unsigned type, const Block& block) const;

private:
    using Record = std::shared_ptr<const RoBundleProxy>;

    /// Null, or the last of ownRecords_: read without a lock.
    std::atomic<const Record*> ownRecord_ = nullptr;

    Mutex mutex_;
    // Every record that was ever set, because a reader may still have its eyes on it. One, in a host.
    std::vector<std::unique_ptr<const Record>> ownRecords_ GUARDED_BY(mutex_);
};

}  // namespace cindral
