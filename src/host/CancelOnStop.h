#pragma once

#include <memory>

#include "host/DaemonConnection.h"
#include "host/StopSignals.h"
#include "platform/foundation/Dispatch.h"

namespace cindral {

/// What ends a command by a signal ends what the daemon does for it, too: an interrupted import leaves nothing behind,
/// whoever was at work.
///
/// From the first SIGINT or SIGTERM on the command gets no answers and asks nothing more; what can be cancelled is, and
/// then the process ends by the signal, as it would have without a daemon. A second signal ends it at once.
///
/// Thread safety: one object at a time, made and ended by one thread.
class CancelOnStop {
public:
    /// `connection` is borrowed for life.
    static Result<std::unique_ptr<CancelOnStop>> start(DaemonConnection& connection);
    ~CancelOnStop();
    CancelOnStop(const CancelOnStop&) = delete;
    CancelOnStop& operator=(const CancelOnStop&) = delete;

private:
    CancelOnStop(std::unique_ptr<StopSignals> signals, UniqueFd over, DaemonConnection& connection)
        : signals_(std::move(signals)), over_(std::move(over)), connection_(connection) {}
    void run();

    std::unique_ptr<StopSignals> signals_;
    const UniqueFd over_;
    DaemonConnection& connection_;
    DispatchGroup running_;
};

}  // namespace cindral
