#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/Data.h"

namespace cindral {

/// The contents of an icon's file, and how large the icon is to be.
struct IconData {
    Bytes bytes;          ///< of a PNG or SVG file, unchecked
    unsigned pixels = 0;  ///< of its longer side, at most
};

/// Where an application's icon is found: a file, or a name in icon themes.
///
/// Thread safety: immutable. Looks at the files anew each time, so that an update of the application is seen.
class ApplicationIcon {
public:
    /// Bytes of an icon's file that are worth looking at.
    static constexpr std::size_t kBytesMax = 4 * 1'048'576;

    /// By the name of an icon or the absolute path of a file, as a desktop entry gives it. `themeFolders` hold themes,
    /// most important first; `looseFolders` hold icons as they are.
    static std::shared_ptr<const ApplicationIcon> named(std::string icon, std::vector<std::string> themeFolders,
                                                        std::vector<std::string> looseFolders);
    /// By name, in what a Flatpak application exports. `deployment` leads through links that an update replaces; it is
    /// opened once for a look, beneath `applications`.
    static std::shared_ptr<const ApplicationIcon> exported(std::string icon, std::string applications,
                                                           std::string deployment);

    /// The smallest that is as large or larger; none when there is none.
    std::optional<IconData> data(unsigned pixels) const;

private:
    ApplicationIcon() = default;
    std::optional<Bytes> best(int folder, const std::string& themes, unsigned pixels, bool beneath) const;

    std::string icon_;
    std::vector<std::string> themeFolders_;
    std::vector<std::string> looseFolders_;
    std::string applications_;
    std::string deployment_;
};

}  // namespace cindral
