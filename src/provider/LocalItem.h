#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/InternedString.h"
#include "platform/foundation/KsURL.h"
#include "platform/tessel/TesselItem.h"

namespace cindral {

/// The record of one file or folder, built from its URL: a snapshot of resource values, one stat and the user's
/// metadata.
///
/// Thread safety: built on one thread; read-only afterwards, except for putBackURL(), which callers ask for on one
/// thread.
class LocalItem : public TesselItem {
protected:
    struct Passkey {};

public:
    /// What replaces the values that would otherwise be computed.
    struct Customs {
        std::optional<TesselItemIdentifier> itemID;
        std::optional<TesselItemIdentifier> parentItemID;
        std::optional<std::string> filename;
        bool isOnlyLookedUp =
            false;  ///< for its URL alone: what takes a walk (sizes of packages, counts of children) is left out
        bool hasVistorDomainIdentifier =
            false;  ///< the item carries its application's identifier as search-index domain
        std::optional<InternedString> bundleIdentifier;
    };

    /// The item of the URL, or null after a log line that says what it lacks.
    static std::shared_ptr<const LocalItem> initWithURL(KsURL url, Customs customs);
    static std::shared_ptr<const LocalItem> initWithURL(KsURL url) { return initWithURL(std::move(url), Customs()); }

    LocalItem(Passkey, KsURL url) : fileURL_(std::move(url)) {}

    const TesselItemIdentifier& itemIdentifier() const override { return itemIdentifier_; }
    const TesselItemIdentifier& parentItemIdentifier() const override { return parentItemIdentifier_; }
    const std::string& filename() const override { return filename_; }
    const std::string& typeIdentifier() const override { return typeIdentifier_.string(); }
    TesselItemCapabilities capabilities() const override { return capabilities_; }
    bool isTrashed() const override { return isTrashed_; }
    bool isUbiquitous() const override { return false; }  // Nothing here is shared through a cloud store.
    bool isAppLibrary() const override { return false; }
    std::optional<std::uint64_t> documentSize() const override { return documentSize_; }
    std::optional<KsDate> creationDate() const override { return creationDate_; }
    std::optional<KsDate> contentModificationDate() const override { return contentModificationDate_; }
    std::optional<std::uint64_t> childItemCount() const override { return childItemCount_; }
    std::optional<ByteView> versionIdentifier() const override;
    std::optional<KsDate> lastUsedDate() const override { return lastUsedDate_; }
    const std::optional<std::vector<std::string>>& tags() const override { return tags_; }
    std::optional<std::int64_t> favoriteRank() const override { return favoriteRank_; }
    std::optional<std::uint64_t> fileID() const override { return fileID_; }
    std::optional<std::uint64_t> docID() const override { return docID_; }
    const KsURL* fileURL() const override { return &fileURL_; }
    const std::string* appContainerBundleIdentifier() const override;
    const std::string* vistorDomainIdentifier() const override;
    std::string description() const override;

    /// Where a trashed item returns to; computed once. None, after an error line, without a put-back attribute.
    const std::optional<KsURL>& putBackURL() const;

protected:
    /// Takes every value from the URL. False, after a log line, when there is no item to be made.
    bool build(Customs customs);

    std::optional<std::uint64_t> childItemCount_;

private:
    std::optional<KsURL> computePutBackURL() const;
    bool identify(Customs& customs);
    bool name(Customs& customs);
    void readSizeAndDates(const Customs& customs);
    void decideCapabilities();
    void readUserMetadata();
    void readStatus(const Customs& customs);
    void findApplication(const Customs& customs);
    bool isAppLibraryIdentifier() const { return itemIdentifier_.starts_with('#'); }

    TesselItemIdentifier itemIdentifier_;
    TesselItemIdentifier parentItemIdentifier_;
    std::string filename_;
    InternedString typeIdentifier_;
    std::optional<std::uint64_t> documentSize_;
    std::optional<KsDate> creationDate_;
    std::optional<KsDate> contentModificationDate_;
    TesselItemCapabilities capabilities_ = TesselItemCapabilities::none;
    std::optional<std::array<std::byte, 16>> versionIdentifier_;
    bool isTrashed_ = false;
    bool hasVistorDomainIdentifier_ = false;
    std::optional<KsDate> lastUsedDate_;
    std::optional<std::vector<std::string>> tags_;
    std::optional<std::int64_t> favoriteRank_;
    std::optional<std::uint64_t> fileID_;
    std::optional<std::uint64_t> docID_;
    KsURL fileURL_;
    InternedString bundleIdentifier_;
    mutable std::optional<std::optional<KsURL>> putBackURL_;
};

}  // namespace cindral
