#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/foundation/Result.h"
#include "platform/foundation/Sys.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// A folder on the way down, open.
struct WalkedFolder {
    UniqueFd fd;  ///< for reading
    FileStatus status;
    std::string name;  ///< in the folder above; empty for the top
    /// The visitor's: a folder elsewhere that belongs to this one, kept open as long as this one is.
    UniqueFd counterpart;
    FileStatus counterpartStatus;
};

enum class Descend { no, yes };
enum class Leave { done, readAgain };

/// What is done with each thing in a tree. An error ends the walk.
class TreeVisitor {
public:
    virtual ~TreeVisitor() = default;
    /// A folder was opened and is about to be read; `above` is null for the top.
    virtual Result<Descend> willEnter(WalkedFolder& folder, const WalkedFolder* above) = 0;
    /// Anything but a folder. It may be gone already.
    virtual Result<void> visit(const WalkedFolder& folder, const char* name) = 0;
    /// A folder of that name can't be opened for want of permission. Whether that was changed, and is worth another try.
    virtual bool hasUnlocked(const WalkedFolder& /*folder*/, const char* /*name*/) { return false; }
    /// Everything in the folder has been visited. It may be asked to be read again, for what has come since.
    virtual Result<Leave> didLeave(WalkedFolder& folder, const WalkedFolder* above) = 0;
};

/// Visits what is in a directory and below it, depth first, the other things in a folder before its sub-folders.
///
/// Every step goes from an open directory to an entry of it, links are not followed, and the way back up is taken only
/// to the very directory that was come from: whatever is renamed or replaced meanwhile, the walk stays in the tree.
/// Trees of any depth cost few descriptors. What vanishes meanwhile is not visited; what can't be read is an error.
/// Errors bear the "path" of what they are about: `path` and the names on the way. ESTALE where a folder was moved from
/// under the walk.
Result<void> walkTree(UniqueFd top, const std::string& path, TreeVisitor& visitor);

}  // namespace cindral
