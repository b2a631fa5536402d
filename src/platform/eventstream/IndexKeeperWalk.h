#pragma once

#include <deque>
#include <optional>
#include <thread>
#include <vector>

#include "platform/eventstream/IndexKeeper.h"
#include "platform/eventstream/IndexKeeperTypes.h"

namespace cindral {

/// Reads a folder and all below it, batch by batch: each folder after the one that it is in, all batches of a folder one
/// after the other. It is watched first, then read: what comes in between is told of twice, never not at all.
///
/// Thread safety: one thread at a time. The keeper's roots must stay meanwhile; nothing else of it is used but what
/// watches.
class IndexKeeper::TreeWalk {
public:
    /// Both are borrowed.
    TreeWalk(const IndexKeeper& keeper, const Root& root, Subfolder top);

    /// None when all has been read. Of the entries, only folders have been looked at.
    std::optional<Batch> next();

private:
    void enter(Batch& batch);

    const IndexKeeper& keeper_;
    const Root& root_;
    std::vector<Subfolder> stack_;
    std::shared_ptr<OpenFolder> folder_;  // Of which there is more; null between two folders.
};

/// Walks some batches ahead in a thread of its own, and looks at their entries in both: to look at everything is most of
/// what a comparison costs, and the kernel does it on as many processors as ask.
///
/// Thread safety: next() and the destructor are for one thread.
class IndexKeeper::ReadAhead {
public:
    /// `walk` is borrowed, and is the thread's until this is destroyed.
    explicit ReadAhead(TreeWalk& walk);
    ~ReadAhead();
    ReadAhead(const ReadAhead&) = delete;
    ReadAhead& operator=(const ReadAhead&) = delete;

    /// The walk's next, whose entries have been looked at; none when all has been read.
    std::optional<Batch> next() EXCLUDES(mutex_);

private:
    struct Slot {
        Batch batch;
        bool isTaken = false;  ///< by a thread that looks at its entries
        bool isDone = false;
    };

    void run() EXCLUDES(mutex_);
    bool waitForRoom() EXCLUDES(mutex_);
    bool lookAtOne() EXCLUDES(mutex_);
    Slot* take() REQUIRES(mutex_);
    bool mustWait() const REQUIRES(mutex_);

    TreeWalk& walk_;
    Mutex mutex_;
    Condition changed_;
    std::deque<Slot> slots_ GUARDED_BY(mutex_);   ///< in the walk's order; their addresses stay
    std::size_t untaken_ GUARDED_BY(mutex_) = 0;  ///< of them
    bool isDone_ GUARDED_BY(mutex_) = false;
    bool isStopped_ GUARDED_BY(mutex_) = false;
    std::thread thread_;
};

}  // namespace cindral
