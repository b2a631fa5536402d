#pragma once

#include <chrono>
#include <cstddef>
#include <deque>
#include <optional>
#include <string>
#include <string_view>

#include "host/LineSink.h"
#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// Writes whole lines to a client's socket without ever holding up who writes: what the socket does not take at once is
/// kept, and a thread of the client's own, started when it is first needed, sends it as the client reads.
///
/// What is kept is bounded by what the client can have asked for. Once it is more than kBacklogBytesMax, a client that
/// has taken nothing for kPatience is dropped: the connection is shut down, and nothing more is kept. One that reads
/// on, however slowly, gets everything; waitForRoom() keeps it from asking for more meanwhile.
///
/// Thread safety: all operations, from any thread.
class SocketOutput final : public LineSink {
public:
    static constexpr std::size_t kBacklogBytesMax = 16 << 20;
    /// Beyond this nothing more is received from a client that reads.
    static constexpr std::size_t kRoomBytes = 4 << 20;
    static constexpr std::chrono::milliseconds kPatience{5000};

    /// `socket` is borrowed for life.
    explicit SocketOutput(int socket, std::chrono::milliseconds patience = kPatience)
        : socket_(socket), patience_(patience) {}
    /// Drops what has not been sent.
    ~SocketOutput() override;
    SocketOutput(const SocketOutput&) = delete;
    SocketOutput& operator=(const SocketOutput&) = delete;

    void write(std::string_view line) override;
    void waitForRoom() override;
    std::optional<KsError> error() const override;

    /// From now on a client that has taken nothing for kPatience is dropped, however little is kept for it.
    void hurry();
    /// Returns when all is sent, or the client is gone or dropped.
    void finish();

private:
    using Moment = std::chrono::steady_clock::time_point;

    std::size_t sendNow(std::string_view bytes) REQUIRES(mutex_);
    void keep(std::string_view bytes) REQUIRES(mutex_);
    void breakOff(std::optional<KsError> error) REQUIRES(mutex_);
    void startThread() REQUIRES(mutex_);
    void run();
    bool takeChunk(std::string& chunk);
    bool sendSome(std::string_view& bytes);
    void waitUntilItTakes();
    bool isOverdue() const REQUIRES(mutex_);

    const int socket_;
    const std::chrono::milliseconds patience_;
    UniqueFd wake_;  ///< constant once the thread runs
    DispatchGroup running_;

    mutable Mutex mutex_;
    Condition changed_;
    std::deque<std::string> chunks_ GUARDED_BY(mutex_);
    std::size_t backlogBytes_ GUARDED_BY(mutex_) = 0;  ///< of the chunks, and of the one that is being sent
    Moment lastTaken_ GUARDED_BY(mutex_);
    bool isBroken_ GUARDED_BY(mutex_) = false;
    bool isHurried_ GUARDED_BY(mutex_) = false;
    bool isEnding_ GUARDED_BY(mutex_) = false;  ///< the thread has nothing more to wait for
    std::optional<KsError> error_ GUARDED_BY(mutex_);
    bool hasThread_ GUARDED_BY(mutex_) = false;
};

}  // namespace cindral
