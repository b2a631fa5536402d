#pragma once

#include <atomic>
#include <optional>
#include <string_view>

#include "host/Descriptor.h"
#include "host/LineSink.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// Writes whole lines to a descriptor, from any thread, never one into another. A reader that is slow holds up whoever
/// writes.
///
/// After a failed write nothing more is written: the stream would go on in the middle of a line. A reader that has gone
/// away is such a failure, not an error to be told of.
///
/// Thread safety: all operations, from any thread.
class LineOutput final : public LineSink {
public:
    /// `fd` is borrowed for life. `interrupt` (borrowed too) is set off by a failed write.
    LineOutput(int fd, const UniqueFd& interrupt) : fd_(fd), interrupt_(interrupt) {}

    void write(std::string_view line) override;
    std::optional<KsError> error() const override;

private:
    const int fd_;
    const UniqueFd& interrupt_;
    std::atomic<bool> isBroken_ = false;
    mutable Mutex mutex_;
    std::optional<KsError> error_ GUARDED_BY(mutex_);
};

}  // namespace cindral
