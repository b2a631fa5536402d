#pragma once

#include <string>
#include <string_view>

#include "platform/foundation/Data.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// The system's own extended attributes of a file: what a person said of a document (tags, rank, dates). Most editors
/// drop them when they save, so the volume store remembers them.
///
/// Encoded form (docs/volume-store.md): for each attribute, in the order of the names, u16 size of the name, the name
/// with its namespace, u32 size of the value, the value; little-endian.
namespace own_attributes {

/// Names that begin like this are the system's own.
inline constexpr std::string_view kPrefix = "user.com.vemra.";

/// Of an entry of a folder, not following a link. Empty when there are none.
Result<Bytes> read(int folder, const char* name);

/// Puts those that the open file lacks onto it; what it has already stays as it is. Answers how many were put.
/// What can't be read of `attributes` is left out.
Result<std::size_t> restoreMissing(int file, ByteView attributes);

}  // namespace own_attributes

}  // namespace cindral
