#pragma once

#include <string>

#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// The moments in which a state folder passes to a daemon or away from it.
///
/// Who may have to use the folder alone, because no daemon answers, looks again with a handover of its own: then nobody
/// is in the middle of becoming the folder's daemon, or of ceasing to be it. Either one answers, or whoever holds the
/// store's lock is none. So a command never fails because a daemon is being started or stopped: it waits for that.
///
/// A lock (flock) of the state folder itself, which is gone with the process. Where there are no locks, nobody waits.
///
/// Thread safety: a value.
class StateHandover {
public:
    enum class Part {
        daemon,  ///< alone: begins or ceases to be the folder's daemon
        client,  ///< beside others: looks whether there is one
    };
    /// Waits for whoever plays the other part. The folder must be there.
    static Result<StateHandover> begin(const std::string& state, Part part);

private:
    explicit StateHandover(UniqueFd folder) : folder_(std::move(folder)) {}
    UniqueFd folder_;
};

}  // namespace cindral
