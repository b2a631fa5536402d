#pragma once

#include <cstdint>
#include <deque>
#include <string>

#include "platform/foundation/KsDate.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// Counts the error lines of the process's log, for the status. Observes the log for as long as it lives; there is one
/// observer at a time.
///
/// A line that only says that what was asked for is not there tells of nothing wrong with the system: whoever asked was
/// told. Such lines do not count.
///
/// Thread safety: all operations, from any thread.
class ErrorLog {
public:
    /// More are not told apart.
    static constexpr std::size_t kCountedMax = 10'000;

    ErrorLog();
    ~ErrorLog();
    ErrorLog(const ErrorLog&) = delete;
    ErrorLog& operator=(const ErrorLog&) = delete;

    struct Recent {
        std::uint64_t count = 0;  ///< within the hour before
        std::string last;         ///< the newest line of them; empty for none
    };
    Recent recent(const KsDate& now) const;
    void add(const KsDate& when, std::string_view line);
    /// Begins anew: somebody has looked after what was logged so far.
    void forget();

private:
    mutable Mutex mutex_;
    std::deque<KsDate> dates_ GUARDED_BY(mutex_);
    std::string last_ GUARDED_BY(mutex_);
};

}  // namespace cindral
