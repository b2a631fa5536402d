#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/Data.h"
#include "platform/foundation/KsDate.h"
#include "platform/foundation/KsError.h"
#include "platform/foundation/KsURL.h"

namespace cindral {

/// The URL with a path that begins with "/var" rewritten to begin with "/private/var"; otherwise unchanged. A plain
/// prefix test: "/variable/x" is rewritten too. Every comparison of a path with a root goes through this first.
KsURL properURL(const KsURL& url);
/// The same for a path; `out` holds the rewritten text where there is one.
std::string_view properPath(std::string_view path, std::string& out);

/// The folder of documents: of the storage, and of an application's container.
inline constexpr std::string_view kDocumentsName = "Documents";

/// Where the user's metadata lives: names of extended attributes. Each value is a keyed archive of one object
/// (docs/keyed-archive.md). On disk: add names, never change one.
inline constexpr std::string_view kXattrTrashDateName = "com.vemra.trash.time#PS";               ///< a date
inline constexpr std::string_view kXattrTrashPutBackName = "com.vemra.trash.putback#PS";         ///< a string
inline constexpr std::string_view kXattrLastUsedDateName = "com.vemra.lastuseddate#PS";          ///< a date
inline constexpr std::string_view kXattrFavoriteRankName = "com.vemra.favorite-rank.number#PS";  ///< a number
inline constexpr std::string_view kXattrTagDataName = "com.vemra.metadata:_kMDItemUserTags";  ///< an array of strings

/// The attribute's bytes, read without following a final link; none when it is absent or can't be read (logged, unless
/// absent).
std::optional<Bytes> initWithValueOfXattr(std::string_view name, const KsURL& url);
/// Sets the attribute of an open file (O_PATH will do), or removes it when there is no value. Removing what is not there
/// succeeds.
std::optional<KsError> setXattr(int fd, const std::optional<Bytes>& value, std::string_view name);

/// Resource values as a type: none when absent, of another type, or unreadable; the last is logged at error level.
std::optional<bool> boolResourceValue(const KsURL& url, ResourceKey key);
std::optional<KsDate> dateResourceValue(const KsURL& url, ResourceKey key);
std::optional<std::string> stringResourceValue(const KsURL& url, ResourceKey key);
std::optional<std::uint64_t> numberResourceValue(const KsURL& url, ResourceKey key);

/// The process ends where it overflows.
std::uint64_t checkedSum(std::uint64_t a, std::uint64_t b);

/// Whether a component below the root that holds the URL is exactly ".Trash".
bool isInTrash(const KsURL& url);

/// Whether the device is a tablet, and the scale of its screen. Read once per process (CINDRAL_DEVICE_CLASS,
/// CINDRAL_SCREEN_SCALE); default no and 2.0.
bool isTabletDevice();
double mainScreenScale();

/// Makes the folder ".TemporaryLocalFolder" of the storage unless it is there, and answers its URL; a failure is
/// logged.
KsURL temporaryLocalFolderURL();

}  // namespace cindral
