#pragma once

#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/Log.h"
#include "platform/foundation/Mutex.h"

namespace cindral::test {

/// Collects the log's lines, of every level and channel, while it lives. Puts the level back afterwards.
class LogCapture {
public:
    LogCapture();
    ~LogCapture();
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    using Line = std::pair<LogLevel, std::string>;
    std::vector<Line> lines() const;
    bool contains(LogLevel level, std::string_view message) const;  ///< exactly that message
    /// Exactly that message, on the host framework's own log.
    bool containsOnFrameworkLog(LogLevel level, std::string_view message) const;
    bool containsPart(LogLevel level, std::string_view part) const;
    std::size_t count(std::string_view part) const;

private:
    const LogLevel levelBefore_ = log::level();
    mutable Mutex mutex_;
    std::vector<Line> lines_ GUARDED_BY(mutex_);
    std::vector<Line> frameworkLines_ GUARDED_BY(mutex_);  ///< those of lines_ that are on the framework's log
};

}  // namespace cindral::test
