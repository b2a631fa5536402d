#include "host/StateHandover.h"

#include <fcntl.h>
#include <sys/file.h>

#include <cerrno>

#include "platform/foundation/Sys.h"
#include "platform/foundation/SysEdits.h"

namespace cindral {

Result<StateHandover> StateHandover::begin(const std::string& state, Part part) {
    UniqueFd folder = TRY(sys::open(state.c_str(), O_RDONLY | O_DIRECTORY));
    const auto locked = sys::flock(folder.get(), part == Part::daemon ? LOCK_EX : LOCK_SH);
    const bool hasNoLocks = !locked.ok() && (locked.error().isPosix(EBADF) || locked.error().isPosix(ENOLCK) ||
                                             locked.error().isPosix(EOPNOTSUPP));
    if (!locked.ok() && !hasNoLocks) return locked.error();
    return StateHandover(std::move(folder));
}

}  // namespace cindral
