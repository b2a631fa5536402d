#include "host/ProgressPace.h"

#include <cstdint>
#include <utility>

namespace cindral {

namespace {

// From here on somebody may be waiting for it.
constexpr std::uint64_t kMuchBytes = 1 << 20;
constexpr std::uint64_t kManyItems = 100;

}  // namespace

ProgressPace::ProgressPace(Clock clock) : clock_(std::move(clock)), lastTold_(clock_()) {}

bool ProgressPace::isTimeToTell(const TesselProgress::Counts& counts) {
    const MutexLock lock(mutex_);
    const auto now = clock_();
    const bool isMuch = counts.totalBytes >= kMuchBytes || counts.totalItems >= kManyItems;
    const bool isFirst = !hasTold_ && isMuch;
    if (!isFirst && now - lastTold_ < kIntervalMin) return false;
    hasTold_ = true;
    lastTold_ = now;
    return true;
}

}  // namespace cindral
