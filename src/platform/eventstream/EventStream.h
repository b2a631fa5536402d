#pragma once

#include <cstdint>
#include <optional>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/KsUUID.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// The positions of the volume's event history.
///
/// Nothing records events: the position moves on only when somebody saw that something changed (noteChange).
///
/// Thread safety: all operations, from any thread.
class EventStream {
public:
    /// 0 when no store is connected.
    static std::uint64_t currentEventID();
    /// The UUID of the event history of the volume that holds the URL; none when the URL can't be read or the history
    /// is another volume's.
    static std::optional<KsUUID> volumeUUID(const KsURL& url);
    /// Moves the position on, and answers the new one.
    static Result<std::uint64_t> noteChange();
};

}  // namespace cindral
