#pragma once

#include <chrono>
#include <deque>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/Mutex.h"

namespace cindral {

/// One browser that was let in.
///
/// Thread safety: immutable.
struct HttpSession {
    std::string cookie;
    std::string token;  ///< to be shown with every write
};

/// Who may come in: one-time links, and the sessions that they were traded for.
///
/// Everything is in memory: a session ends with the process, at the latest. All secrets are 32 bytes of the kernel's
/// generator, as hexadecimal digits, compared in a time that says nothing of where they differ; none is ever logged.
///
/// Thread safety: all operations, from any thread.
class HttpSessions {
public:
    /// Beyond these the oldest goes.
    static constexpr std::size_t kLinksMax = 16;
    static constexpr std::size_t kSessionsMax = 64;
    static constexpr std::chrono::hours kLifetime{24 * 30};

    using Clock = std::chrono::steady_clock;

    /// The secret of a new link.
    std::string makeLink();
    /// A new session for a link that was made and not traded before; null for anything else.
    std::shared_ptr<const HttpSession> trade(std::string_view link, Clock::time_point now = Clock::now());
    /// The session of a cookie; null where there is none, or no longer.
    std::shared_ptr<const HttpSession> find(std::string_view cookie, Clock::time_point now = Clock::now());
    void end(const HttpSession& session);

    /// Takes the same time wherever the texts differ.
    static bool areEqual(std::string_view a, std::string_view b);

private:
    struct Entry {
        std::shared_ptr<const HttpSession> session;
        Clock::time_point end;
    };

    Mutex mutex_;
    std::deque<std::string> links_ GUARDED_BY(mutex_);
    std::deque<Entry> sessions_ GUARDED_BY(mutex_);
};

}  // namespace cindral
