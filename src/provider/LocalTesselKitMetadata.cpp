// The user's metadata.

#include <fmt/format.h>

#include <utility>
#include <vector>

#include "platform/foundation/KeyedArchive.h"
#include "platform/foundation/Log.h"
#include "platform/tessel/FileOperations.h"
#include "platform/tessel/TesselErrors.h"
#include "platform/tessel/TesselTags.h"
#include "provider/LocalTesselKit.h"
#include "provider/Utilities.h"

namespace cindral {

namespace {

/// As they are kept: an array of strings; none at all where there are none.
std::optional<Bytes> archivedTags(const std::vector<TSTag>& tags) {
    if (tags.empty()) return std::nullopt;
    PropertyList::Array labels;
    for (const TSTag& tag : tags) labels.emplace_back(tag.label);
    return keyed_archive::archive(std::move(labels));
}

}  // namespace

/// The item with the attribute written, or taken away.
Result<std::shared_ptr<const TesselItem>> LocalTesselKit::withAttribute(const KsURL& url,
                                                                        const TesselItemIdentifier& identifier,
                                                                        std::string_view name,
                                                                        const std::optional<Bytes>& value) {
    const Result<void> written = ts_withReadWriteAccess(url, [&](int fd) -> Result<void> {
        if (auto error = setXattr(fd, value, name)) return error->with("path", url.path());
        return {};
    });
    if (!written.ok()) {
        logError("can't set xattr {}; {}", name, written.error().description());
        return written.error();
    }
    return std::shared_ptr<const TesselItem>(TRY(fetchItem(identifier)));
}

void LocalTesselKit::setLastUsedDate(const std::optional<KsDate>& date, const TesselItemIdentifier& identifier,
                                     ItemCompletion completion) {
    const LogSection section("{}",
                             date ? fmt::format("set last used date \"{}\" to item \"{}\"", date->rfc3339(), identifier)
                                  : fmt::format("clearing last used date for item \"{}\"", identifier));
    if (identifier.starts_with('#')) {
        const auto item = fetchItem(identifier);
        return completion(item.ok() ? Result<std::shared_ptr<const TesselItem>>(*item) : item.error());
    }
    const Result<KsURL> url = urlForItem(identifier);
    if (!url.ok()) return completion(url.error());
    const auto value = date ? std::optional(keyed_archive::archive(*date)) : std::nullopt;
    completion(withAttribute(*url, identifier, kXattrLastUsedDateName, value));
}

void LocalTesselKit::setTagData(const std::optional<Bytes>& tagData, const TesselItemIdentifier& identifier,
                                ItemCompletion completion) {
    const LogSection section("set tag data to item \"{}\"", identifier);
    const std::optional<KsURL> url = urlForItemWithPersistentIdentifier(identifier);
    if (!url) {
        logError("can't find URL for item; {}", identifier);
        return completion(tsItemNotFoundError(identifier));
    }
    const auto tags = tagData ? tsGetTagsFromTagsData(*tagData) : std::vector<TSTag>();
    // Bytes that are no tags are no wish to have none.
    if (!tags) return completion(tsInvalidParameterError("tagData", identifier));
    completion(withAttribute(*url, identifier, kXattrTagDataName, archivedTags(*tags)));
}

void LocalTesselKit::setFavoriteRank(std::optional<std::int64_t> rank, const TesselItemIdentifier& identifier,
                                     ItemCompletion completion) {
    const LogSection section("set favorite rank \"{}\" {}", rank ? fmt::to_string(*rank) : "none", identifier);
    const Result<KsURL> url = urlForItem(identifier);
    if (!url.ok()) return completion(url.error());
    const auto value = rank ? std::optional(keyed_archive::archive(*rank)) : std::nullopt;
    completion(withAttribute(*url, identifier, kXattrFavoriteRankName, value));
}

}  // namespace cindral
