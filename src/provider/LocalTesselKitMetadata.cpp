// The user's metadata.

#include <fmt/format.h>

#include <utility>
#include <vector>

#include "platform/foundation/KeyedArchive.h"
#include "platform/foundation/Log.h"
#include "platform/tessel/FileOperations.h"
#include "platform/tessel/TesselErrors.h"
#include "platform/tessel/TesselManager.h"
#include "platform/tessel/TesselTags.h"
#include "provider/DesktopTags.h"
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

}  // namespace

std::vector<LocalTesselKit::Attribute> LocalTesselKit::attributesFor(const std::vector<TSTag>& tags) {
    std::vector<Attribute> attributes;
    if (TesselManager::defaultManager().sharesDesktopTags()) {
        std::vector<std::string> labels;
        for (const TSTag& tag : tags) labels.push_back(tag.label);
        attributes.push_back({desktop_tags::kXattrName, desktop_tags::encode(labels)});
    }
    attributes.push_back({kXattrTagDataName, archivedTags(tags)});
    return attributes;
}

/// All of them, or none.
Result<void> LocalTesselKit::setAttributes(const MeantFile& file, const std::vector<Attribute>& attributes,
                                           std::string_view& failing) {
    return ts_withReadWriteAccess(file, [&](int fd) -> Result<void> {
        std::vector<Attribute> before;
        for (const auto& [name, value] : attributes) {
            failing = name;
            // One alone is never to be put back.
            if (attributes.size() > 1) before.push_back({name, initWithValueOfXattr(name, file.url)});
            const auto error = setXattr(fd, value, name);
            if (!error) continue;
            for (const Attribute& former : before) (void)setXattr(fd, former.value, former.name);
            return error->with("path", file.url.path());
        }
        return {};
    });
}

/// The item with the attributes written, or taken away.
Result<std::shared_ptr<const TesselItem>> LocalTesselKit::withAttributes(const TesselItemIdentifier& identifier,
                                                                         Lookup lookup,
                                                                         const std::vector<Attribute>& attributes) {
    for (int attempts = 0; attempts < kAttemptsMax; ++attempts) {
        const MeantFile file = TRY(find(identifier, lookup));
        std::string_view failing = attributes.front().name;
        const Result<void> written = setAttributes(file, attributes, failing);
        if (written.ok()) return std::shared_ptr<const TesselItem>(TRY(fetchItem(identifier)));
        if (hasGone(written.error(), file)) continue;
        logUnwritten(failing, written.error());
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
    completion(withAttributes(identifier, Lookup::strict, {{kXattrLastUsedDateName, value}}));
}

void LocalTesselKit::setTagData(const std::optional<Bytes>& tagData, const TesselItemIdentifier& identifier,
                                ItemCompletion completion) {
    const LogSection section("set tag data to item \"{}\"", identifier);
    const auto tags = tagData ? tsGetTagsFromTagsData(*tagData) : std::vector<TSTag>();
    auto tagged = tags ? withAttributes(identifier, Lookup::lenient, attributesFor(*tags)) : notTagged(identifier);
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
    completion(withAttributes(identifier, Lookup::strict, {{kXattrFavoriteRankName, value}}));
}

}  // namespace cindral
