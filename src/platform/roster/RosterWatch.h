#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <string_view>

#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"
#include "platform/roster/RosterScanner.h"

struct inotify_event;

namespace cindral {

/// Says when a look at the sources is worth it, and which files are not to be read yet.
///
/// A file that was made or written to is being written until it is closed, or nothing more has been written to it for
/// kQuiet.
///
/// Thread safety: for one thread at a time.
class RosterWatch {
public:
    using TimePoint = std::chrono::steady_clock::time_point;
    static constexpr std::chrono::milliseconds kQuiet{500};

    static Result<RosterWatch> make();

    /// Watches what the look depends on, and no more. Whether something is watched now that was not when the look was
    /// taken: then it may have missed something.
    bool watch(const RosterInterests& interests);
    /// Whether all of it could be watched that exists.
    bool isComplete() const { return isComplete_; }
    /// Takes what happened up to now. Whether a look is worth it.
    bool drain(TimePoint now);
    const std::set<std::string>& filesBeingWritten() const { return filesBeingWritten_; }
    /// When drain() is to be called although nothing happens.
    std::optional<TimePoint> nextMoment() const;
    int descriptor() const { return fd_.get(); }

private:
    struct Folder {
        std::string path;
        RosterInterest interest;
    };

    explicit RosterWatch(UniqueFd fd) : fd_(std::move(fd)) {}
    bool take(const inotify_event& event, TimePoint now);
    bool takeContents(const inotify_event& event, const std::string& path, TimePoint now);
    void noteWriting(const std::string& path, TimePoint now);
    void noteWritten(const std::string& path);

    UniqueFd fd_;
    std::map<int, Folder> folders_;
    bool isComplete_ = true;
    bool hasSaidLimit_ = false;
    std::set<std::string> filesBeingWritten_;
    std::map<std::string, TimePoint> lastWrites_;  ///< of filesBeingWritten_
};

}  // namespace cindral
