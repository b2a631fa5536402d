#include "platform/tessel/TSPacer.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <thread>
#include <vector>

#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/SerialQueue.h"

namespace cindral {
namespace {

using namespace std::chrono_literals;
using std::chrono::milliseconds;
using ::testing::ElementsAre;
using ::testing::IsEmpty;
using TimePoint = std::chrono::steady_clock::time_point;

constexpr milliseconds kInterval = 500ms;

/// A clock that stands still until it is told the time, and a timer by it.
class FakeTime {
public:
    TimePoint now() const {
        const MutexLock lock(mutex_);
        return now_;
    }

    void callAt(TimePoint moment, std::function<void()> callback) {
        const MutexLock lock(mutex_);
        calls_.emplace(moment, std::move(callback));
    }

    /// Goes forward without the timer's calls: they are late.
    void passSilently(milliseconds time) {
        const MutexLock lock(mutex_);
        now_ += time;
    }

    /// Makes the calls that are due.
    void callWhatIsDue() {
        while (true) {
            std::function<void()> callback;
            {
                const MutexLock lock(mutex_);
                if (calls_.empty() || calls_.begin()->first > now_) return;
                callback = std::move(calls_.begin()->second);
                calls_.erase(calls_.begin());
            }
            callback();
        }
    }

    /// Makes all calls, however early.
    void callEverything() {
        std::multimap<TimePoint, std::function<void()>> calls;
        {
            const MutexLock lock(mutex_);
            calls.swap(calls_);
        }
        for (const auto& [moment, callback] : calls) callback();
    }

    std::size_t callsAskedFor() const {
        const MutexLock lock(mutex_);
        return calls_.size();
    }

private:
    mutable Mutex mutex_;
    TimePoint now_ GUARDED_BY(mutex_) = TimePoint(1h);
    std::multimap<TimePoint, std::function<void()>> calls_ GUARDED_BY(mutex_);
};

class TSPacerTest : public ::testing::Test {
protected:
    TSPacerTest() {
        setBlockTo([] {});
        pacer_->resume();
    }

    std::unique_ptr<TSPacer> makePacer() {
        return std::make_unique<TSPacer>(
            "cindral.test.pacer", queue_, kInterval, [this] { return time_.now(); },
            [this](TimePoint moment, std::function<void()> callback) { time_.callAt(moment, std::move(callback)); });
    }

    /// Each event notes when it began, in milliseconds from the start, and then does the work.
    void setBlockTo(std::function<void()> work) {
        pacer_->setEventBlock([this, work = std::move(work)] {
            events_.push_back(std::chrono::duration_cast<milliseconds>(time_.now() - start_).count());
            work();
        });
    }

    void pass(milliseconds time) {
        time_.passSilently(time);
        time_.callWhatIsDue();
        settle();
    }
    void signal() {
        pacer_->signal();
        settle();
    }
    /// Until the queue has nothing to do.
    void settle() {
        queue_.sync([] {});
    }
    std::vector<std::int64_t> events() {
        std::vector<std::int64_t> copy;
        queue_.sync([&] { copy = events_; });
        return copy;
    }

