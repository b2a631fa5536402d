#pragma once

#include <optional>
#include <string_view>

#include "platform/foundation/KsError.h"

namespace cindral {

/// Where the lines go that one client is to read.
///
/// Thread safety: all operations, from any thread; lines never run into each other.
class LineSink {
public:
    virtual ~LineSink() = default;

    /// `line` ends with its newline. What can't be written is dropped, and so is all that follows.
    virtual void write(std::string_view line) = 0;
    /// Returns when more may be asked for in the client's name: what it has asked for so far is not piling up.
    virtual void waitForRoom() {}
    /// What went wrong; none while nothing did, and where only the reader has gone away.
    virtual std::optional<KsError> error() const = 0;
};

}  // namespace cindral
