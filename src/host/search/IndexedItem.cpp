#include "host/search/IndexedItem.h"

#include <algorithm>
#include <limits>

#include "host/ItemText.h"
#include "host/search/NameFolding.h"
#include "platform/tessel/StagingFolder.h"

namespace cindral {
namespace {

std::optional<std::int64_t> nanosecondsOf(const std::optional<KsDate>& date) {
    if (!date) return std::nullopt;
    constexpr std::int64_t kSecondsMax = std::numeric_limits<std::int64_t>::max() / 1'000'000'000 - 1;
    const std::int64_t seconds = std::clamp(date->seconds, -kSecondsMax, kSecondsMax);
    return seconds * 1'000'000'000 + date->nanoseconds;
}

std::int64_t flagsOf(const TesselItem& item) {
    const std::int64_t trashed = item.isTrashed() ? IndexedItem::kTrashed : 0;
    switch (kindOf(item)) {
        case ItemKind::folder: return trashed | IndexedItem::kFolder;
        case ItemKind::package:
        case ItemKind::document: return trashed | IndexedItem::kDocument;
        case ItemKind::link:
        case ItemKind::fifo:
        case ItemKind::socket:
        case ItemKind::characterDevice:
        case ItemKind::blockDevice: return trashed;
    }
    return trashed;
}

bool isTemporaryFolder(const IndexedItem& item) {
    return item.name == kTemporaryLocalFolderName &&
           (item.parent == kTesselRootContainerItemIdentifier || item.parent.starts_with('#'));
}

}  // namespace

IndexedItem IndexedItem::of(const TesselItem& item) {
    IndexedItem indexed;
    indexed.identifier = item.itemIdentifier();
    indexed.parent = item.parentItemIdentifier();
    indexed.name = item.filename();
    indexed.type = item.typeIdentifier();
    if (const std::string* domain = item.vistorDomainIdentifier()) {
        indexed.domain = *domain;
    } else if (const std::string* bundle = item.appContainerBundleIdentifier()) {
        indexed.domain = *bundle;
    }
    indexed.flags = flagsOf(item) | (isTemporaryFolder(indexed) ? kTemporary : 0);
    indexed.modified = nanosecondsOf(item.contentModificationDate());
    indexed.used = nanosecondsOf(item.lastUsedDate());
    if (const auto size = item.documentSize()) {
        indexed.size =
            static_cast<std::int64_t>(std::min<std::uint64_t>(*size, std::numeric_limits<std::int64_t>::max()));
    }
    indexed.rank = item.favoriteRank();
    indexed.tags = item.tags().value_or(std::vector<std::string>());
    std::ranges::sort(indexed.tags);
    const auto twice = std::ranges::unique(indexed.tags);
    indexed.tags.erase(twice.begin(), twice.end());
    return indexed;
}

bool IndexedItem::isIn(const SearchQuery& query) const {
    switch (query.kind) {
        case SearchQuery::Kind::names:
            return isOrdinary() && !query.text.empty() &&
                   nameMatchOf(name_folding::fold(name), name_folding::fold(query.text)).has_value();
        case SearchQuery::Kind::recents: return isDocument() && isOrdinary();
        case SearchQuery::Kind::tagged: return isOrdinary() && std::ranges::binary_search(tags, query.text);
        case SearchQuery::Kind::favorites: return rank.has_value() && isOrdinary();
        case SearchQuery::Kind::trashed: return isTrashed() && !isTemporary();
        case SearchQuery::Kind::children: return parent == query.text && !isTemporary();
        case SearchQuery::Kind::tags: return !tags.empty() && isOrdinary();
    }
    return false;
}

}  // namespace cindral
