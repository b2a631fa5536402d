#include "platform/eventstream/EventStream.h"

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/foundation/Fatal.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/SharedTimer.h"
#include "platform/revisions/RvStorageManager.h"

namespace cindral {

namespace {

// Events that a callback is given at once: enough to share the cost of a transaction, few enough to stop between.
constexpr std::size_t kEventsAtOnceMax = 100;
constexpr std::string_view kDocumentTree = "/.docid";

bool holds(std::string_view folder, std::string_view path) {
    return path.starts_with(folder) && (path.size() == folder.size() || path[folder.size()] == '/' || folder == "/");
}

}  // namespace

/// Lives for as long as the stream, the observer's call or a task of the queue needs it.
struct EventStream::State : std::enable_shared_from_this<EventStream::State> {
    // Constant once started.
    std::vector<std::string> paths;
    std::chrono::milliseconds latency{};
    bool isOfDocuments = false;
    std::shared_ptr<EventHistory> history;

    Mutex mutex;
    std::shared_ptr<SerialQueue> queue GUARDED_BY(mutex);
    std::shared_ptr<const Callback> callback GUARDED_BY(mutex);
    std::optional<std::uint64_t> observer GUARDED_BY(mutex);
    bool isStarted GUARDED_BY(mutex) = false;
    bool isStopped GUARDED_BY(mutex) = false;
    bool isLive GUARDED_BY(mutex) = false;       // "History done" was said.
    bool isScheduled GUARDED_BY(mutex) = false;  // A delivery is on its way.

    // The queue's.
    std::uint64_t position = 0;

