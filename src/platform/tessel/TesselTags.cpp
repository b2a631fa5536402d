#include "platform/tessel/TesselTags.h"

#include <utility>

#include "platform/foundation/KeyedArchive.h"

namespace cindral {

Bytes tsTagsData(const std::vector<TSTag>& tags) {
    PropertyList::Array labels;
    for (const TSTag& tag : tags) labels.emplace_back(tag.label);
    return keyed_archive::archive(std::move(labels));
}

std::optional<std::vector<TSTag>> tsGetTagsFromTagsData(ByteView data) {
    std::optional<std::vector<std::string>> labels = keyed_archive::unarchiveStrings(data);
    if (!labels) return std::nullopt;
    std::vector<TSTag> tags;
    tags.reserve(labels->size());
    for (std::string& label : *labels) tags.push_back({std::move(label)});
    return tags;
}

}  // namespace cindral
