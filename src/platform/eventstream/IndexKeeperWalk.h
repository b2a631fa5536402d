#pragma once

#include <deque>
#include <optional>
#include <thread>
#include <vector>

#include "platform/eventstream/IndexKeeper.h"
#include "platform/eventstream/IndexKeeperTypes.h"

namespace cindral {

/// Reads a folder and all below it, batch by batch: each folder after the one that it is in. It is watched first, then
/// read: what comes in between is told of twice, never not at all.
///
/// Thread safety: one thread at a time. The keeper's roots must stay meanwhile; nothing else of it is used but what
/// watches.
class IndexKeeper::TreeWalk {
public:
    /// Both are borrowed.
    TreeWalk(const IndexKeeper& keeper, const Root& root, Subfolder top);

    /// None when all has been read.
    std::optional<Batch> next();

private:
    const IndexKeeper& keeper_;
    const Root& root_;
    std::vector<Subfolder> stack_;
    std::shared_ptr<OpenFolder> folder_;  // Of which there is more; null between two folders.
};

/// Walks in a thread of its own, some batches ahead: the kernel works on the next folders while the last are compared.
///
/// Thread safety: next() and the destructor are for one thread.
class IndexKeeper::ReadAhead {
public:
    /// `walk` is borrowed, and is the thread's until this is destroyed.
    explicit ReadAhead(TreeWalk& walk);
    ~ReadAhead();
    ReadAhead(const ReadAhead&) = delete;
    ReadAhead& operator=(const ReadAhead&) = delete;

    /// Waits for it; none when all has been read.
    std::optional<Batch> next() EXCLUDES(mutex_);

private:
    void run() EXCLUDES(mutex_);

    TreeWalk& walk_;
    Mutex mutex_;
    Condition changed_;
    std::deque<Batch> ready_ GUARDED_BY(mutex_);
    bool isDone_ GUARDED_BY(mutex_) = false;
    bool isStopped_ GUARDED_BY(mutex_) = false;
    std::thread thread_;
};

}  // namespace cindral
