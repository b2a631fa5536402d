#include "host/RemoteProvider.h"

#include <fmt/format.h>

#include <cerrno>
#include <utility>

#include "host/JsonText.h"
#include "host/RemoteError.h"
#include "host/RemoteItem.h"
#include "platform/foundation/Base64.h"
#include "platform/foundation/Utf8.h"
#include "platform/tessel/TesselTags.h"

namespace cindral {
namespace {

using Params = DaemonConnection::Params;

/// A name of any bytes.
Params& addName(Params& params, std::string_view name) {
    if (isUtf8(name)) return params.add("name", name);
    std::string encoded;
    appendPercentEncoded(encoded, name);
    return params.add("encodedName", encoded);
}

std::string textIn(const Result<Json>& answer, const char* key) {
    if (!answer.ok() || !answer->is_object()) return "";
    const auto found = answer->find(key);
    return found != answer->end() && found->is_string() ? found->get<std::string>() : "";
}

}  // namespace

std::optional<KsURL> RemoteProvider::URLForItemWithPersistentIdentifier(const TesselItemIdentifier& identifier) {
    const std::string url = textIn(connection_.call("URLForItem", Params().add("identifier", identifier)), "url");
    return url.empty() ? std::nullopt : KsURL::parse(url);
}

std::optional<TesselItemIdentifier> RemoteProvider::persistentIdentifierForItemAtURL(const KsURL& url) {
    std::string identifier =
        textIn(connection_.call("identifierForItemAtURL", Params().add("url", url.absoluteString())), "identifier");
    return identifier.empty() ? std::nullopt : std::optional(std::move(identifier));
}

Result<std::shared_ptr<const TesselItem>> RemoteProvider::itemForIdentifier(const TesselItemIdentifier& identifier) {
    return itemFromJson(TRY(connection_.call("itemForIdentifier", Params().add("identifier", identifier))));
}

Result<std::shared_ptr<TesselEnumerator>> RemoteProvider::enumeratorForContainerItemIdentifier(
    const TesselItemIdentifier& /*container*/) {
    return KsError::posix(ENOTSUP);
}

void RemoteProvider::providePlaceholderAtURL(const KsURL& /*url*/, Completion completion) {
    completion(KsError::posix(ENOTSUP));
}

void RemoteProvider::startProvidingItemAtURL(const KsURL& /*url*/, Completion completion) {
    completion(KsError::posix(ENOTSUP));
}

void RemoteProvider::stopProvidingItemAtURL(const KsURL& /*url*/) {}

void RemoteProvider::itemChangedAtURL(const KsURL& /*url*/) {}

// MARK: Edits

void RemoteProvider::sendForItem(std::string_view method, const Params& params, ItemCompletion completion,
                                 std::shared_ptr<TesselProgress> progress) {
    connection_.send(
        method, params,
        [completion = std::move(completion)](Result<Json> answer) {
            completion(answer.ok() ? itemFromJson(*answer) : std::move(answer).error());
        },
        std::move(progress));
}

void RemoteProvider::sendForEnd(std::string_view method, const Params& params, Completion completion,
                                std::shared_ptr<TesselProgress> progress) {
    connection_.send(
        method, params,
        [completion = std::move(completion)](Result<Json> answer) {
            completion(answer.ok() ? std::nullopt : std::optional(std::move(answer).error()));
        },
        std::move(progress));
}

std::shared_ptr<TesselProgress> RemoteProvider::importDocumentAtURL(const KsURL& url,
                                                                    const TesselItemIdentifier& parent,
                                                                    ItemCompletion completion) {
    auto progress = std::make_shared<TesselProgress>();
    sendForItem("importDocument", Params().add("url", url.absoluteString()).add("parent", parent),
                std::move(completion), progress);
    return progress;
}

void RemoteProvider::createDirectoryWithName(const std::string& name, const TesselItemIdentifier& parent,
                                             ItemCompletion completion) {
    Params params;
    sendForItem("createDirectory", addName(params, name).add("parent", parent), std::move(completion));
}

void RemoteProvider::renameItemWithIdentifier(const TesselItemIdentifier& identifier, const std::string& name,
                                              ItemCompletion completion) {
    Params params;
    sendForItem("renameItem", addName(params, name).add("identifier", identifier), std::move(completion));
}

std::shared_ptr<TesselProgress> RemoteProvider::reparentItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                                           const TesselItemIdentifier& parent,
                                                                           const std::optional<std::string>& newName,
                                                                           ItemCompletion completion) {
    auto progress = std::make_shared<TesselProgress>();
    Params params;
    if (newName) addName(params, *newName);
    sendForItem("reparentItem", params.add("identifier", identifier).add("parent", parent), std::move(completion),
                progress);
    return progress;
}

