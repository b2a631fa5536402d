// A record that is read from a cache of applications can be archived and read again as the same; so can the paths of
// roots that the volume store remembers.

#include <cstdlib>

#include "platform/eventstream/RootPaths.h"
#include "platform/foundation/KeyedArchive.h"
#include "platform/roster/Roster.h"

using namespace cindral;  // NOLINT(google-build-using-namespace)

namespace {

void checkRecord(const PropertyList& value) {
    const auto record = RoBundleProxy::unarchived(value);
    if (!record) return;
    const auto again = RoBundleProxy::unarchived(record->archived());
    if (!again || again->bundleIdentifier() != record->bundleIdentifier() ||
        again->localizedName() != record->localizedName() || again->dataContainerURL() != record->dataContainerURL()) {
        std::abort();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const ByteView bytes = std::as_bytes(std::span(data, size));
    const RootPaths paths = decodeRootPaths(bytes);
    const Bytes encoded = encodeRootPaths(paths, {});
    if (size <= 65'536 && decodeRootPaths(encoded) != paths) std::abort();

    const auto root = keyed_archive::unarchiveRoot(bytes);
    if (!root || root->dictionary() == nullptr) return 0;
    const auto found = root->dictionary()->find("bundleProxy");
    if (found == root->dictionary()->end() || found->second.array() == nullptr) return 0;
    for (const PropertyList& each : *found->second.array()) checkRecord(each);
    return 0;
}
