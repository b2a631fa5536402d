#pragma once

#include <functional>
#include <memory>
#include <optional>

#include "platform/foundation/Dispatch.h"
#include "platform/foundation/UniqueFd.h"
#include "platform/roster/RosterScanner.h"
#include "platform/roster/RosterWatch.h"

namespace cindral {

/// Follows the sources of applications, on a thread of its own ("cindral.roster").
///
/// Thread safety: stop() once, from any thread but the watcher's own.
class RosterWatcher {
public:
    using Receiver = std::function<void(RosterContents)>;

    /// Takes the first look, and hands it to the receiver before it returns; each later one on the watcher's thread.
    static std::shared_ptr<RosterWatcher> start(RosterSources sources, Receiver receive);
    /// Returns when the receiver is not being called, nor will be.
    void stop();

private:
    RosterWatcher(RosterSources sources, Receiver receive);
    void look();
    void run();
    /// False when the watcher is to stop.
    bool waitForNews();
    bool poll(std::optional<RosterWatch::TimePoint> until, bool& isReady);

    RosterScanner scanner_;
    const Receiver receive_;
    std::optional<RosterWatch> watch_;
    UniqueFd wakeFd_;
    DispatchSemaphore ended_{0};
    bool isRunning_ = false;
};

}  // namespace cindral
