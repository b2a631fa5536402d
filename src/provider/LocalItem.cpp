#include "provider/LocalItem.h"

#include <fmt/format.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <utility>

#include "platform/foundation/KeyedArchive.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/TypeDatabase.h"
#include "platform/roster/Roster.h"
#include "platform/tessel/FileOperations.h"
#include "platform/tessel/TesselManager.h"
#include "provider/DesktopTags.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/Utilities.h"

namespace cindral {

namespace {

constexpr std::string_view kInboxName = "Inbox";
// The package families whose size people ask for; measuring every package would cost a walk each.
constexpr std::string_view kMeasuredPackagePrefixes[] = {"com.vemra.folio", "com.vemra.tonemill"};

bool isMeasuredPackage(std::string_view type) {
    return std::ranges::any_of(kMeasuredPackagePrefixes,
                               [type](std::string_view prefix) { return type.starts_with(prefix); });
}

/// Whether a relative path names something below the folder that it is appended to.
bool isPathBelow(std::string_view path) {
    if (path.empty() || path.starts_with('/') || path.find('\0') != std::string_view::npos) return false;
    while (true) {
        const std::size_t end = std::min(path.find('/'), path.size());
        if (path.substr(0, end) == "..") return false;
        if (end == path.size()) return true;
        path.remove_prefix(end + 1);
    }
}

void putBigEndian(std::byte* out, const KsDate& date) {
    const auto stamp = static_cast<std::uint64_t>(date.seconds) * 1'000'000'000 + date.nanoseconds;
    for (int i = 0; i < 8; ++i) out[i] = static_cast<std::byte>(stamp >> (56 - 8 * i));
}

}  // namespace

std::shared_ptr<const LocalItem> LocalItem::initWithURL(KsURL url, Customs customs) {
    auto item = std::make_shared<LocalItem>(Passkey(), std::move(url));
    if (!item->build(std::move(customs))) return nullptr;
    return item;
}

bool LocalItem::build(Customs customs) {
    if (!identify(customs)) return false;
    isTrashed_ = isInTrash(fileURL_);
    if (!name(customs)) return false;
    if (filename_ == kInboxName && parentItemIdentifier_.starts_with('#') && fileURL_.ts_isFolder()) {
        logDebug("can't create an item for the \"Inbox\" directory");
        return false;
    }
    readSizeAndDates(customs);
    decideCapabilities();
    readUserMetadata();
    readStatus(customs);
    findApplication(customs);
    fileURL_.detach();
    return true;
}

bool LocalItem::identify(Customs& customs) {
    std::optional<TesselItemIdentifier> identifier =
        customs.itemID ? std::move(customs.itemID) : cindral::itemIdentifier(fileURL_);
    if (!identifier) {
        logDebug("can't create an item without an ID");
        return false;
    }
    itemIdentifier_ = *std::move(identifier);
    // The root is at the top: nothing holds it.
    if (itemIdentifier_ == kTesselRootContainerItemIdentifier) return true;

    std::optional<TesselItemIdentifier> parent = std::move(customs.parentItemID);
    if (!parent) {
        if (std::optional<KsURL> folder = fileURL_.deletingLastPathComponent())
            parent = cindral::itemIdentifier(*folder);
    }
    if (!parent) {
        logError("can't create an item without a parent ID (itemIdentifier: {})", itemIdentifier_);
        return false;
    }
    parentItemIdentifier_ = *std::move(parent);
    return true;
}

bool LocalItem::name(Customs& customs) {
    std::optional<std::string> filename = std::move(customs.filename);
    if (!filename) filename = stringResourceValue(fileURL_, ResourceKey::name);
    if (!filename) {
        logError("can't create an item without a filename (itemIdentifier: {}, parentItemIdentifier: {})",
                 itemIdentifier_, parentItemIdentifier_);
        return false;
    }
    filename_ = *std::move(filename);
    const Result<InternedString> type = fileURL_.typeIdentifier();
    if (!type.ok() || type->empty()) {
        logError(
            "can't create an item without a type identifier (itemIdentifier: {}, parentItemIdentifier: {}, filename: "
            "{})",
            itemIdentifier_, parentItemIdentifier_, filename_);
        return false;
    }
    typeIdentifier_ = *type;
    return true;
}

void LocalItem::readSizeAndDates(const Customs& customs) {
    const Result<FileStatus> status = fileURL_.status();
    const bool isDirectory = status.ok() && status->isDirectory();
    if (!isDirectory) {
        documentSize_ = numberResourceValue(fileURL_, ResourceKey::fileSize);
    } else if (!customs.isOnlyLookedUp &&
               TypeDatabase::shared().conforms(typeIdentifier_.view(), kPackageTypeIdentifier) &&
               isMeasuredPackage(typeIdentifier_.view())) {
        const Result<std::uint64_t> size = ts_directorySize(fileURL_);
        if (size.ok()) documentSize_ = *size;
    }
    creationDate_ = dateResourceValue(fileURL_, ResourceKey::creationDate);
    contentModificationDate_ = dateResourceValue(fileURL_, ResourceKey::contentModificationDate);
    if (status.ok()) {
        // The modification date alone would miss a rewrite that sets it back, which many tools do.
        versionIdentifier_.emplace();
        putBigEndian(versionIdentifier_->data(), status->modificationTime);
        putBigEndian(versionIdentifier_->data() + 8, status->changeTime);
    }
}

void LocalItem::decideCapabilities() {
    capabilities_ = TesselItemCapabilities::allowsReading;
    if (itemIdentifier_ == kTesselRootContainerItemIdentifier) return;
    if (!boolResourceValue(fileURL_, ResourceKey::isWritable).value_or(false)) return;
    capabilities_ = capabilities_ | TesselItemCapabilities::allowsWriting;
    if (isAppLibraryIdentifier()) return;
    capabilities_ = capabilities_ | TesselItemCapabilities::allowsReparenting | TesselItemCapabilities::allowsRenaming |
                    TesselItemCapabilities::allowsTrashing | TesselItemCapabilities::allowsDeleting;
}

void LocalItem::readUserMetadata() {
    if (isAppLibraryIdentifier()) return;
    // Most files bear no attribute at all: one look spares three.
    fileURL_.loadAttributeNames();
    if (const auto bytes = initWithValueOfXattr(kXattrLastUsedDateName, fileURL_))
        lastUsedDate_ = keyed_archive::unarchiveDate(*bytes);
    if (const auto bytes = initWithValueOfXattr(kXattrTagDataName, fileURL_)) {
        tags_ = keyed_archive::unarchiveStrings(*bytes);
    } else if (TesselManager::defaultManager().sharesDesktopTags()) {
        if (const auto shared = initWithValueOfXattr(desktop_tags::kXattrName, fileURL_))
            tags_ = desktop_tags::decode(*shared);
    }
    if (const auto bytes = initWithValueOfXattr(kXattrFavoriteRankName, fileURL_))
        favoriteRank_ = keyed_archive::unarchiveInteger(*bytes);
}

void LocalItem::readStatus(const Customs& customs) {
    const Result<FileStatus> status = fileURL_.status();
    if (status.ok()) {
        fileID_ = status->fileID;
        if (status->isDirectory() && !customs.isOnlyLookedUp) {
            const Result<std::uint16_t> links = fileURL_.linkCount();
            if (links.ok()) {
                childItemCount_ = static_cast<std::uint16_t>(*links - 2);
            } else {
                logDebug("can't count the children of item \"{}\"; {}", itemIdentifier_, links.error().description());
            }
        }
    } else if (status.error().isPosix(ENOENT)) {
        logDebug("can't find fileID for item \"{}\"; {}", itemIdentifier_, status.error().description());
    } else {
        logError("can't find fileID for item \"{}\"; {}", itemIdentifier_, status.error().description());
    }
    if (itemIdentifier_.starts_with("did=")) {
        std::uint64_t number = 0;
        const char* end = itemIdentifier_.data() + itemIdentifier_.size();
        const auto read = std::from_chars(itemIdentifier_.data() + 4, end, number);
        if (read.ec == std::errc() && read.ptr == end) docID_ = number;
    }
}

void LocalItem::findApplication(const Customs& customs) {
    hasVistorDomainIdentifier_ = customs.hasVistorDomainIdentifier;
    if (customs.bundleIdentifier) {
        bundleIdentifier_ = *customs.bundleIdentifier;
    } else if (const auto proxy = RoBundleProxy::proxyWithContaining(fileURL_)) {
        bundleIdentifier_ = InternedString(proxy->bundleIdentifier());
    }
}

std::optional<ByteView> LocalItem::versionIdentifier() const {
    if (!versionIdentifier_) return std::nullopt;
    return ByteView(*versionIdentifier_);
}

const std::string* LocalItem::appContainerBundleIdentifier() const {
    return bundleIdentifier_.empty() ? nullptr : &bundleIdentifier_.string();
}

const std::string* LocalItem::vistorDomainIdentifier() const {
    return hasVistorDomainIdentifier_ ? appContainerBundleIdentifier() : nullptr;
}

const std::optional<KsURL>& LocalItem::putBackURL() const {
    if (!putBackURL_) putBackURL_ = computePutBackURL();
    return *putBackURL_;
}

std::optional<KsURL> LocalItem::computePutBackURL() const {
    const auto bytes = initWithValueOfXattr(kXattrTrashPutBackName, fileURL_);
    const auto putBack = bytes ? keyed_archive::unarchiveString(*bytes) : std::nullopt;
    if (!putBack) {
        logError("couldn't find putback xattr for {}", fileURL_.description());
        return std::nullopt;
    }
    const auto proxy = RoBundleProxy::proxyWithContaining(fileURL_);
    const auto container = proxy ? proxy->dataContainerURL() : std::nullopt;
    const std::optional<KsURL> library =
        container ? std::optional(container->appendingPathComponent("Documents")) : std::nullopt;
    logDebug("putback: '{}' library: '{}'", *putBack, library ? library->description() : "");
    // The record is the file's own attribute, which any program may have written: it must not lead out of the library.
    if (!library || !isPathBelow(*putBack)) {
        logError("couldn't compute putback url");
        return std::nullopt;
    }
    return library->appendingPathComponent(*putBack);
}

std::string LocalItem::description() const {
    return fmt::format("<LocalItem {} in {} \"{}\" {}>", itemIdentifier_, parentItemIdentifier_, filename_,
                       typeIdentifier_.view());
}

}  // namespace cindral
