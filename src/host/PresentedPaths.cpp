#include "host/PresentedPaths.h"

#include <climits>
#include <filesystem>

#include "host/JsonText.h"

namespace cindral {
namespace {

constexpr std::string_view kDocuments = "Documents";

/// Calls back with each component; stops when it answers false.
template <typename Visit>
void eachComponent(std::string_view path, Visit visit) {
    while (!path.empty()) {
        const std::size_t slash = path.find('/');
        const std::string_view component = path.substr(0, slash);
        if (!component.empty() && !visit(component)) return;
        if (slash == std::string_view::npos) return;
        path.remove_prefix(slash + 1);
    }
}

// Trees deeper than the kernel's own limit on a path are walked in pieces; a real one has some thousand bytes more.
constexpr std::size_t kWalkedPathMax = 65'536;

bool isWalkable(std::string_view path) {
    bool walkable = path.size() <= kWalkedPathMax;
    eachComponent(path,
                  [&](std::string_view component) { return walkable = walkable && component.size() <= NAME_MAX; });
    return walkable;
}

/// The parent with its links resolved, and the last component as it is. Unchanged where the parent can't be walked.
std::string withRealParent(const std::string& path) {
    const std::size_t slash = path.rfind('/');
    const std::string_view name = std::string_view(path).substr(slash + 1);
    // No folder that exists has so long a path or such a component; walking it would cost many times its length.
    if (!isWalkable(path)) return path;
    // ".." has no name of its own: the folder that it leads to has.
    const bool isWalked = name == ".." || name.empty();
    std::error_code error;
    const std::string parent = isWalked ? path : path.substr(0, slash + 1);
    std::string real = std::filesystem::canonical(parent, error).string();
    if (error) return path;
    if (isWalked) return real;
    if (real != "/") real += '/';
    return real.append(name);
}

}  // namespace

std::string tidyPath(std::string_view path) {
    std::string tidy;
    eachComponent(path, [&](std::string_view component) {
        if (component != ".") tidy.append("/").append(component);
        return true;
    });
    return tidy.empty() ? "/" : tidy;
}

PresentedPaths::PresentedPaths(std::string given, std::string real, std::string presented)
    : given_(std::move(given)), real_(std::move(real)), presented_(std::move(presented)) {}

bool PresentedPaths::isPresentable(std::string_view path) {
    if (path == "/") return false;
    const std::size_t slash = path.rfind('/');
    return path.substr(slash + 1) == kDocuments && !hasDocumentsComponent(path.substr(0, slash));
}

bool PresentedPaths::hasDocumentsComponent(std::string_view path) {
    bool found = false;
    eachComponent(path, [&](std::string_view component) {
        found = component == kDocuments;
        return !found;
    });
    return found;
}

std::optional<std::string_view> PresentedPaths::remainder(std::string_view path, std::string_view folder) {
    if (folder == "/") folder = "";
    if (!path.starts_with(folder)) return std::nullopt;
    path.remove_prefix(folder.size());
    if (!path.empty() && path.front() != '/') return std::nullopt;
    return path;
}

std::string PresentedPaths::realPath(std::string_view presentedPath) const {
    const auto below = isSame() ? std::nullopt : remainder(presentedPath, presented_);
    if (!below) return std::string(presentedPath);
    return std::string(real_).append(*below);
}

void PresentedPaths::appendRealURL(std::string& out, const KsURL& url) const {
    if (!url.isFileURL()) {
        out += url.path();
        return;
    }
    out += "file://";
    appendPercentEncoded(out, realPath(url.path()));
}

std::string PresentedPaths::realURL(const KsURL& url) const {
    std::string out;
    appendRealURL(out, url);
    return out;
}

std::string PresentedPaths::presentedPath(std::string_view path) const {
    std::string tidy = tidyPath(path);
    // The storage itself may have been named by a link, and is presented by one: here the last component is followed.
    for (const std::string* name : {&given_, &presented_}) {
        const auto below = remainder(tidy, *name);
        if (below) {
            tidy = real_ + std::string(*below);
            break;
        }
    }
    std::string real = tidy == real_ ? tidy : withRealParent(tidy);
    const auto below = remainder(real, real_);
    return below ? std::string(presented_).append(*below) : real;
}

KsURL PresentedPaths::presentedURL(const KsURL& url) const {
    return url.isFileURL() ? KsURL::fileURL(presentedPath(url.path())) : url;
}

}  // namespace cindral
