#include "host/LineOutput.h"

#include <cerrno>

namespace cindral {

void LineOutput::write(std::string_view line) {
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
