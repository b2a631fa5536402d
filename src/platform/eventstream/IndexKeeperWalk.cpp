#include "platform/eventstream/IndexKeeperWalk.h"

#include <pthread.h>

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
    readEntries(batch);
    addSubfolders(batch, stack_);
    if (batch.isLast) folder_ = nullptr;
    return batch;
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
    while (true) {
        std::optional<Batch> batch = walk_.next();
        const MutexLock lock(mutex_);
        while (ready_.size() >= kBatchesAheadMax && !isStopped_) changed_.wait(mutex_);
        if (isStopped_) return;
        isDone_ = !batch;
        if (batch) ready_.push_back(*std::move(batch));
        // Several at once: a batch of a small folder is worth less than the wake-up.
        if (ready_.size() == kBatchesAheadMax / 2 || isDone_) changed_.notifyOne();
        if (isDone_) return;
    }
}

std::optional<IndexKeeper::Batch> IndexKeeper::ReadAhead::next() {
    const MutexLock lock(mutex_);
    if (ready_.empty()) {
        while (ready_.size() < kBatchesAheadMax / 2 && !isDone_) changed_.wait(mutex_);
    }
    if (ready_.empty()) return std::nullopt;
    std::optional<Batch> batch(std::move(ready_.front()));
    ready_.pop_front();
    if (ready_.size() == kBatchesAheadMax / 2) changed_.notifyOne();
    return batch;
}

}  // namespace cindral
