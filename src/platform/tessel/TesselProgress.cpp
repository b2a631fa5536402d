#include "platform/tessel/TesselProgress.h"

#include <cerrno>
#include <utility>

namespace cindral {

TesselProgress::Counts TesselProgress::counts() const {
    const MutexLock lock(mutex_);
    return counts_;
}

void TesselProgress::setObserver(Observer observer) {
    auto shared = observer ? std::make_shared<const Observer>(std::move(observer)) : nullptr;
    bool hasCounted = false;
    {
        const MutexLock lock(mutex_);
        isObserved_.store(shared != nullptr);
        observer_.swap(shared);  // The old one goes after the lock.
        hasCounted = counts_.totalItems != 0;
    }
    if (hasCounted) tell();
}

Result<void> TesselProgress::check() const {
    if (isCancelled()) return KsError::posix(ECANCELED);
    return {};
}

void TesselProgress::setTotal(std::uint64_t bytes, std::uint64_t items) {
    {
        const MutexLock lock(mutex_);
        counts_.totalBytes = bytes;
        counts_.totalItems = items;
    }
    tell();
}

void TesselProgress::advance(std::uint64_t bytes, std::uint64_t items) {
    {
        const MutexLock lock(mutex_);
        counts_.completedBytes += bytes;
        counts_.completedItems += items;
    }
    tell();
}

void TesselProgress::setCounts(const Counts& counts) {
    {
        const MutexLock lock(mutex_);
        counts_ = counts;
    }
    tell();
}

void TesselProgress::tell() {
    if (!isObserved_.load()) return;
    std::shared_ptr<const Observer> observer;
    Counts counts;
    {
        const MutexLock lock(mutex_);
        observer = observer_;
        counts = counts_;
    }
    if (observer) (*observer)(counts);
}

}  // namespace cindral
