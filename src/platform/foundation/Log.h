#pragma once

#include <fmt/format.h>

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>

namespace cindral {

/// Severity of a log line, lowest first.
enum class LogLevel { debug, info, error };

/// The one log channel of the process.
///
/// Subsystem "com.vemra.TesselKit", category "cindral-store". Lines go to standard error as "TIME LEVEL MESSAGE", one
/// line each, control characters of the message escaped as \xNN. CINDRAL_LOG (debug, info, error) chooses the lowest
/// level that is written; default info. A line that is dropped costs one comparison.
///
/// Thread safety: all of it, from any thread.
namespace log {

bool enabled(LogLevel level);
void setLevel(LogLevel level);

/// Writes one line, without a prefix of its own.
void write(LogLevel level, std::string_view message);

/// Sees every line that is written or would be; null takes it away. For tests and for the host's status.
/// Called on the thread that logs; must not log.
using Observer = std::function<void(LogLevel, std::string_view message)>;
void setObserver(Observer observer);

}  // namespace log

/// "[DEBUG] MESSAGE", "[INFO] MESSAGE", "[ERROR] MESSAGE". The message is composed only when the line is written.
template <typename... Args>
void logDebug(fmt::format_string<Args...> format, Args&&... args) {
    if (log::enabled(LogLevel::debug)) log::write(LogLevel::debug, "[DEBUG] " + fmt::format(format, std::forward<Args>(args)...));
}
template <typename... Args>
void logInfo(fmt::format_string<Args...> format, Args&&... args) {
    if (log::enabled(LogLevel::info)) log::write(LogLevel::info, "[INFO] " + fmt::format(format, std::forward<Args>(args)...));
}
template <typename... Args>
void logError(fmt::format_string<Args...> format, Args&&... args) {
    if (log::enabled(LogLevel::error)) log::write(LogLevel::error, "[ERROR] " + fmt::format(format, std::forward<Args>(args)...));
}
/// A line without a level prefix.
template <typename... Args>
void logPlain(LogLevel level, fmt::format_string<Args...> format, Args&&... args) {
    if (log::enabled(level)) log::write(level, fmt::format(format, std::forward<Args>(args)...));
}
/// The host framework's own log, which is another channel than the system's: same back end, category "default".
template <typename... Args>
void logFrameworkDefault(LogLevel level, fmt::format_string<Args...> format, Args&&... args) {
    if (log::enabled(level)) log::write(level, fmt::format(format, std::forward<Args>(args)...));
}

/// The next section number; strictly increasing over the process.
std::uint64_t newLogSection();
/// "[DEBUG] ┏NUMBER TITLE"
void openLogSection(std::uint64_t number, std::string_view title);
/// "[DEBUG] ┗NUMBER"
void closeLogSection(std::uint64_t number);

/// Brackets a scope with an opening and a closing line of one new section number.
class LogSection {
public:
    template <typename... Args>
    explicit LogSection(fmt::format_string<Args...> format, Args&&... args) : number_(newLogSection()) {
        if (log::enabled(LogLevel::debug)) openLogSection(number_, fmt::format(format, std::forward<Args>(args)...));
    }
    ~LogSection() { closeLogSection(number_); }
    LogSection(const LogSection&) = delete;
    LogSection& operator=(const LogSection&) = delete;

private:
    std::uint64_t number_;
};

/// An errno value as text for a log line: "ENOENT (2)". The platform's %{errno}d.
std::string errnoText(int errorNumber);

}  // namespace cindral
