#include "host/ErrorLog.h"

#include <algorithm>
#include <array>

#include "platform/foundation/Log.h"

namespace cindral {
namespace {

/// How the provider says that an identifier, a URL or an anchor that somebody came with names nothing any more.
bool saysThatNothingIsThere(std::string_view line) {
    constexpr std::array kBeginnings = {
        std::string_view("invalid identifier;"),
        std::string_view("invalid host for identifier"),
        std::string_view("can't resolve doc ID"),
        std::string_view("item lookup failed for identifier"),
        std::string_view("can't find URL matching identifier"),
        std::string_view("identifier lookup failed for URL"),
        std::string_view("can't find URL for item"),
        std::string_view("can't find fileID for item"),
        std::string_view("can't create bundle proxy with"),
        std::string_view("can't create change token from anchor data"),
        std::string_view("can't decode token from provided data"),
    };
    return std::ranges::any_of(kBeginnings, [&](std::string_view beginning) { return line.starts_with(beginning); });
}

}  // namespace

ErrorLog::ErrorLog() {
    log::setObserver([this](LogLevel level, std::string_view line, LogChannel) {
        if (level == LogLevel::error) add(KsDate::now(), line);
    });
}

ErrorLog::~ErrorLog() {
    log::setObserver(nullptr);
}

void ErrorLog::add(const KsDate& when, std::string_view line) {
    constexpr std::string_view kMark = "[ERROR] ";
    if (line.starts_with(kMark)) line.remove_prefix(kMark.size());
    if (saysThatNothingIsThere(line)) return;
    const MutexLock lock(mutex_);
    dates_.push_back(when);
    if (dates_.size() > kCountedMax) dates_.pop_front();
    last_ = line;
}

void ErrorLog::forget() {
    const MutexLock lock(mutex_);
    dates_.clear();
    last_.clear();
}

ErrorLog::Recent ErrorLog::recent(const KsDate& now) const {
    const KsDate begin{now.seconds - 3'600, now.nanoseconds};
    const MutexLock lock(mutex_);
    Recent recent;
    recent.count =
        static_cast<std::uint64_t>(std::ranges::count_if(dates_, [&](const KsDate& date) { return begin < date; }));
    if (recent.count > 0) recent.last = last_;
    return recent;
}

}  // namespace cindral
