#pragma once

#include <span>
#include <string_view>

namespace cindral {

/// A file of the page, which is part of the program.
struct WebAsset {
    std::string_view path;  ///< "/app.js"
    std::string_view contentType;
    std::string_view contents;
};

/// All of them; "/" is the page itself.
std::span<const WebAsset> webAssets();

}  // namespace cindral