    FakeTime time_;
    const TimePoint start_ = time_.now();
    std::vector<std::int64_t> events_;  // Touched on the queue only.
    SerialQueue queue_{"cindral.test"};
    std::unique_ptr<TSPacer> pacer_ = makePacer();
};

TEST_F(TSPacerTest, firesAtOnceForTheFirstSignal) {
    signal();
    EXPECT_THAT(events(), ElementsAre(0));
    EXPECT_FALSE(pacer_->isSignalPending());
    EXPECT_EQ(time_.callsAskedFor(), 0U);
}

TEST_F(TSPacerTest, firesNothingWithoutASignal) {
    pass(10s);
    EXPECT_THAT(events(), IsEmpty());
    EXPECT_EQ(time_.callsAskedFor(), 0U);
}

TEST_F(TSPacerTest, gathersWhatComesWithinTheInterval) {
    signal();
    pass(100ms);
    signal();
    pass(100ms);
    signal();
    EXPECT_TRUE(pacer_->isSignalPending());
    EXPECT_THAT(events(), ElementsAre(0));
    pass(299ms);
    EXPECT_THAT(events(), ElementsAre(0));
    pass(1ms);
    EXPECT_THAT(events(), ElementsAre(0, 500));
    EXPECT_FALSE(pacer_->isSignalPending());
    pass(10s);
    EXPECT_THAT(events(), ElementsAre(0, 500));
}

TEST_F(TSPacerTest, firesAtOnceAgainAfterAPause) {
    signal();
    pass(500ms);
    signal();
    EXPECT_THAT(events(), ElementsAre(0, 500));
    pass(700ms);
    signal();
    EXPECT_THAT(events(), ElementsAre(0, 500, 1200));
}

TEST_F(TSPacerTest, firesOnceAnIntervalInALongBurst) {
    for (int i = 0; i < 200; ++i) {
        signal();
        pass(10ms);
    }
    EXPECT_THAT(events(), ElementsAre(0, 500, 1000, 1500, 2000));
    pass(10s);
    EXPECT_THAT(events(), ElementsAre(0, 500, 1000, 1500, 2000));
}

TEST_F(TSPacerTest, asksTheTimerOnceForABurst) {
    for (int i = 0; i < 10; ++i) signal();
    EXPECT_EQ(time_.callsAskedFor(), 1U);
}

// The signal comes when the event has already looked at what it reports.
TEST_F(TSPacerTest, firesAgainForASignalDuringAnEvent) {
    std::atomic<bool> isFirst = true;
    setBlockTo([&] {
        if (!isFirst.exchange(false)) return;
        pacer_->signal();
        EXPECT_TRUE(pacer_->isSignalPending());
    });
    signal();
    EXPECT_THAT(events(), ElementsAre(0));
    pass(500ms);
    EXPECT_THAT(events(), ElementsAre(0, 500));
    pass(10s);
    EXPECT_THAT(events(), ElementsAre(0, 500));
}

TEST_F(TSPacerTest, countsTheIntervalFromTheBeginningOfAnEvent) {
    std::atomic<bool> isFirst = true;
    setBlockTo([&] {
        if (isFirst.exchange(false)) time_.passSilently(700ms);
    });
    signal();
    signal();
    EXPECT_THAT(events(), ElementsAre(0, 700));
}

// An event that the queue could not run at once is as late as it is: the next keeps its distance from it.
TEST_F(TSPacerTest, keepsTheDistanceFromAnEventThatWasDelayed) {
    DispatchSemaphore go(0);
    queue_.async([&] { go.wait(); });
    pacer_->signal();
    time_.passSilently(300ms);
    go.signal();
    settle();
    signal();
    pass(499ms);
    EXPECT_THAT(events(), ElementsAre(300));
    pass(1ms);
    EXPECT_THAT(events(), ElementsAre(300, 800));
}

TEST_F(TSPacerTest, putsOneEventOnABusyQueue) {
    DispatchSemaphore go(0);
    queue_.async([&] { go.wait(); });
    for (int i = 0; i < 10; ++i) pacer_->signal();
    go.signal();
    settle();
    EXPECT_THAT(events(), ElementsAre(0));
    EXPECT_FALSE(pacer_->isSignalPending());
}

TEST_F(TSPacerTest, startsSuspendedAndKeepsSignals) {
    pacer_ = makePacer();
    setBlockTo([] {});
    signal();
    EXPECT_TRUE(pacer_->isSignalPending());
    EXPECT_THAT(events(), IsEmpty());
    pacer_->resume();
    settle();
    EXPECT_THAT(events(), ElementsAre(0));
}

TEST_F(TSPacerTest, keepsSignalsWhileSuspended) {
    signal();
    pacer_->suspend();
    signal();
    pass(10s);
    EXPECT_THAT(events(), ElementsAre(0));
    EXPECT_TRUE(pacer_->isSignalPending());
    pacer_->resume();
    settle();
    EXPECT_THAT(events(), ElementsAre(0, 10000));
}

TEST_F(TSPacerTest, keepsTheIntervalOverASuspension) {
    signal();
    pacer_->suspend();
    signal();
    pacer_->resume();
    pass(499ms);
    EXPECT_THAT(events(), ElementsAre(0));
    pass(1ms);
    EXPECT_THAT(events(), ElementsAre(0, 500));
}

TEST_F(TSPacerTest, beginsNoEventThatWaitsOnTheQueueWhenItIsSuspended) {
    DispatchSemaphore go(0);
    queue_.async([&] { go.wait(); });
    pacer_->signal();
    pacer_->suspend();
    go.signal();
    settle();
    EXPECT_THAT(events(), IsEmpty());
    EXPECT_TRUE(pacer_->isSignalPending());
    pacer_->resume();
    settle();
    EXPECT_THAT(events(), ElementsAre(0));
}

TEST_F(TSPacerTest, keepsSignalsUntilThereIsABlock) {
    pacer_ = makePacer();
    pacer_->resume();
    signal();
    EXPECT_TRUE(pacer_->isSignalPending());
    setBlockTo([] {});
    settle();
    EXPECT_THAT(events(), ElementsAre(0));
}

TEST_F(TSPacerTest, asksAgainWhenTheTimerCallsEarly) {
    signal();
    signal();
    time_.passSilently(100ms);
    time_.callEverything();
    settle();
    EXPECT_THAT(events(), ElementsAre(0));
    pass(400ms);
    EXPECT_THAT(events(), ElementsAre(0, 500));
}

TEST_F(TSPacerTest, doesNotWaitForATimerThatIsLate) {
    signal();
    signal();
    time_.passSilently(600ms);
    signal();
    EXPECT_THAT(events(), ElementsAre(0, 600));
    time_.callWhatIsDue();
    settle();
    EXPECT_THAT(events(), ElementsAre(0, 600));
    signal();
    pass(500ms);
    EXPECT_THAT(events(), ElementsAre(0, 600, 1100));
}

TEST_F(TSPacerTest, runsItsEventsOnTheQueue) {
    setBlockTo([this] { queue_.assertCurrent(); });
    signal();
    signal();
    pass(500ms);
    EXPECT_THAT(events(), ElementsAre(0, 500));
}

TEST_F(TSPacerTest, beginsNoEventAfterItsEnd) {
    DispatchSemaphore go(0);
    signal();
    signal();
    queue_.async([&] { go.wait(); });
    time_.passSilently(500ms);
    time_.callWhatIsDue();
    pacer_.reset();
    go.signal();
    settle();
    EXPECT_THAT(events(), ElementsAre(0));
}

TEST_F(TSPacerTest, aTimerThatCallsAfterItsEndFindsNothingToDo) {
    signal();
    signal();
    pacer_.reset();
    pass(500ms);
    EXPECT_THAT(events(), ElementsAre(0));
}

TEST_F(TSPacerTest, mayEndInItsOwnEvent) {
    setBlockTo([this] { pacer_.reset(); });
    queue_.sync([&] { pacer_->signal(); });
    settle();
    EXPECT_EQ(pacer_, nullptr);
    EXPECT_THAT(events(), ElementsAre(0));
}

TEST_F(TSPacerTest, letsGoOfItsBlockAtItsEnd) {
    auto held = std::make_shared<int>(0);
    pacer_->setEventBlock([held] {});
    signal();
    signal();
    EXPECT_GT(held.use_count(), 1);
    pacer_.reset();
    settle();
    EXPECT_EQ(held.use_count(), 1);
}

// Whoever signals after having changed something sees an event begin after the change.
TEST_F(TSPacerTest, dropsNoLastSignalOfManyThreads) {
    std::atomic<int> changes = 0;
    int seen = 0;
    setBlockTo([&] { seen = changes; });
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) {
        threads.emplace_back([&] {
            for (int change = 0; change < 100; ++change) {
                ++changes;
                pacer_->signal();
                time_.passSilently(50ms);
                time_.callWhatIsDue();
            }
        });
    }
    for (std::thread& thread : threads) thread.join();
    settle();
    pass(500ms);
    queue_.sync([&] { EXPECT_EQ(seen, 400); });
    EXPECT_FALSE(pacer_->isSignalPending());
}

// By the real clock, with an interval that is over soon.
TEST(TSPacer, firesForEachOfItsSignalsInTheEnd) {
    SerialQueue queue("cindral.test");
    DispatchSemaphore fired(0);
    std::vector<TimePoint> moments;
    {
        TSPacer pacer("cindral.test.pacer", queue, 2ms);
        pacer.setEventBlock([&] {
            moments.push_back(std::chrono::steady_clock::now());
            fired.signal();
        });
        pacer.signal();
        pacer.resume();
        fired.wait();
        pacer.signal();
        fired.wait();
    }
    queue.sync([&] {
        ASSERT_EQ(moments.size(), 2U);
        // Each was noted after its event had begun; the first may have been noted late.
        EXPECT_GT(moments[1], moments[0]);
    });
}

}  // namespace
}  // namespace cindral
