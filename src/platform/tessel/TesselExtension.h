#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Result.h"
#include "platform/tessel/TesselEnumerator.h"
#include "platform/tessel/TesselItem.h"

namespace cindral {

/// What a provider is to its host: lookups, enumerators, and calls around a document's contents.
///
/// The host makes one through the provider's factory (TesselExtensionFactory), and calls it on its own threads.
///
/// Thread safety: all operations, from any thread, at the same time.
class TesselExtension {
public:
    using Completion = std::function<void(std::optional<KsError>)>;
    using ItemCompletion = std::function<void(Result<std::shared_ptr<const TesselItem>>)>;

    virtual ~TesselExtension() = default;

    virtual std::optional<KsURL> URLForItemWithPersistentIdentifier(const TesselItemIdentifier& identifier) = 0;
    virtual std::optional<TesselItemIdentifier> persistentIdentifierForItemAtURL(const KsURL& url) = 0;
    virtual Result<std::shared_ptr<const TesselItem>> itemForIdentifier(const TesselItemIdentifier& identifier) = 0;
    virtual Result<std::shared_ptr<TesselEnumerator>> enumeratorForContainerItemIdentifier(
        const TesselItemIdentifier& container) = 0;

    virtual void providePlaceholderAtURL(const KsURL& url, Completion completion) = 0;
    virtual void startProvidingItemAtURL(const KsURL& url, Completion completion) = 0;
    virtual void stopProvidingItemAtURL(const KsURL& url) = 0;
    virtual void itemChangedAtURL(const KsURL& url) = 0;

    /// The default save location of an application.
    virtual void defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                                ItemCompletion completion) = 0;
};

/// Makes a provider. Each provider library exports one function of this type.
using TesselExtensionFactory = std::shared_ptr<TesselExtension> (*)();

}  // namespace cindral
