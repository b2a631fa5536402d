#pragma once

#include <map>
#include <string>

#include "platform/foundation/Data.h"
#include "platform/revisions/VolumeIndex.h"

namespace cindral {

/// Where roots are or were, by file ID.
using RootPaths = std::map<FileID, std::string>;

/// As the volume store remembers them: for each "ID PATH" and a NUL. Those of `current` come first; of the others, as
/// many as there is room for.
Bytes encodeRootPaths(const RootPaths& current, const RootPaths& former);
/// What is neither is left out.
RootPaths decodeRootPaths(ByteView bytes);

}  // namespace cindral
