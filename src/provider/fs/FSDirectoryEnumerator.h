#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/RootDirectories.h"

namespace cindral {

class FSListingPositions;

/// How the entries of a directory are scanned.
enum class DirectoryEnumerationOptions : std::int64_t {
    none = 0,
    skipsHiddenNames = 1 << 0,         ///< leave out entries whose name begins with "."
    skipsPackageDescendants = 1 << 1,  ///< don't descend into a sub-directory that is a package
    skipsFolderDescendants = 1 << 2,   ///< don't descend into a sub-directory that is no package
};
constexpr bool operator&(DirectoryEnumerationOptions a, DirectoryEnumerationOptions b) {
    return (static_cast<std::int64_t>(a) & static_cast<std::int64_t>(b)) != 0;
}

/// What to list, from where, and how much of it.
struct EnumeratorOptions {
    std::vector<KsURL> urls;  ///< the directories, in this order
    bool recursively = false;
    std::uint64_t offset = 0;  ///< entries to skip before the first one delivered, over all directories and levels
    std::uint64_t limit = UINT64_MAX;  ///< entries to deliver at most
    /// Chooses the option bits of a directory before it is scanned, the `urls` among them; none is no bits.
    std::function<std::optional<DirectoryEnumerationOptions>(const KsURL&)> directoryEnumerationOptionsFor;
    /// Where listings of this kind left off, so that a later page need not count from the start; null does without.
    /// `positionsKey` tells one kind of listing (directories and options) from another.
    FSListingPositions* positions = nullptr;
    std::string positionsKey;
};

/// An open directory with its status, which is taken before the first entry is read, so that a change during a scan shows
/// as a change since. `parent`, where it is known, spares asking for what directories of one file system share.
Result<std::shared_ptr<const DirectoryReference>> describedDirectory(UniqueFd fd, std::string path,
                                                                     const DirectoryReference* parent);

/// Lists the entries of directories in the order in which the file system returns them, "." and ".." left out.
///
/// An entry is delivered before what is below it (pre-order). Offset and limit count over the whole enumeration, so
/// that pages of N entries, one after the other, deliver exactly what one enumeration without a limit delivers, as long
/// as nothing changes.
///
/// A listing is not a snapshot. An entry that exists through the whole scan is delivered exactly once; one that appears
/// or disappears meanwhile is delivered or not.
///
/// Links are never followed, and directories of other devices not entered. At most a few dozen descriptors are open at
/// a time, however deep the tree.
///
/// Thread safety: one enumeration at a time an object.
class FSDirectoryEnumerator {
public:
    /// Gets each delivered entry, its directory still open (KsURL::directory). A failure stops the enumeration.
    using Body = std::function<Result<void>(KsURL entry)>;

    /// The body's error, unchanged; or an expired page, when a directory moved away from under a deep scan. A directory
    /// that can't be opened yields no entries and an error line; see also
    /// openError().
    Result<void> enumerate(const EnumeratorOptions& options, const Body& body);

    /// The offset that follows the last entry consumed.
    std::uint64_t counter() const { return counter_; }
    /// False when the limit stopped the scan and more entries remain.
    bool isComplete() const { return complete_; }
    /// Why the first of `urls` that can't be opened, or be read to its end, couldn't be.
    const std::optional<KsError>& openError() const { return openError_; }

private:
    class Scan;
    std::uint64_t counter_ = 0;
    bool complete_ = true;
    std::optional<KsError> openError_;
};

}  // namespace cindral
