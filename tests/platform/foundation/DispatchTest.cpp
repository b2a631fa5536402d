#include "platform/foundation/Dispatch.h"

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <thread>
#include <vector>

namespace cindral {
namespace {

constexpr auto kForever = std::chrono::steady_clock::duration::max();
constexpr auto kNoTime = std::chrono::steady_clock::duration::zero();

TEST(DispatchGroup, doesNotWaitWhenNobodyEntered) {
    DispatchGroup group;
    group.wait();
    EXPECT_EQ(group.wait(kNoTime), WaitResult::done);
}

TEST(DispatchGroup, waitsUntilEverybodyHasLeft) {
    DispatchGroup group;
    std::atomic<int> left = 0;
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i) {
        group.enter();
        threads.emplace_back([&] {
            ++left;
            group.leave();
        });
    }
    group.wait();
    EXPECT_EQ(left, 8);
    for (std::thread& thread : threads) thread.join();
}

TEST(DispatchGroup, timesOutWhileSomebodyIsInside) {
    DispatchGroup group;
    group.enter();
    group.enter();
    group.leave();
    EXPECT_EQ(group.wait(kNoTime), WaitResult::timedOut);
    EXPECT_EQ(group.wait(std::chrono::milliseconds(-1)), WaitResult::timedOut);
    group.leave();
    EXPECT_EQ(group.wait(kNoTime), WaitResult::done);
}

TEST(DispatchGroup, waitsForeverWithTheLongestTimeout) {
    DispatchGroup group;
    group.enter();
    std::thread thread([&] { group.leave(); });
    EXPECT_EQ(group.wait(kForever), WaitResult::done);
    thread.join();
}

TEST(DispatchGroup, canBeUsedAgain) {
    DispatchGroup group;
    for (int i = 0; i < 3; ++i) {
        group.enter();
        EXPECT_EQ(group.wait(kNoTime), WaitResult::timedOut);
        group.leave();
        group.wait();
    }
}

TEST(DispatchGroup, wakesEveryWaiter) {
    DispatchGroup group;
    group.enter();
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) threads.emplace_back([&] { group.wait(); });
    group.leave();
    for (std::thread& thread : threads) thread.join();
}

// The usual shape: the group lives on the stack of the one who waits.
TEST(DispatchGroup, mayGoAsSoonAsTheWaitIsOver) {
    for (int i = 0; i < 200; ++i) {
        auto group = std::make_unique<DispatchGroup>();
        group->enter();
        std::thread thread([raw = group.get()] { raw->leave(); });
        group->wait();
        group.reset();
        thread.join();
    }
}

TEST(DispatchGroupDeathTest, abortsWhenLeftMoreOftenThanEntered) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    DispatchGroup group;
    group.enter();
    group.leave();
    EXPECT_DEATH(group.leave(), "left more often than entered");
}

TEST(DispatchSemaphore, letsAsManyPassAsItCounts) {
    DispatchSemaphore semaphore(2);
    semaphore.wait();
    EXPECT_EQ(semaphore.wait(kNoTime), WaitResult::done);
    EXPECT_EQ(semaphore.wait(kNoTime), WaitResult::timedOut);
    semaphore.signal();
    EXPECT_EQ(semaphore.wait(kNoTime), WaitResult::done);
}

TEST(DispatchSemaphore, keepsASignalThatCameBeforeTheWait) {
    DispatchSemaphore semaphore(0);
    semaphore.signal();
    semaphore.wait();
    EXPECT_EQ(semaphore.wait(kNoTime), WaitResult::timedOut);
}

TEST(DispatchSemaphore, aTimeoutTakesNothing) {
    DispatchSemaphore semaphore(0);
    EXPECT_EQ(semaphore.wait(std::chrono::nanoseconds(1)), WaitResult::timedOut);
    semaphore.signal();
    EXPECT_EQ(semaphore.wait(kForever), WaitResult::done);
}

TEST(DispatchSemaphore, wakesOneWaiterForEachSignal) {
    constexpr int kWaiters = 4;
    DispatchSemaphore semaphore(0);
    std::atomic<int> passed = 0;
    std::vector<std::thread> threads;
    for (int i = 0; i < kWaiters; ++i) {
        threads.emplace_back([&] {
            if (semaphore.wait(kForever) == WaitResult::done) ++passed;
        });
    }
    for (int i = 0; i < kWaiters; ++i) semaphore.signal();
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(passed, kWaiters);
    EXPECT_EQ(semaphore.wait(kNoTime), WaitResult::timedOut);
}

}  // namespace
}  // namespace cindral