    void replay();
    void deliverNews();
    void deliverUpTo(std::uint64_t bound);
    void deliver(std::span<const Event> events);
    void sayDropped();
    void sayHistoryDone();
    void schedule() REQUIRES(mutex);
    void newsCame();
    bool isOver() {
        const MutexLock lock(mutex);
        return isStopped;
    }
    bool isWatched(const Event& event) const {
        if (isOfDocuments) return true;
        // What left, or is in doubt, above a path may be what the path leads through.
        const bool isOfAncestorsToo = event.flags & (EventFlags::removed | EventFlags::mustScanSubdirectories);
        return std::ranges::any_of(paths, [&](const std::string& path) {
            return holds(path, event.path) || (isOfAncestorsToo && holds(event.path, path));
        });
    }
};

void EventStream::State::deliver(std::span<const Event> events) {
    std::shared_ptr<const Callback> current;
    {
        const MutexLock lock(mutex);
        if (!isStopped) current = callback;
    }
    if (current) (*current)(events);
}

void EventStream::State::sayDropped() {
    Event event;
    event.flags = EventFlags::userDropped;
    event.id = history ? history->currentEventID() : 0;
    if (!paths.empty()) event.path = paths.front();
    position = event.id;
    deliver({&event, 1});
}

void EventStream::State::sayHistoryDone() {
    Event event;
    event.flags = EventFlags::historyDone;
    event.id = position;
    deliver({&event, 1});
    const MutexLock lock(mutex);
    isLive = true;
    if (history && history->currentEventID() > position) schedule();
}

/// Delivers what there is after the position, until the bound is reached or there is no more.
void EventStream::State::deliverUpTo(std::uint64_t bound) {
    while (!isOver()) {
        Result<EventHistory::Batch> batch = isOfDocuments ? history->documentEvents(position, kEventsAtOnceMax)
                                                          : history->pathEvents(position, kEventsAtOnceMax);
        if (!batch.ok()) {
            logError("can't read the event history; {}", batch.error().description());
            return sayDropped();
        }
        // The journal may have been trimmed past the position since it was last asked.
        if (!history->canReplayAfter(position)) return sayDropped();
        position = std::max(position, batch->upTo);
        std::erase_if(batch->events, [this](const Event& event) { return !isWatched(event); });
        if (!batch->events.empty()) deliver(batch->events);
        if (batch->isLast || position >= bound) return;
    }
}

void EventStream::State::replay() {
    Result<void> drained = KsError::posix(ENODEV);
    if (history) drained = history->drain();
    if (isOver()) return;
    if (!drained.ok() || !history->canReplayAfter(position)) {
        if (history && !drained.ok()) {
            logError("can't bring the event history up to date; {}", drained.error().description());
        }
        sayDropped();
    } else {
        deliverUpTo(history->currentEventID());
    }
    if (!isOver()) sayHistoryDone();
}

void EventStream::State::deliverNews() {
    {
        const MutexLock lock(mutex);
        isScheduled = false;
    }
    if (!history->canReplayAfter(position)) return sayDropped();
    deliverUpTo(UINT64_MAX);
}

void EventStream::State::schedule() {
    if (isScheduled || isStopped) return;
    isScheduled = true;
    SharedTimer::shared().callAt(std::chrono::steady_clock::now() + latency, [weak = weak_from_this()] {
        const auto state = weak.lock();
        if (!state) return;
        const MutexLock lock(state->mutex);
        if (!state->isStopped && state->queue) state->queue->async([state] { state->deliverNews(); });
    });
}

void EventStream::State::newsCame() {
    const MutexLock lock(mutex);
    if (isLive) schedule();
}

std::shared_ptr<EventStream> EventStream::create(std::vector<std::string> paths, std::uint64_t since,
                                                 std::chrono::milliseconds latency, std::uint32_t /*creationFlags*/,
                                                 Callback callback) {
    auto state = std::make_shared<State>();
    state->paths = std::move(paths);
    state->position = since;
    state->latency = latency;
    state->history = EventHistory::shared();
    {
        const MutexLock lock(state->mutex);
        state->callback = std::make_shared<const Callback>(std::move(callback));
    }
    return std::shared_ptr<EventStream>(new EventStream(std::move(state)));
}

std::shared_ptr<EventStream> EventStream::createRelativeToDevice(std::uint32_t /*device*/,
                                                                 std::vector<std::string> paths, std::uint64_t since,
                                                                 std::chrono::milliseconds latency,
                                                                 std::uint32_t creationFlags, Callback callback) {
    const bool isOfDocuments = std::ranges::find(paths, kDocumentTree) != paths.end();
    auto stream = create(std::move(paths), since, latency, creationFlags, std::move(callback));
    stream->state_->isOfDocuments = isOfDocuments;
    return stream;
}

void EventStream::setDispatchQueue(std::shared_ptr<SerialQueue> queue) {
    const MutexLock lock(state_->mutex);
    state_->queue = std::move(queue);
}

void EventStream::start() {
    std::shared_ptr<SerialQueue> queue;
    {
        const MutexLock lock(state_->mutex);
        if (state_->isStarted || state_->isStopped) return;
        if (!state_->queue) fatal("an event stream is started without a queue");
        state_->isStarted = true;
        queue = state_->queue;
    }
    if (state_->history) {
        const std::uint64_t observer = state_->history->addObserver([weak = std::weak_ptr(state_)] {
            if (const auto state = weak.lock()) state->newsCame();
        });
        bool isStopped = false;
        {
            const MutexLock lock(state_->mutex);
            isStopped = state_->isStopped;
            if (!isStopped) state_->observer = observer;
        }
        if (isStopped) state_->history->removeObserver(observer);
    }
    queue->async([state = state_] { state->replay(); });
}

void EventStream::stop() {
    std::optional<std::uint64_t> observer;
    {
        const MutexLock lock(state_->mutex);
        state_->isStopped = true;
        observer = std::exchange(state_->observer, std::nullopt);
    }
    if (observer) state_->history->removeObserver(*observer);
}

void EventStream::invalidate() {
    stop();
    // Let go of without the lock: either may be the last to hold something that uses the stream.
    std::shared_ptr<SerialQueue> queue;
    std::shared_ptr<const Callback> callback;
    const MutexLock lock(state_->mutex);
    queue.swap(state_->queue);
    callback.swap(state_->callback);
}

EventStream::~EventStream() {
    invalidate();
}

std::uint64_t EventStream::currentEventID() {
    if (const auto history = EventHistory::shared()) return history->currentEventID();
    const auto store = RvStorageManager::defaultManager().store();
    return store ? store->currentEventID() : 0;
}

std::optional<KsUUID> EventStream::volumeUUID(const KsURL& url) {
    const auto store = RvStorageManager::defaultManager().store();
    const Result<FileStatus> status = url.status();
    if (!store || !status.ok() || !RootDirectories::shared().isPublishedDevice(status->device)) return std::nullopt;
    return store->uuid();
}

Result<std::uint64_t> EventStream::noteChange() {
    const auto store = RvStorageManager::defaultManager().store();
    if (!store) return KsError::posix(EAGAIN);
    return store->advanceEventID();
}

}  // namespace cindral
