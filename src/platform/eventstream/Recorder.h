#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/eventstream/EventHistory.h"
#include "platform/eventstream/EventSource.h"
#include "platform/eventstream/IndexKeeper.h"
#include "platform/eventstream/RootPaths.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/UniqueFd.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// Records what happens below the roots, as long as it runs; what happened before is found by comparing when it starts.
///
/// A history that nothing is missing from: whatever was complete before drain() is in it when drain() returns. What
/// can't be watched (beyond the watch limit, on a file system that tells of nothing) is compared at each drain().
///
/// Thread safety: all operations, from any thread.
class Recorder final : public EventHistory {
public:
    enum class Choice { automatic, inotify, fanotify };
    using SourceFactory = std::function<Result<std::unique_ptr<EventSource>>()>;

    struct Options {
        Choice choice = Choice::automatic;
        SourceFactory makeInotify = makeInotifySource;
        SourceFactory makeFanotify = makeFanotifySource;
        std::uint64_t eventsMax = 5'000'000;
        std::chrono::seconds ageMax{30 * 24 * 3600};
        /// Without news for so long, the tree is compared with the index, at leisure.
        std::chrono::milliseconds auditAfterIdle{60'000};
        std::chrono::milliseconds auditInterval{3'600'000};
        /// Off: nothing happens by itself after the start, only within drain() and audit(). For tests.
        bool recordsByItself = true;
        std::function<std::chrono::steady_clock::time_point()> now = std::chrono::steady_clock::now;
        std::function<KsDate()> wallClock = KsDate::now;
    };
    using Roots = std::vector<std::shared_ptr<const RootDirectory>>;

    /// Starts to read or compare the roots, and returns before that is done. The first root is the storage.
    static std::shared_ptr<Recorder> start(std::shared_ptr<VolumeStore> store, Roots roots, Options options);
    ~Recorder() override;
    Recorder(const Recorder&) = delete;
    Recorder& operator=(const Recorder&) = delete;

    /// A root that is new is read, and what it holds is journalled as having come; what was below one that is gone
    /// is forgotten, and journalled as having gone.
    Result<void> setRoots(Roots roots);
    /// No more is recorded; who waits gets ECANCELED. Returns when nothing is under way.
    void stop();
    /// Whether the first look at the roots is over. Until then drain() waits.
    bool isReady() const override;

    KsUUID volumeUUID() const override;
    std::uint64_t currentEventID() const override;
    Result<void> drain() override;
    bool canReplayAfter(std::uint64_t eventID) const override;
    Result<Batch> pathEvents(std::uint64_t after, std::size_t max) const override;
    Result<Batch> documentEvents(std::uint64_t after, std::size_t max) const override;
    std::uint64_t addObserver(std::function<void()> observer) override;
    void removeObserver(std::uint64_t observer) override;

    /// Compares the whole tree with the index now. Answers how many changes that took.
    Result<std::uint64_t> audit();

    /// What is checked by comparison instead of by events, and why.
    struct Uncovered {
        std::string path;
        std::string why;
    };
    static constexpr std::string_view kUnreadable = "it can't be read";
    struct Status {
        std::string recorder = "none";  ///< "inotify", "fanotify", or "none" where nothing tells of changes
        std::vector<Uncovered> uncovered;
        std::uint64_t auditedDifferences = 0;  ///< changes that only an audit found
        EventSource::Usage watches;            ///< of the first root's source
        std::uint64_t unwatchedFolders = 0;    ///< beyond the limit of watches
        bool isReading = false;                ///< the first look at the roots is not over
        std::optional<KsError> failure;        ///< why what happens is not recorded at present
    };
    Status status() const;

private:
    Recorder(std::shared_ptr<VolumeStore> store, Options options);

    struct Place;
    void run();
    Result<void> startUp();
    Result<void> giveUpStaleRoots() REQUIRES(mutex_);
    Result<void> recordRoots() REQUIRES(mutex_);
    Result<void> rememberRoots() REQUIRES(mutex_);
    void readFormerRoots() REQUIRES(mutex_);
    std::vector<IndexKeeper::Root> sourcesFor(const Roots& roots) REQUIRES(mutex_);
    std::shared_ptr<EventSource> sourceFor(const RootDirectory& root) REQUIRES(mutex_);
    std::shared_ptr<EventSource> workingSource(std::shared_ptr<EventSource>& source, const SourceFactory& make,
                                               const RootDirectory& root);
    Result<void> settle() EXCLUDES(mutex_);
    void noteState() REQUIRES(mutex_);
    void finished(const Result<void>& startUp);
    void noteOutcome(const Result<void>& outcome) EXCLUDES(stateMutex_);
    void tellObservers() EXCLUDES(observersMutex_);
    void trim();
    enum class Wake { news, timeout, stop };
    Wake waitForNews(std::chrono::milliseconds timeout);
    std::chrono::milliseconds idle();
    std::chrono::milliseconds untilAudit() const;
    void rest(std::chrono::milliseconds time);
    std::shared_ptr<const Roots> roots() const;
    /// A folder as the index has it.
    struct FolderPlace {
        std::string path;     ///< as presented; empty when it can't be told
        bool isOpen = false;  ///< listings get to what is in it
    };
    using FolderPlaces = std::map<FileID, FolderPlace>;
    const FolderPlace& placeOf(const Roots& roots, std::span<const FileID> rootIDs, FileID folder,
                               FolderPlaces& known) const;

    // Constant.
    const std::shared_ptr<VolumeStore> store_;
    const Options options_;
    UniqueFd wakeFd_;
    std::thread thread_;

    std::atomic<bool> stopping_{false};

    SeenFiles seenFiles_;

    /// Held while the index is worked on: over system calls and the store's writes.
    Mutex mutex_;
    IndexKeeper keeper_ GUARDED_BY(mutex_);
    std::shared_ptr<EventSource> inotify_ GUARDED_BY(mutex_);
    std::shared_ptr<EventSource> fanotify_ GUARDED_BY(mutex_);
    std::vector<FileID> auditStack_ GUARDED_BY(mutex_);
    bool saidWatchLimit_ GUARDED_BY(mutex_) = false;

    // The thread's.
    std::chrono::steady_clock::time_point lastNews_;
    std::chrono::steady_clock::time_point nextAudit_;
    bool isAuditing_ = false;
    std::uint64_t trimmedAt_ = 0;

    mutable Mutex stateMutex_;
    Condition stateChanged_;
    bool isReady_ GUARDED_BY(stateMutex_) = false;
    std::optional<KsError> startError_ GUARDED_BY(stateMutex_);
    std::shared_ptr<const Roots> roots_ GUARDED_BY(stateMutex_);
    /// Roots that are none any more, and where they were: what departed from them is told of under its path there.
    RootPaths formerRoots_ GUARDED_BY(stateMutex_);
    std::vector<int> pollDescriptors_ GUARDED_BY(stateMutex_);
    Status status_ GUARDED_BY(stateMutex_);
    std::optional<KsError> failure_ GUARDED_BY(stateMutex_);  ///< of the last try to record

    /// Held while observers are called, so that one that was removed is not called any more.
    Mutex observersMutex_;
    std::map<std::uint64_t, std::function<void()>> observers_ GUARDED_BY(observersMutex_);
    std::uint64_t nextObserver_ GUARDED_BY(observersMutex_) = 1;
    std::uint64_t toldEventID_ GUARDED_BY(observersMutex_) = 0;
};

}  // namespace cindral
