#pragma once

#include <cstdint>
#include <string_view>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Result.h"
#include "platform/tessel/TesselEnumerator.h"
#include "provider/fs/FSDirectoryEnumerator.h"

namespace cindral {

/// What a container lists, and as which items: one rule, for the pages of a listing and for changes.
///
/// The working set lists everything below its folders, not descending into packages; all directories the plain folders
/// among that; every other container the direct children of its folders. Nothing lists an entry named ".Trash", but a
/// deep listing descends into it.
namespace container_contents {

/// Whether everything below the container's folders is listed, not their direct children alone.
bool isDeep(const TesselItemIdentifier& container);
bool isOfFoldersOnly(const TesselItemIdentifier& container);

/// Whether what happens at the path is the container's to tell of, by the text of the path alone: it is directly in one
/// of the folders or, where the container is deep, anywhere below one.
bool covers(const TesselItemIdentifier& container, const std::vector<KsURL>& urls, std::string_view path);

/// How the container's folders are scanned from the beginning to the end.
EnumeratorOptions scanOptions(const TesselItemIdentifier& container, const std::vector<KsURL>& urls);

/// Whether the container lists such an entry, come upon in one of its folders or, where it is deep, below them. An entry
/// that was mounted from elsewhere is left out, which is said once in the log: its number names nothing here.
bool isListed(const TesselItemIdentifier& container, const KsURL& entry);
/// Whether entries of the name are listed nowhere, while what is in them may be.
bool isTrashName(std::string_view name);

/// The items of entries of open folders (KsURL::child), in their order, without those of which none can be made and
/// without further names of an object.
///
/// The entries are identified in one transaction, and what the entries of a folder have in common is worked out once.
/// An error where document IDs can't be given: without them there are no items, and better none at all than some.
Result<TesselItems> itemsOf(std::vector<KsURL> entries);

}  // namespace container_contents

}  // namespace cindral
