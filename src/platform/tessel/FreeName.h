#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace cindral {

/// Bytes of a name that file systems take at most.
inline constexpr std::size_t kNameBytesMax = 255;

enum class NameKind { folder, document };

/// The name to try instead of one that is taken: "Report 2.txt" for "Report.txt", then "Report 3.txt", … A folder's name
/// has no extension, nor has one whose only "." comes first.
///
/// `number` is 2 or more. Never longer than kNameBytesMax: what is too long is cut before the number, between characters
/// where the name is UTF-8.
std::string alternativeName(std::string_view name, NameKind kind, std::uint64_t number);

}  // namespace cindral
