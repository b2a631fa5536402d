#include "host/ImportStaging.h"

#include <fmt/format.h>

#include "host/HostError.h"
#include "platform/foundation/RootDirectories.h"

namespace cindral {

Result<ImportStaging> ImportStaging::make(TesselExtension& provider, const PresentedPaths& paths) {
    auto root = RootDirectories::shared().rootHolding(paths.presented());
    // Open already, where the provider is in this process.
    if (root == nullptr) root = TRY(RootDirectories::shared().add(paths.presented(), RootPolicy::storage));
    auto folder = StagingFolder::make(root);
    if (!folder.ok()) return hostFailure(fmt::format("can't make a temporary folder: {}", messageOf(folder.error())));
    auto identifier = provider.persistentIdentifierForItemAtURL(KsURL::fileURL((*folder)->path()));
    if (!identifier) return hostFailure("the temporary folder can't be found");
    return ImportStaging{*std::move(folder), *std::move(identifier)};
}

}  // namespace cindral
