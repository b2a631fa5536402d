#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/KsDate.h"
#include "platform/foundation/KsURL.h"
#include "platform/tessel/TesselTypes.h"

namespace cindral {

/// One file or folder as a provider describes it: a snapshot that nobody changes.
///
/// Thread safety: read-only once made.
class TesselItem {
public:
    virtual ~TesselItem() = default;

    virtual const TesselItemIdentifier& itemIdentifier() const = 0;
    virtual const TesselItemIdentifier& parentItemIdentifier() const = 0;
    virtual const std::string& filename() const = 0;  ///< bytes as in the file system, not always UTF-8
    virtual const std::string& typeIdentifier() const = 0;
    virtual TesselItemCapabilities capabilities() const = 0;
    virtual bool isTrashed() const = 0;
    virtual bool isUbiquitous() const = 0;
    virtual bool isAppLibrary() const = 0;
    virtual std::optional<std::uint64_t> documentSize() const = 0;  ///< bytes
    virtual std::optional<KsDate> creationDate() const = 0;
    virtual std::optional<KsDate> contentModificationDate() const = 0;
    virtual std::optional<std::uint64_t> childItemCount() const = 0;
    virtual std::optional<ByteView> versionIdentifier() const = 0;  ///< lives as long as the item
    virtual std::optional<KsDate> lastUsedDate() const = 0;
    virtual const std::optional<std::vector<std::string>>& tags() const = 0;
    virtual std::optional<std::int64_t> favoriteRank() const = 0;
    virtual std::optional<std::uint64_t> fileID() const = 0;
    virtual std::optional<std::uint64_t> docID() const = 0;
    virtual const KsURL* fileURL() const = 0;                             ///< null when there is none
    virtual const std::string* appContainerBundleIdentifier() const = 0;  ///< null when there is none
    virtual const std::string* vistorDomainIdentifier() const = 0;  ///< search-index domain; null when there is none

    /// For log lines.
    virtual std::string description() const = 0;
};

}  // namespace cindral
