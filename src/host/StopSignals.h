#pragma once

#include <csignal>
#include <memory>

#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// Turns SIGINT and SIGTERM into a descriptor that becomes readable, so that what is under way ends in order. A signal
/// that the process was started to ignore stays ignored.
///
/// Thread safety: one object at a time, made and ended by one thread.
class StopSignals {
public:
    static Result<std::unique_ptr<StopSignals>> catchThem();
    /// The signals do again what they did before.
    ~StopSignals();
    StopSignals(const StopSignals&) = delete;
    StopSignals& operator=(const StopSignals&) = delete;

    /// Stays readable once a signal has come.
    int descriptor() const { return descriptor_.get(); }
    /// The one that came last; 0 while none has.
    int signal() const;

private:
    explicit StopSignals(UniqueFd descriptor);

    const UniqueFd descriptor_;
    struct sigaction interruptBefore_ {};
    struct sigaction terminateBefore_ {};
};

}  // namespace cindral
