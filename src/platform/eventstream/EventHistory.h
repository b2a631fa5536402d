#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/KsUUID.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/Sys.h"
#include "platform/revisions/VolumeStore.h"

namespace cindral {

/// What an event says beside its path: bits that streams hand out. Part of the interface: add bits, never change one.
enum class EventFlags : std::uint32_t {
    none = 0,
    mustScanSubdirectories = 0x01,  ///< anything below the path may have changed
    userDropped = 0x02,             ///< events are missing: look at everything
    kernelDropped = 0x04,           ///< the same
    idsWrapped = 0x08,
    historyDone = 0x10,  ///< no path: what was to be replayed has been
    removed = 0x200,     ///< the object left the path: deleted, or moved elsewhere
    cutOff = 0x400,      ///< with `removed`: the folder that it left is gone now, or is not where it was then
    renamed = 0x800,  ///< with `removed`: it went on as the same object, and another event tells where it is or ended
};
constexpr EventFlags operator|(EventFlags a, EventFlags b) {
    return static_cast<EventFlags>(static_cast<std::uint32_t>(a) | static_cast<std::uint32_t>(b));
}
/// Whether they have a bit in common.
constexpr bool operator&(EventFlags a, EventFlags b) {
    return (static_cast<std::uint32_t>(a) & static_cast<std::uint32_t>(b)) != 0;
}

/// One event of a stream, with its extended data.
struct Event {
    std::string path;  ///< as presented, below a root; or a document-ID change path; empty with historyDone
    EventFlags flags = EventFlags::none;
    std::uint64_t id = 0;
    FileID fileID{};
    DocumentID documentID{};  ///< that the object had when it was recorded, or has now; 0 for none
    /// What the object was when it left, or is; `other` with document-ID changes.
    ObjectKind kind = ObjectKind::other;
    /// What the recorder saw when it looked last, of a plain file that had no extended attributes and one name, in a
    /// folder that listings get to. Null: it has to be looked at.
    std::shared_ptr<const FileStatus> seen{};
    FileID folder{};  ///< with `seen`
};

/// The events of the volume, in order, and where they come to an end: now.
///
/// An object has one event at a time, the newest: it tells that the object is to be looked at, where it is now. An
/// object that left a place has one more for that place (EventFlags::removed). So a history is never longer than what
/// it is about, and a replay costs what has changed, not how often.
///
/// Thread safety: all operations, from any thread.
class EventHistory {
public:
    /// The one that streams read; null when nothing records. For tests, any other.
    static std::shared_ptr<EventHistory> shared();
    static void setShared(std::shared_ptr<EventHistory> history);

    virtual ~EventHistory() = default;

    virtual KsUUID volumeUUID() const = 0;
    /// The last event's ID. Never goes back.
    virtual std::uint64_t currentEventID() const = 0;
    /// Whether the first look at the roots since the start is over. Until then drain() waits, and what is found out
    /// about the time before the start is still on its way into the history.
    virtual bool isReady() const { return true; }
    /// Returns when everything that was complete before the call is in the history. Waits for a first reading of the
    /// roots to end; an error when it never will.
    virtual Result<void> drain() = 0;
    /// Whether every event after `eventID` is still there. False for an ID above the current one, or of before the
    /// history began.
    virtual bool canReplayAfter(std::uint64_t eventID) const = 0;

    struct Batch {
        std::vector<Event> events;
        std::uint64_t upTo = 0;  ///< events of the kind up to this ID are in, or came before
        bool isLast = false;     ///< there is none beyond, as of now
    };
    /// Events of paths after an ID, oldest first, at most `max`.
    virtual Result<Batch> pathEvents(std::uint64_t after, std::size_t max) const = 0;
    /// The same of document-ID changes, with paths "/.docid/DEVICE/changed/DOCUMENT/src=SOURCE,dst=DESTINATION".
    virtual Result<Batch> documentEvents(std::uint64_t after, std::size_t max) const = 0;

    /// Calls back, on any thread, whenever there are new events. An observer only passes on: it calls nothing of the
    /// history. Returns a number for removeObserver(), which waits for a call that is under way.
    virtual std::uint64_t addObserver(std::function<void()> observer) = 0;
    virtual void removeObserver(std::uint64_t observer) = 0;
};

}  // namespace cindral
