#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <string>

namespace cindral {

class SerialQueue;

/// Turns any number of signals into events that are at least an interval apart.
///
/// The first signal after a pause of the interval or longer fires at once; signals that come sooner fire together,
/// once, when the interval since the last event is over. The last signal is never dropped: an event always begins after
/// it. The interval counts from one beginning to the next. Starts suspended; signals before resume(), or before there
/// is an event block, count.
///
/// Thread safety: all operations, from any thread. Events run on the queue, one at a time.
class TSPacer {
public:
    /// Must not use the pacer.
    using Clock = std::function<std::chrono::steady_clock::time_point()>;
    /// Calls back once at or after the moment, on any thread. Cancelled by nothing: a late call finds nothing to do.
    using Timer = std::function<void(std::chrono::steady_clock::time_point, std::function<void()>)>;

    /// `queue` is borrowed and must outlive the pacer's events.
    TSPacer(std::string name, SerialQueue& queue, std::chrono::milliseconds minFireInterval);
    /// With a clock and timer of the caller's, for tests.
    TSPacer(std::string name, SerialQueue& queue, std::chrono::milliseconds minFireInterval, Clock clock, Timer timer);
    /// No event begins after this. One that has begun goes on.
    ~TSPacer();
    TSPacer(const TSPacer&) = delete;
    TSPacer& operator=(const TSPacer&) = delete;

    const std::string& name() const;
    void setEventBlock(std::function<void()> block);
    void resume();
    void suspend();
    void signal();
    /// Whether a signal waits for its event to begin.
    bool isSignalPending() const;

    struct State;

private:
    std::shared_ptr<State> state_;
};

}  // namespace cindral
