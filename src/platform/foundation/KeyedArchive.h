#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/Data.h"
#include "platform/foundation/KsDate.h"
#include "platform/foundation/PropertyList.h"

namespace cindral {

/// One typed root object as self-describing bytes: docs/keyed-archive.md.
///
/// A binary property list whose top is a dictionary of `archiver` ("KsKeyedArchiver"), `version` (1) and `root`.
/// Strings, numbers, dates, bytes, arrays and dictionaries stand as property-list values; an object of an archived
/// class as a dictionary with `class` and its fields.
///
/// Decoding names the class that it allows, exactly; anything else (another archiver or version, another class, bytes
/// that are no property list) is absent.
///
/// Thread safety: functions without state.
namespace keyed_archive {

Bytes archive(const PropertyList& root);
/// What an archive holds.
struct Unarchived {
    std::optional<PropertyList> root;  ///< none: the archive has none
};
/// For who must tell an archive without a root object from bytes that are no archive of this version, which are none.
std::optional<Unarchived> unarchive(ByteView bytes);
/// The root object, whatever its class; none when the bytes are no archive of this version.
std::optional<PropertyList> unarchiveRoot(ByteView bytes);

std::optional<KsDate> unarchiveDate(ByteView bytes);
std::optional<std::string> unarchiveString(ByteView bytes);
std::optional<std::vector<std::string>> unarchiveStrings(ByteView bytes);

/// A number as archived: exact for integers of 64 bits, signed or unsigned; a real counts when it is a whole number
/// that fits.
std::optional<std::int64_t> unarchiveInteger(ByteView bytes);

}  // namespace keyed_archive

}  // namespace cindral
