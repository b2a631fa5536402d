#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/eventstream/EventHistory.h"
#include "platform/foundation/KsURL.h"
#include "platform/foundation/KsUUID.h"
#include "platform/foundation/SerialQueue.h"

namespace cindral {

/// How a stream is made: bits, as its creator writes them.
enum class EventStreamCreationFlags : std::uint32_t {
    useStringObjects = 0x01,  ///< paths as strings; the only form there is
    fileEvents = 0x10,        ///< an event for each file, not for its directory; the only grain there is
    useExtendedData = 0x40,   ///< events carry their object's file ID; they always do
};

/// Reads the volume's events below some paths: those after an ID, then "history done", then those that come, a latency
/// after they do.
///
/// "History done" comes after everything that was complete before start() was called. A history that can't be replayed
/// is told by an event flagged userDropped, before "history done".
///
/// Thread safety: all operations, from any thread. The callback runs on the queue, never after stop() has returned to
/// a caller on the queue; for a caller elsewhere, one call may still be under way.
class EventStream {
public:
    using Callback = std::function<void(std::span<const Event>)>;

    /// Of the directories at the paths and everything below them; and of what is above them that left its place, or is
    /// to be scanned.
    static std::shared_ptr<EventStream> create(std::vector<std::string> paths, std::uint64_t since,
                                               std::chrono::milliseconds latency, std::uint32_t creationFlags,
                                               Callback callback);
    /// Of paths relative to a device: the only one that has events is "/.docid", the tree of document-ID changes.
    static std::shared_ptr<EventStream> createRelativeToDevice(std::uint32_t device, std::vector<std::string> paths,
                                                               std::uint64_t since, std::chrono::milliseconds latency,
                                                               std::uint32_t creationFlags, Callback callback);

    /// Before start(). The queue is kept until the stream is released.
    void setDispatchQueue(std::shared_ptr<SerialQueue> queue);
    void start();
    void stop();
    /// stop(), and lets go of the queue and the callback.
    void invalidate();
    ~EventStream();
    EventStream(const EventStream&) = delete;
    EventStream& operator=(const EventStream&) = delete;

    /// Position of the newest event that has been recorded; 0 when no store is connected.
    static std::uint64_t currentEventID();
    /// The UUID of the event history of the volume that holds the URL; none when the URL can't be read or the history
    /// is another volume's.
    static std::optional<KsUUID> volumeUUID(const KsURL& url);
    /// Moves the position on, and answers the new one. For listings while nothing records events.
    static Result<std::uint64_t> noteChange();

private:
    struct State;
    explicit EventStream(std::shared_ptr<State> state) : state_(std::move(state)) {}
    std::shared_ptr<State> state_;
};

}  // namespace cindral
