#include "host/RemoteItem.h"

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "host/JsonText.h"
#include "host/RemoteError.h"
#include "platform/foundation/Base64.h"

namespace cindral {
namespace {

/// The value of a key, where it is there and of that kind.
template <typename Value>
std::optional<Value> value(const Json& json, const char* key);

template <>
std::optional<std::string> value(const Json& json, const char* key) {
    const auto found = json.find(key);
    if (found == json.end() || !found->is_string()) return std::nullopt;
    return found->get<std::string>();
}

template <>
std::optional<std::uint64_t> value(const Json& json, const char* key) {
    const auto found = json.find(key);
    if (found == json.end() || !found->is_number_unsigned()) return std::nullopt;
    return found->get<std::uint64_t>();
}

template <>
std::optional<std::int64_t> value(const Json& json, const char* key) {
    const auto found = json.find(key);
    if (found == json.end() || !found->is_number_integer()) return std::nullopt;
    return found->get<std::int64_t>();
}

template <>
std::optional<KsDate> value(const Json& json, const char* key) {
    const auto text = value<std::string>(json, key);
    return text ? KsDate::parseRFC3339(*text) : std::nullopt;
}

bool flag(const Json& json, const char* key) {
    const auto found = json.find(key);
    return found != json.end() && found->is_boolean() && found->get<bool>();
}

std::optional<std::vector<std::string>> texts(const Json& json, const char* key) {
    const auto found = json.find(key);
    if (found == json.end() || !found->is_array()) return std::nullopt;
    std::vector<std::string> texts;
    for (const Json& each : *found) {
        if (each.is_string()) texts.push_back(each.get<std::string>());
    }
    return texts;
}

class RemoteItem final : public TesselItem {
public:
    explicit RemoteItem(const Json& json)
        : identifier_(value<std::string>(json, "identifier").value_or("")),
          parent_(value<std::string>(json, "parentIdentifier").value_or("")),
          name_(value<std::string>(json, "filename").value_or("")),
          type_(value<std::string>(json, "typeIdentifier").value_or("")),
          capabilities_(static_cast<TesselItemCapabilities>(value<std::uint64_t>(json, "capabilities").value_or(0))),
          isTrashed_(flag(json, "isTrashed")),
          isUbiquitous_(flag(json, "isUbiquitous")),
          isAppLibrary_(flag(json, "isAppLibrary")),
          documentSize_(value<std::uint64_t>(json, "documentSize")),
          creationDate_(value<KsDate>(json, "creationDate")),
          contentModificationDate_(value<KsDate>(json, "contentModificationDate")),
          childItemCount_(value<std::uint64_t>(json, "childItemCount")),
          lastUsedDate_(value<KsDate>(json, "lastUsedDate")),
          tags_(texts(json, "tags")),
          favoriteRank_(value<std::int64_t>(json, "favoriteRank")),
          fileID_(value<std::uint64_t>(json, "fileID")),
          docID_(value<std::uint64_t>(json, "docID")),
          bundleIdentifier_(value<std::string>(json, "bundleIdentifier")) {
        if (const auto version = value<std::string>(json, "versionIdentifier")) version_ = base64Decode(*version);
        if (const auto url = value<std::string>(json, "fileURL")) fileURL_ = KsURL::parse(*url);
        if (name_.find("\xEF\xBF\xBD") != std::string::npos) readNameFromURL();
    }

    const TesselItemIdentifier& itemIdentifier() const override { return identifier_; }
    const TesselItemIdentifier& parentItemIdentifier() const override { return parent_; }
    const std::string& filename() const override { return name_; }
    const std::string& typeIdentifier() const override { return type_; }
    TesselItemCapabilities capabilities() const override { return capabilities_; }
    bool isTrashed() const override { return isTrashed_; }
    bool isUbiquitous() const override { return isUbiquitous_; }
    bool isAppLibrary() const override { return isAppLibrary_; }
    std::optional<std::uint64_t> documentSize() const override { return documentSize_; }
    std::optional<KsDate> creationDate() const override { return creationDate_; }
    std::optional<KsDate> contentModificationDate() const override { return contentModificationDate_; }
    std::optional<std::uint64_t> childItemCount() const override { return childItemCount_; }
    std::optional<ByteView> versionIdentifier() const override {
        return version_ ? std::optional<ByteView>(*version_) : std::nullopt;
    }
    std::optional<KsDate> lastUsedDate() const override { return lastUsedDate_; }
    const std::optional<std::vector<std::string>>& tags() const override { return tags_; }
    std::optional<std::int64_t> favoriteRank() const override { return favoriteRank_; }
    std::optional<std::uint64_t> fileID() const override { return fileID_; }
    std::optional<std::uint64_t> docID() const override { return docID_; }
    const KsURL* fileURL() const override { return fileURL_ ? &*fileURL_ : nullptr; }
    const std::string* appContainerBundleIdentifier() const override {
        return bundleIdentifier_ ? &*bundleIdentifier_ : nullptr;
    }
    const std::string* vistorDomainIdentifier() const override { return nullptr; }
    std::string description() const override { return identifier_; }

private:
    /// An application's own name is not that of its folder.
    void readNameFromURL() {
        if (!fileURL_) return;
        const std::string_view name = fileURL_->lastPathComponent();
        if (jsonString(name) == jsonString(name_)) name_ = name;
    }

    TesselItemIdentifier identifier_;
    TesselItemIdentifier parent_;
    std::string name_;
    std::string type_;
    TesselItemCapabilities capabilities_;
    bool isTrashed_;
    bool isUbiquitous_;
    bool isAppLibrary_;
    std::optional<std::uint64_t> documentSize_;
    std::optional<KsDate> creationDate_;
    std::optional<KsDate> contentModificationDate_;
    std::optional<std::uint64_t> childItemCount_;
    std::optional<Bytes> version_;
    std::optional<KsDate> lastUsedDate_;
    std::optional<std::vector<std::string>> tags_;
    std::optional<std::int64_t> favoriteRank_;
    std::optional<std::uint64_t> fileID_;
    std::optional<std::uint64_t> docID_;
    std::optional<KsURL> fileURL_;
    std::optional<std::string> bundleIdentifier_;
};

}  // namespace

Result<std::shared_ptr<const TesselItem>> itemFromJson(const Json& json) {
    if (!value<std::string>(json, "identifier") || !value<std::string>(json, "filename")) return unreadableAnswer();
    return std::make_shared<const RemoteItem>(json);
}

Result<TesselItems> itemsFromJson(const Json& answer) {
    const auto found = answer.find("items");
    if (found == answer.end() || !found->is_array()) return unreadableAnswer();
    TesselItems items;
    items.reserve(found->size());
    for (const Json& item : *found) items.push_back(TRY(itemFromJson(item)));
    return items;
}

Result<std::optional<Bytes>> bytesFromJson(const Json& answer, const char* key) {
    const auto found = answer.find(key);
    if (found == answer.end()) return unreadableAnswer();
    if (found->is_null()) return std::optional<Bytes>();
    auto bytes = found->is_string() ? base64Decode(found->get_ref<const std::string&>()) : std::nullopt;
    if (!bytes) return unreadableAnswer();
    return bytes;
}

Result<ItemsPage> itemsPageFromJson(const Json& answer) {
    ItemsPage page;
    page.items = TRY(itemsFromJson(answer));
    page.nextPage = TRY(bytesFromJson(answer, "nextPage"));
    return page;
}

}  // namespace cindral
