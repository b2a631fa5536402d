#pragma once

#include "platform/eventstream/EventSource.h"

namespace cindral {

/// Passes on the hints of one read, a run of equal ones as one.
///
/// For one read alone: all its events happened before the first of them was looked at. One of a later read may tell of
/// what that look missed.
///
/// Thread safety: one thread at a time.
class HintSender {
public:
    /// Borrows the receiver, and what hints borrow, for its life.
    explicit HintSender(const EventSource::Receiver& receive) : receive_(receive) {}

    /// A name in a watched folder. "#NUMBER" is what the kernel calls a file that was opened without a name: its writer
    /// goes by that name also after the file was given a true one, so that the hint is of the object, too.
    void entry(FileID folder, std::string_view name);
    void object(FileID fileID) { send({.kind = EventHint::Kind::object, .fileID = fileID}); }
    void lost(FileID fileID) { send({.kind = EventHint::Kind::lost, .fileID = fileID}); }
    void overflow() { send({.kind = EventHint::Kind::overflow}); }

private:
    void send(const EventHint& hint);

    const EventSource::Receiver& receive_;
    EventHint previous_{.fileID = FileID{0}};
    bool hasPrevious_ = false;
};

}  // namespace cindral
