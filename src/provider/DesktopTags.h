#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/Data.h"

namespace cindral {

/// Tags as file managers of the desktop keep them: an attribute of UTF-8 text, separated by commas.
namespace desktop_tags {

/// With the namespace it is "user.xdg.tags".
inline constexpr std::string_view kXattrName = "xdg.tags";

/// Each label once, in their order, without the spaces around them. What is empty or no text is left out; none where
/// nothing is left.
std::optional<std::vector<std::string>> decode(ByteView bytes);

/// None for none. A label with a comma would be read as two, and is left out, like what decode() would leave out.
std::optional<Bytes> encode(const std::vector<std::string>& labels);

}  // namespace desktop_tags

}  // namespace cindral
