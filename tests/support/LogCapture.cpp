#include "support/LogCapture.h"

#include <algorithm>

namespace cindral::test {

LogCapture::LogCapture() {
    log::setLevel(LogLevel::debug);
    log::setObserver([this](LogLevel level, std::string_view message, LogChannel channel) {
        const MutexLock lock(mutex_);
        lines_.emplace_back(level, message);
        if (channel == LogChannel::frameworkDefault) frameworkLines_.emplace_back(level, message);
    });
}

LogCapture::~LogCapture() {
    log::setObserver(nullptr);
    log::setLevel(levelBefore_);
}

std::vector<LogCapture::Line> LogCapture::lines() const {
    const MutexLock lock(mutex_);
    return lines_;
}

bool LogCapture::contains(LogLevel level, std::string_view message) const {
    const auto all = lines();
    return std::ranges::any_of(all, [&](const Line& line) { return line.first == level && line.second == message; });
}

bool LogCapture::containsOnFrameworkLog(LogLevel level, std::string_view message) const {
    const MutexLock lock(mutex_);
    return std::ranges::find(frameworkLines_, Line(level, message)) != frameworkLines_.end();
}

bool LogCapture::containsPart(LogLevel level, std::string_view part) const {
    const auto all = lines();
    return std::ranges::any_of(
        all, [&](const Line& line) { return line.first == level && line.second.find(part) != std::string::npos; });
}

std::size_t LogCapture::count(std::string_view part) const {
    const auto all = lines();
    return static_cast<std::size_t>(
        std::ranges::count_if(all, [&](const Line& line) { return line.second.find(part) != std::string::npos; }));
}

}  // namespace cindral::test