std::shared_ptr<TesselProgress> RemoteProvider::deleteItemWithIdentifier(const TesselItemIdentifier& identifier,
                                                                         Completion completion) {
    auto progress = std::make_shared<TesselProgress>();
    sendForEnd("deleteItem", Params().add("identifier", identifier), std::move(completion), progress);
    return progress;
}

void RemoteProvider::trashItemWithIdentifier(const TesselItemIdentifier& identifier, ItemCompletion completion) {
    sendForItem("trashItem", Params().add("identifier", identifier), std::move(completion));
}

std::shared_ptr<TesselProgress> RemoteProvider::untrashItemWithIdentifier(
    const TesselItemIdentifier& identifier, const std::optional<TesselItemIdentifier>& parent,
    ItemCompletion completion) {
    auto progress = std::make_shared<TesselProgress>();
    Params params;
    if (parent) params.add("parent", *parent);
    sendForItem("untrashItem", params.add("identifier", identifier), std::move(completion), progress);
    return progress;
}

void RemoteProvider::removeTrashedItemsOlderThanDate(const KsDate& date, Completion completion) {
    sendForEnd("removeTrashedItemsOlderThan", Params().add("date", date.rfc3339()), std::move(completion));
}

// MARK: Metadata

void RemoteProvider::setLastUsedDate(const std::optional<KsDate>& date, const TesselItemIdentifier& identifier,
                                     ItemCompletion completion) {
    Params params;
    date ? params.add("date", date->rfc3339()) : params.addNull("date");
    sendForItem("setLastUsedDate", params.add("identifier", identifier), std::move(completion));
}

void RemoteProvider::setTagData(const std::optional<Bytes>& tagData, const TesselItemIdentifier& identifier,
                                ItemCompletion completion) {
    const auto tags = tagData ? tsGetTagsFromTagsData(*tagData) : std::vector<TSTag>();
    if (!tags) return completion(KsError::posix(EINVAL));
    std::string labels = "[";
    for (const TSTag& tag : *tags) {
        if (labels.size() > 1) labels += ',';
        appendJsonString(labels, tag.label);
    }
    sendForItem("setTags", Params().addJson("tags", labels + "]").add("identifier", identifier), std::move(completion));
}

void RemoteProvider::setFavoriteRank(std::optional<std::int64_t> rank, const TesselItemIdentifier& identifier,
                                     ItemCompletion completion) {
    const Params params = Params().addJson("rank", rank ? fmt::to_string(*rank) : "null").add("identifier", identifier);
    sendForItem("setFavoriteRank", params, std::move(completion));
}

void RemoteProvider::defaultApplicationContainerForBundleIdentifier(const std::string& bundleIdentifier,
                                                                    ItemCompletion completion) {
    sendForItem("defaultContainer", Params().add("bundleIdentifier", bundleIdentifier), std::move(completion));
}

void RemoteProvider::fetchThumbnailsForItemIdentifiers(const std::vector<TesselItemIdentifier>& identifiers,
                                                       unsigned requestedSize, ThumbnailCompletion perThumbnail,
                                                       Completion completion) {
    std::string list = "[";
    for (const TesselItemIdentifier& identifier : identifiers) {
        if (list.size() > 1) list += ',';
        appendJsonString(list, identifier);
    }
    const auto answer = connection_.call(
        "fetchThumbnails", Params().addJson("identifiers", list + "]").addJson("size", fmt::to_string(requestedSize)));
    const Json none = Json::array();
    const Json& thumbnails = answer.ok() && answer->contains("thumbnails") ? answer->at("thumbnails") : none;
    for (std::size_t i = 0; i < identifiers.size(); ++i) {
        const auto png = i < thumbnails.size() ? thumbnails[i].value("png", Json()) : Json();
        perThumbnail(identifiers[i], png.is_string() ? base64Decode(png.get<std::string>()) : std::nullopt);
    }
    completion(std::nullopt);
}

}  // namespace cindral
