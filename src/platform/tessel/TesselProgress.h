#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>

#include "platform/foundation/Mutex.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// How far a long operation has come, and the way to stop it.
///
/// The operation counts; whoever asked for it looks, and may cancel. Cancelling asks: an operation that is past the
/// point where it takes effect goes on to its end. One that was cancelled in time answers with ECANCELED, and what it
/// had done is undone.
///
/// Thread safety: all operations, from any thread.
class TesselProgress {
public:
    struct Counts {
        std::uint64_t completedBytes = 0;
        std::uint64_t totalBytes = 0;
        std::uint64_t completedItems = 0;
        std::uint64_t totalItems = 0;
    };
    /// Called on the operation's thread whenever it has counted, and once by setObserver() where it has already. Must be
    /// quick: the operation waits for it.
    using Observer = std::function<void(const Counts&)>;

    Counts counts() const;
    void setObserver(Observer observer);

    void cancel() { isCancelled_.store(true); }
    bool isCancelled() const { return isCancelled_.load(); }

    /// For the operation. ECANCELED once it has been cancelled.
    Result<void> check() const;
    void setTotal(std::uint64_t bytes, std::uint64_t items);
    void advance(std::uint64_t bytes, std::uint64_t items);
    /// For an operation that is counted elsewhere.
    void setCounts(const Counts& counts);

private:
    void tell();

    std::atomic<bool> isCancelled_ = false;
    std::atomic<bool> isObserved_ = false;
    mutable Mutex mutex_;
    Counts counts_ GUARDED_BY(mutex_);
    std::shared_ptr<const Observer> observer_ GUARDED_BY(mutex_);
};

}  // namespace cindral
