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

// What moves away between the look for it and the write is looked for once more.
constexpr int kAttemptsMax = 2;

/// As they are kept: an array of strings; none at all where there are none.
std::optional<Bytes> archivedTags(const std::vector<TSTag>& tags) {
    if (tags.empty()) return std::nullopt;
    PropertyList::Array labels;
    for (const TSTag& tag : tags) labels.emplace_back(tag.label);
    return keyed_archive::archive(std::move(labels));
}

void logUnwritten(std::string_view name, const KsError& error) {
    // The date is set by whatever is opened, and its line is no longer than it has to be.
    if (name == kXattrLastUsedDateName) return logError("can't set xattr {}", name);
    logError("can't set xattr {}; {}", name, error.description());
}

Result<void> setAttribute(const MeantFile& file, std::string_view name, const std::optional<Bytes>& value) {
    return ts_withReadWriteAccess(file, [&](int fd) -> Result<void> {
        if (auto error = setXattr(fd, value, name)) return error->with("path", file.url.path());
        return {};
    });
}

}  // namespace

/// The item with the attribute written, or taken away.
Result<std::shared_ptr<const TesselItem>> LocalTesselKit::withAttribute(const TesselItemIdentifier& identifier,
                                                                        Lookup lookup, std::string_view name,
                                                                        const std::optional<Bytes>& value) {
    for (int attempts = 0; attempts < kAttemptsMax; ++attempts) {
        const MeantFile file = TRY(find(identifier, lookup));
        const Result<void> written = setAttribute(file, name, value);
        if (written.ok()) return std::shared_ptr<const TesselItem>(TRY(fetchItem(identifier)));
        if (hasGone(written.error(), file)) continue;
        logUnwritten(name, written.error());
        return written.error();
    }
    return missingItem(identifier, lookup);
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
    const auto value = date ? std::optional(keyed_archive::archive(*date)) : std::nullopt;
    completion(withAttribute(identifier, Lookup::strict, kXattrLastUsedDateName, value));
}

void LocalTesselKit::setTagData(const std::optional<Bytes>& tagData, const TesselItemIdentifier& identifier,
                                ItemCompletion completion) {
    const LogSection section("set tag data to item \"{}\"", identifier);
    const auto tags = tagData ? tsGetTagsFromTagsData(*tagData) : std::vector<TSTag>();
    auto tagged = tags ? withAttribute(identifier, Lookup::lenient, kXattrTagDataName, archivedTags(*tags))
                       : notTagged(identifier);
    if (!tagged.ok() && tagged.error().is(kTSErrorDomain, static_cast<std::int64_t>(TSErrorCode::itemNotFound)))
        logError("can't find URL for item; {}", identifier);
    completion(std::move(tagged));
}

/// Bytes that are no tags are no wish to have none.
KsError LocalTesselKit::notTagged(const TesselItemIdentifier& identifier) {
    const Result<MeantFile> file = find(identifier, Lookup::lenient);
    return file.ok() ? tsInvalidParameterError("tagData", identifier) : file.error();
}

void LocalTesselKit::setFavoriteRank(std::optional<std::int64_t> rank, const TesselItemIdentifier& identifier,
                                     ItemCompletion completion) {
    const LogSection section("set favorite rank \"{}\" {}", rank ? fmt::to_string(*rank) : "none", identifier);
    const auto value = rank ? std::optional(keyed_archive::archive(*rank)) : std::nullopt;
    completion(withAttribute(identifier, Lookup::strict, kXattrFavoriteRankName, value));
}

}  // namespace cindral
