#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <variant>
#include <vector>

#include "platform/eventstream/EventStream.h"
#include "platform/foundation/KsURL.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/tessel/TesselItem.h"
#include "provider/fs/FSEntryFinder.h"

namespace cindral {

/// Whether a listing may go on from a later page: something was deleted since its first page, nothing was, or it can't
/// be told.
struct DeletionOccurred {
    std::string path;
};
struct CanResume {};
struct CantReplayHistoricalFSEvents {};
using FSEventReaderGatherPhaseResumeStatus = std::variant<DeletionOccurred, CanResume, CantReplayHistoricalFSEvents>;

enum class FSEventReaderMode {
    pathBased,   ///< what happens under the monitored directories' paths
    docIDBased,  ///< which document went from which file to which, on the volume's tree of document-ID changes
};

class FSEventReader;

/// Receives what a reader makes of events. All calls come on the reader's queue, in the order of the events.
class FSEventReaderDelegate {
public:
    enum class LookFurther { no, yes };

    virtual ~FSEventReaderDelegate() = default;

    /// An event below the reader's URLs, before the file system is looked at. `path` is of its object, and empty for a
    /// document that no longer exists. "No" where that alone says all that there is to know: nothing more is reported of
    /// the event. Comes some events ahead of what is reported of earlier ones.
    virtual LookFurther readerDidReceiveEvent(FSEventReader& reader, const Event& event, std::string_view path) = 0;
    /// The object is where the event says. Without an item nothing more is reported of the event, except of a document's
    /// that it was dropped.
    virtual bool readerShouldMakeItem(FSEventReader& reader, const Event& event, const KsURL& entry);

    // `identifier` is the event's own: of its file ID, or of its document.

    virtual void readerDidUpdateItem(FSEventReader& reader, const Event& event, const TesselItemIdentifier& identifier,
                                     const std::shared_ptr<const TesselItem>& item);
    /// There is no object at the path any more.
    virtual void readerDidDeleteItem(FSEventReader& reader, const Event& event, const TesselItemIdentifier& identifier);
    /// An event was dropped although there is an object: another than the event's, one that has left and is here again,
    /// one of which no item can be made, or one that no listing of the URLs comes upon.
    virtual void readerDidDropEvent(FSEventReader& reader, const Event& event, const TesselItemIdentifier& identifier);

    /// Anything at the path and below it may have changed, without events of its own. The path may be above the URLs.
    virtual void readerMustScan(FSEventReader& reader, const Event& event) = 0;
    /// A monitored directory, or one that holds it, may be at another path now.
    virtual void readerDidMoveDirectory(FSEventReader& reader, const Event& event);
    /// Events are missing, or their IDs began anew.
    virtual void readerDidLoseEvents(FSEventReader& reader, const Event& event) = 0;
    /// The events can't be read on, because the file system or the store failed. The reader was stopped.
    virtual void readerDidFail(FSEventReader& reader, const KsError& error);
    /// The replay has reached the present: everything up to the ID was reported.
    virtual void readerDidFinishHistory(FSEventReader& reader, std::uint64_t eventID) = 0;
};

/// Reads the event stream for some directories from an event ID on, and makes of each event an item or a deletion.
///
/// An item is exactly what a listing of the directories would deliver. The items of events that come together are
/// identified together. Events that can't be mapped are dropped with a line of the log, and stop nothing.
///
/// Thread safety: all operations, from any thread. The delegate is called on the reader's queue.
class FSEventReader : public std::enable_shared_from_this<FSEventReader> {
public:
    static constexpr std::chrono::milliseconds kLatency{500};

    static std::shared_ptr<FSEventReader> create(std::vector<KsURL> urls, FSEventReaderMode mode, bool verbose,
                                                 std::uint64_t sinceEventID);
    ~FSEventReader();
    FSEventReader(const FSEventReader&) = delete;
    FSEventReader& operator=(const FSEventReader&) = delete;

    /// Before start(). Borrowed: a delegate that is gone gets nothing.
    void setDelegate(std::weak_ptr<FSEventReaderDelegate> delegate);
    /// Creates the stream and starts it; does nothing where there is one. A reader that was stopped goes on after the
    /// last event handled.
    void start();
    /// Nothing is reported after this has returned on the reader's queue; elsewhere, one call may still be under way.
    void stop();
    bool isStarted() const;

    const std::vector<KsURL>& urls() const { return urls_; }
    FSEventReaderMode mode() const { return mode_; }
    /// The ID of the last event handled, dropped ones among them. While one is reported: of the one before it.
    std::uint64_t lastProcessedFSEventID() const;
    /// Finds entries as the reader does. On the reader's queue.
    FSEntryFinder& entryFinder() NO_THREAD_SAFETY_ANALYSIS;

    /// Stops the process unless the caller is on the reader's queue.
    void assertOnQueue() const { streamQueue_->assertCurrent(); }
    /// Runs the task on the reader's queue, after what is reported now.
    void async(SerialQueue::Task task) { streamQueue_->async(std::move(task)); }

    /// For log lines.
    std::string description() const;

    /// Whether a listing of the directories may go on: whether nothing was deleted from them since the event. Waits for
    /// the replay of the history, and is not to be called on a reader's queue. `previousEventID` is the one that the
    /// listing's first page was given.
    ///
    /// A listing that began while nothing could be replayed is judged by what it has seen (FSGatherWitness) first, and
    /// waits for nothing while that holds.
    static FSEventReaderGatherPhaseResumeStatus canResumeGatherPhase(const std::vector<KsURL>& on,
                                                                     std::uint64_t previousEventID);

private:
    struct Look;
    class Delivery;

    FSEventReader(std::vector<KsURL> urls, FSEventReaderMode mode, bool verbose, std::uint64_t sinceEventID);
    std::shared_ptr<EventStream> makeStream();
    void handle(std::span<const Event> events);
    bool handleTogether(FSEventReaderDelegate& delegate, std::span<const Event> events);
    bool fail(FSEventReaderDelegate& delegate, const KsError& error);
    Result<Look> lookAt(FSEventReaderDelegate& delegate, const Event& event);
    Result<Look> lookAtPath(FSEventReaderDelegate& delegate, const Event& event, std::string_view path, FileID fileID,
                            TesselItemIdentifier identifier);
    Result<Look> lookAtDocument(FSEventReaderDelegate& delegate, const Event& event);
    bool mayMoveDirectory(const Event& event) const;
    void report(FSEventReaderDelegate& delegate, const Look& look);
    static void reportFlags(FSEventReaderDelegate& delegate, FSEventReader& reader, const Event& event);

    // Constant after construction.
    const std::vector<KsURL> urls_;
    const FSEventReaderMode mode_;
    const bool verbose_;
    /// Shared, because the stream's work may be on it when the reader goes.
    const std::shared_ptr<SerialQueue> streamQueue_;

    mutable Mutex mutex_;
    std::shared_ptr<EventStream> stream_ GUARDED_BY(mutex_);
    std::uint64_t lastProcessedFSEventID_ GUARDED_BY(mutex_);
    std::weak_ptr<FSEventReaderDelegate> delegate_ GUARDED_BY(mutex_);

    FSEntryFinder entryFinder_ GUARDED_BY(*streamQueue_);
};

/// The path of an object by the store's records, checked by nobody; none when it has none below a root. Cheap, also for
/// a number that nothing has.
std::optional<std::string> recordedPathOf(FileID fileID);

}  // namespace cindral
