#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/KsURL.h"

namespace cindral {

/// The two names of the storage: where it really is, and the path that the provider knows it by.
///
/// The provider finds trash folders by a path component "Documents", the last and only one of the storage's path. Where
/// the real path is otherwise, the storage is presented through a link of that name, and every path and URL that
/// crosses the host's boundary changes its beginning here.
///
/// Thread safety: immutable.
class PresentedPaths {
public:
    /// All absolute and without trailing slashes. `given` is the storage as the person named it, `real` has no links in
    /// it.
    PresentedPaths(std::string given, std::string real, std::string presented);

    const std::string& real() const { return real_; }
    const std::string& presented() const { return presented_; }
    bool isSame() const { return real_ == presented_; }

    /// Whether the path may be presented as it is: "Documents" is its last component and no other.
    static bool isPresentable(std::string_view path);
    static bool hasDocumentsComponent(std::string_view path);

    /// The path that a client sees for one that the provider handed out.
    std::string realPath(std::string_view presentedPath) const;
    std::string realURL(const KsURL& url) const;
    void appendRealURL(std::string& out, const KsURL& url) const;

    /// The path that the provider knows for one that a client named: below the storage by any of its names, links in
    /// the parent resolved. The last component is never followed. A path outside of the storage stays what it is.
    std::string presentedPath(std::string_view path) const;
    KsURL presentedURL(const KsURL& url) const;

    /// What follows the folder in a path that is the folder or below it: "" or "/…"; none for any other path.
    static std::optional<std::string_view> remainder(std::string_view path, std::string_view folder);

private:
    std::string given_;
    std::string real_;
    std::string presented_;
};

/// Without doubled and trailing slashes and "." components. ".." stays: what it means depends on links.
std::string tidyPath(std::string_view path);

}  // namespace cindral
