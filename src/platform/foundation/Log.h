#pragma once

#include <fmt/format.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <utility>

namespace cindral {

/// Severity of a log line, lowest first.
enum class LogLevel { debug, info, error };

/// Where a line belongs. Both are written alike; the observer tells them apart.
enum class LogChannel {
    store,             ///< the system's own: subsystem "com.vemra.TesselKit", category "cindral-store"
    frameworkDefault,  ///< the host framework's own log: category "default"
};

/// The log of the process.
///
/// Lines go to standard error as "TIME LEVEL MESSAGE", one line each with one write: TIME is RFC 3339 in UTC, LEVEL is
/// debug, info or error; control characters of the message, line separators and bytes that are no UTF-8 are escaped as
/// \xNN. Where standard error is the service manager's journal (JOURNAL_STREAM names it), "<N>", the syslog priority,
/// stands in place of the time, which the journal keeps itself. CINDRAL_LOG (debug, info, error) chooses the lowest
/// level that is written; anything else is info. A line that is dropped costs one comparison. A line that standard
/// error does not take is lost.
///
/// Thread safety: all of it, from any thread.
namespace log {

namespace detail {
extern std::atomic<LogLevel> lowestLevel;
}

inline bool enabled(LogLevel level) {
    return level >= detail::lowestLevel.load(std::memory_order_relaxed);
}
LogLevel level();
void setLevel(LogLevel level);

/// Reads CINDRAL_LOG and JOURNAL_STREAM. Done once before main().
void configureFromEnvironment();

/// Writes one line, without a prefix of its own, where the level is enabled.
void write(LogLevel level, std::string_view message, LogChannel channel = LogChannel::store);

/// Sees every line that is written, or would be if standard error took it; null takes it away. For tests and for the
/// host's status. Called on the thread that logs, by one at a time; must not log. A call never outlasts the
/// setObserver() that replaces it.
using Observer = std::function<void(LogLevel, std::string_view message, LogChannel)>;
void setObserver(Observer observer);

}  // namespace log

/// "[DEBUG] MESSAGE", "[INFO] MESSAGE", "[ERROR] MESSAGE". The message is composed only when the line is written.
template <typename... Args>
void logDebug(fmt::format_string<Args...> format, Args&&... args) {
    if (log::enabled(LogLevel::debug))
        log::write(LogLevel::debug, "[DEBUG] " + fmt::format(format, std::forward<Args>(args)...));
}
template <typename... Args>
void logInfo(fmt::format_string<Args...> format, Args&&... args) {
    if (log::enabled(LogLevel::info))
        log::write(LogLevel::info, "[INFO] " + fmt::format(format, std::forward<Args>(args)...));
}
template <typename... Args>
void logError(fmt::format_string<Args...> format, Args&&... args) {
    if (log::enabled(LogLevel::error))
        log::write(LogLevel::error, "[ERROR] " + fmt::format(format, std::forward<Args>(args)...));
}
/// A line without a level prefix.
template <typename... Args>
void logPlain(LogLevel level, fmt::format_string<Args...> format, Args&&... args) {
    if (log::enabled(level)) log::write(level, fmt::format(format, std::forward<Args>(args)...));
}
/// A line on the host framework's own log, which is another channel than the system's.
template <typename... Args>
void logFrameworkDefault(LogLevel level, fmt::format_string<Args...> format, Args&&... args) {
    if (log::enabled(level))
        log::write(level, fmt::format(format, std::forward<Args>(args)...), LogChannel::frameworkDefault);
}

/// The next section number, from 1; strictly increasing over the process. Not to be called on the queue
/// "cindral.log-section".
std::uint64_t newLogSection();
/// "[DEBUG] ┏NUMBER TITLE"
void openLogSection(std::uint64_t number, std::string_view title);
/// "[DEBUG] ┗NUMBER"
void closeLogSection(std::uint64_t number);

/// Brackets a scope with an opening and a closing line of one new section number. Draws none where debug lines are
/// dropped.
class LogSection {
public:
    template <typename... Args>
    explicit LogSection(fmt::format_string<Args...> format, Args&&... args) {
        if (!log::enabled(LogLevel::debug)) return;
        number_ = newLogSection();
        openLogSection(number_, fmt::format(format, std::forward<Args>(args)...));
    }
    ~LogSection() {
        if (number_ != 0) closeLogSection(number_);
    }
    LogSection(const LogSection&) = delete;
    LogSection& operator=(const LogSection&) = delete;

private:
    std::uint64_t number_ = 0;  ///< 0: none was drawn
};

/// An errno value as text for a log line: "ENOENT (2)". The platform's %{errno}d.
std::string errnoText(int errorNumber);

}  // namespace cindral
