#include "host/LineOutput.h"

#include <cerrno>

#include "platform/foundation/ThreadPool.h"

namespace cindral {

void LineOutput::write(std::string_view line) {
    // A reader that is slow, or another's line: meanwhile the pool may do something else.
    const ThreadPool::BlockingRegion region;
    const MutexLock lock(mutex_);
    if (isBroken_.load()) return;
    if (auto written = descriptor::writeAll(fd_, line); !written.ok()) {
        isBroken_.store(true);
        if (!written.error().isPosix(EPIPE)) error_ = std::move(written).error();
        descriptor::interrupt(interrupt_);
    }
}

std::optional<KsError> LineOutput::error() const {
    const MutexLock lock(mutex_);
    return error_;
}

}  // namespace cindral
