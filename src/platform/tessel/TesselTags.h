#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/Data.h"

namespace cindral {

/// A label that a person gives to items. Tags have no colour here.
struct TSTag {
    std::string label;
    friend bool operator==(const TSTag&, const TSTag&) = default;
};

/// Tags on the way from the host to a provider: a keyed archive of the array of their labels (docs/keyed-archive.md).
Bytes tsTagsData(const std::vector<TSTag>& tags);
/// What tsTagsData() made; none where the bytes are anything else.
std::optional<std::vector<TSTag>> tsGetTagsFromTagsData(ByteView data);

}  // namespace cindral
