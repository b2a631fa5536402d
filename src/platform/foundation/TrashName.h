#pragma once

#include <string_view>

namespace cindral {

/// The name of a folder of trash. Such a folder is no item, wherever it lies; what is in it is.
inline constexpr std::string_view kTrashName = ".Trash";

}  // namespace cindral
