#include "platform/roster/ApplicationIcon.h"

#include <fcntl.h>

#include <algorithm>
#include <charconv>
#include <limits>

#include "platform/roster/RosterFiles.h"

namespace cindral {
namespace {

using roster_files::Links;

constexpr std::string_view kTheme = "hicolor";
constexpr std::string_view kContext = "apps";
constexpr std::string_view kScalable = "scalable";
constexpr std::string_view kSuffixes[] = {".png", ".svg", ".svgz"};

/// How large the icons in a folder of a theme are ("48x48", "48x48@2"): pixels of a side; none for other folders.
std::optional<unsigned> pixelsOf(std::string_view folder) {
    unsigned size = 0;
    const char* end = folder.data() + folder.size();
    const auto width = std::from_chars(folder.data(), end, size);
    if (width.ec != std::errc() || width.ptr == end || *width.ptr != 'x') return std::nullopt;
    unsigned height = 0;
    const auto rest = std::from_chars(width.ptr + 1, end, height);
    if (rest.ec != std::errc() || size == 0 || height != size || size > 4096) return std::nullopt;
    if (rest.ptr == end) return size;
    unsigned scale = 0;
    if (*rest.ptr != '@') return std::nullopt;
    const auto read = std::from_chars(rest.ptr + 1, end, scale);
    if (read.ec != std::errc() || read.ptr != end || scale == 0 || scale > 16) return std::nullopt;
    return size * scale;
}

/// A name that leads nowhere else.
bool isPlainName(std::string_view name) {
    return !name.empty() && !name.starts_with('.') && name.find('/') == std::string_view::npos;
}

bool hasKnownSuffix(std::string_view name) {
    return std::ranges::any_of(kSuffixes, [name](std::string_view suffix) { return name.ends_with(suffix); });
}

/// The folders of a theme that have an icon as large as asked for or larger, the nearest first. A drawing fits every
/// size, but costs more than a picture of just that size.
std::vector<std::string> foldersFor(std::vector<std::string> folders, unsigned pixels) {
    const auto distance = [pixels](const std::string& folder) {
        constexpr auto kNone = std::numeric_limits<unsigned>::max();
        if (folder == kScalable) return 1U;
        const auto size = pixelsOf(folder);
        if (!size || *size < pixels) return kNone;
        return *size == pixels ? 0 : *size - pixels + 1;
    };
    std::erase_if(folders,
                  [&](const std::string& each) { return distance(each) == std::numeric_limits<unsigned>::max(); });
    std::ranges::stable_sort(folders, {}, distance);
    return folders;
}

std::optional<Bytes> readIcon(int folder, const std::string& path, Links links) {
    return roster_files::read(folder, path, ApplicationIcon::kBytesMax, links);
}

std::optional<Bytes> readNamed(int folder, const std::string& place, const std::string& name, Links links) {
    if (hasKnownSuffix(name)) {
        if (auto bytes = readIcon(folder, place + "/" + name, links)) return bytes;
    }
    for (const std::string_view suffix : kSuffixes) {
        if (auto bytes = readIcon(folder, (place + "/" + name).append(suffix), links)) return bytes;
    }
    return std::nullopt;
}

}  // namespace

std::shared_ptr<const ApplicationIcon> ApplicationIcon::named(std::string icon, std::vector<std::string> themeFolders,
                                                              std::vector<std::string> looseFolders) {
    std::shared_ptr<ApplicationIcon> made(new ApplicationIcon);
    made->icon_ = std::move(icon);
    made->themeFolders_ = std::move(themeFolders);
    made->looseFolders_ = std::move(looseFolders);
    return made;
}

std::shared_ptr<const ApplicationIcon> ApplicationIcon::exported(std::string icon, std::string applications,
                                                                 std::string deployment) {
    std::shared_ptr<ApplicationIcon> made(new ApplicationIcon);
    made->icon_ = std::move(icon);
    made->applications_ = std::move(applications);
    made->deployment_ = std::move(deployment);
    return made;
}

std::optional<Bytes> ApplicationIcon::best(int folder, const std::string& themes, unsigned pixels, bool beneath) const {
    const Links links = beneath ? Links::beneath : Links::anywhere;
    const auto theme = roster_files::openFolder(folder, (themes + "/").append(kTheme), links);
    if (!theme) return std::nullopt;
    for (const std::string& size : foldersFor(roster_files::names(theme->get()), pixels)) {
        if (auto bytes = readNamed(theme->get(), (size + "/").append(kContext), icon_, links)) return bytes;
    }
    return std::nullopt;
}

std::optional<IconData> ApplicationIcon::data(unsigned pixels) const {
    std::optional<Bytes> bytes;
    if (!applications_.empty()) {
        const auto applications = roster_files::openFolder(AT_FDCWD, applications_, Links::anywhere);
        const auto deployment =
            applications ? roster_files::openFolder(applications->get(), deployment_, Links::beneath) : std::nullopt;
        if (deployment && isPlainName(icon_)) bytes = best(deployment->get(), "export/share/icons", pixels, true);
    } else if (icon_.starts_with('/')) {
        bytes = readIcon(AT_FDCWD, icon_, Links::anywhere);
    } else if (isPlainName(icon_)) {
        for (const std::string& folder : themeFolders_) {
            bytes = best(AT_FDCWD, folder, pixels, false);
            if (bytes) break;
        }
        for (const std::string& folder : looseFolders_) {
            if (bytes) break;
            bytes = readNamed(AT_FDCWD, folder, icon_, Links::anywhere);
        }
    }
    if (!bytes) return std::nullopt;
    return IconData{*std::move(bytes), pixels};
}

}  // namespace cindral
