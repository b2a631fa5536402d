#pragma once

#include <string>
#include <utility>
#include <vector>

#include "platform/foundation/Log.h"
#include "platform/foundation/Mutex.h"

namespace cindral::test {

/// Collects the log's lines, of every level, while it lives.
class LogCapture {
public:
    LogCapture();
    ~LogCapture();
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    using Line = std::pair<LogLevel, std::string>;
    std::vector<Line> lines() const;
    bool contains(LogLevel level, std::string_view message) const;       ///< exactly that message
    bool containsPart(LogLevel level, std::string_view part) const;
    std::size_t count(std::string_view part) const;

private:
    mutable Mutex mutex_;
    std::vector<Line> lines_ GUARDED_BY(mutex_);
};

}  // namespace cindral::test
