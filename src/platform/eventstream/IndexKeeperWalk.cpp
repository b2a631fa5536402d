#include "platform/eventstream/IndexKeeperWalk.h"

#include <pthread.h>

#include <algorithm>
#include <utility>

namespace cindral {

namespace {

// Each holds the names of up to 64 KiB; enough that neither thread waits for the other at every folder.
constexpr std::size_t kBatchesAheadMax = 32;

}  // namespace

IndexKeeper::TreeWalk::TreeWalk(const IndexKeeper& keeper, const Root& root, Subfolder top)
    : keeper_(keeper), root_(root) {
    stack_.push_back(std::move(top));
}

std::optional<IndexKeeper::Batch> IndexKeeper::TreeWalk::next() {
    Batch batch;
    if (!folder_) {
        if (stack_.empty()) return std::nullopt;
        batch.place = std::move(stack_.back());
        stack_.pop_back();
        batch.isFirst = true;
        auto opened = keeper_.open(batch.place.fileID, batch.place.path, root_);
        if (!opened.ok()) {
            batch.error = opened.error();
            batch.isLast = true;
            return batch;
        }
        folder_ = *std::move(opened);
        batch.watched = keeper_.startWatching(*folder_);
    }
    batch.folder = folder_;
    readNames(batch);
    enter(batch);
    if (batch.isLast) folder_ = nullptr;
    return batch;
}

/// The walk needs to know which entries are folders; of the others it can be known later.
void IndexKeeper::TreeWalk::enter(Batch& batch) {
    for (BatchEntry& entry : batch.entries) {
        if (!entry.mayBeFolder || !lookAt(batch, entry) || !entry.status.isDirectory()) continue;
        entry.isEntered = true;
        stack_.push_back({FileID{entry.status.fileID}, index_keeper::joined(batch.folder->path, entry.name)});
    }
}

IndexKeeper::ReadAhead::ReadAhead(TreeWalk& walk) : walk_(walk), thread_([this] { run(); }) {
    ::pthread_setname_np(thread_.native_handle(), "recorder-reads");
}

IndexKeeper::ReadAhead::~ReadAhead() {
    {
        const MutexLock lock(mutex_);
        isStopped_ = true;
        changed_.notifyAll();
    }
    thread_.join();
}

void IndexKeeper::ReadAhead::run() {
    while (waitForRoom()) {
        std::optional<Batch> batch = walk_.next();
        const MutexLock lock(mutex_);
        isDone_ = !batch;
        if (batch) {
            ++untaken_;
            slots_.push_back({.batch = *std::move(batch)});
        }
        changed_.notifyOne();
        if (isDone_) break;
    }
    while (lookAtOne()) {
    }
}

/// Looks at entries meanwhile. False when the walk is no longer wanted.
bool IndexKeeper::ReadAhead::waitForRoom() {
    while (true) {
        {
            const MutexLock lock(mutex_);
            if (isStopped_) return false;
            if (slots_.size() < kBatchesAheadMax) return true;
        }
        if (lookAtOne()) continue;
        const MutexLock lock(mutex_);
        // Room for several: one batch is worth less than the wake-up.
        while (slots_.size() > kBatchesAheadMax / 2 && !isStopped_) changed_.wait(mutex_);
    }
}

/// The first whose entries nobody looks at yet.
IndexKeeper::ReadAhead::Slot* IndexKeeper::ReadAhead::take() {
    if (untaken_ == 0) return nullptr;
    --untaken_;
    const auto slot = std::ranges::find(slots_, false, &Slot::isTaken);
    slot->isTaken = true;
    return &*slot;
}

/// False when there is none.
bool IndexKeeper::ReadAhead::lookAtOne() {
    Slot* slot = nullptr;
    {
        const MutexLock lock(mutex_);
        slot = isStopped_ ? nullptr : take();
    }
    if (slot == nullptr) return false;
    if (slot->batch.folder) lookAtEntries(slot->batch);
    const MutexLock lock(mutex_);
    slot->isDone = true;
    // Somebody waits for the first only.
    if (slot == &slots_.front()) changed_.notifyOne();
    return true;
}

std::optional<IndexKeeper::Batch> IndexKeeper::ReadAhead::next() {
    while (true) {
        {
            const MutexLock lock(mutex_);
            if (slots_.empty() && isDone_) return std::nullopt;
            if (!slots_.empty() && slots_.front().isDone) {
                std::optional<Batch> batch(std::move(slots_.front().batch));
                slots_.pop_front();
                if (slots_.size() == kBatchesAheadMax / 2) changed_.notifyOne();
                return batch;
            }
        }
        if (lookAtOne()) continue;
        const MutexLock lock(mutex_);
        while (mustWait()) changed_.wait(mutex_);
    }
}

/// Whether the other thread has all there is to do.
bool IndexKeeper::ReadAhead::mustWait() const {
    if (untaken_ > 0) return false;
    return slots_.empty() ? !isDone_ : !slots_.front().isDone;
}

}  // namespace cindral
