#pragma once

#include <atomic>
#include <optional>
#include <string_view>

#include "host/Descriptor.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// Writes whole lines to a descriptor, from any thread, never one into another.
///
/// After a failed write nothing more is written: the stream would go on in the middle of a line. A reader that has gone
/// away is such a failure, not an error to be told of.
///
/// Thread safety: all operations, from any thread.
class LineOutput {
public:
    /// `fd` is borrowed for life. `interrupt` (borrowed too) is set off by a failed write.
    LineOutput(int fd, const UniqueFd& interrupt) : fd_(fd), interrupt_(interrupt) {}

    /// `line` ends with its newline.
    void write(std::string_view line);

    bool isBroken() const { return isBroken_.load(); }
    /// What went wrong; none while nothing did, and where only the reader has gone away.
    std::optional<KsError> error() const;

private:
    const int fd_;
    const UniqueFd& interrupt_;
    std::atomic<bool> isBroken_ = false;
    mutable Mutex mutex_;
    std::optional<KsError> error_ GUARDED_BY(mutex_);
};

}  // namespace cindral
