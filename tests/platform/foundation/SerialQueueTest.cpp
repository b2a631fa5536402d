#include "platform/foundation/SerialQueue.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <filesystem>
#include <functional>
#include <iterator>
#include <memory>
#include <numeric>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/foundation/Dispatch.h"
#include "platform/foundation/ThreadPool.h"

namespace cindral {
namespace {

using ::testing::ElementsAre;

std::string threadName() {
    std::array<char, 64> name{};
    ::pthread_getname_np(::pthread_self(), name.data(), name.size());
    return name.data();
}

std::size_t threadCount() {
    return static_cast<std::size_t>(std::distance(std::filesystem::directory_iterator("/proc/self/task"), {}));
}

/// A door that tasks wait at until it is opened, once and for all.
class Gate {
public:
    Gate() { group_.enter(); }
    void open() { group_.leave(); }
    void pass() { group_.wait(); }

private:
    DispatchGroup group_;
};

/// More waiting tasks than any machine that runs this has processors.
constexpr std::size_t kManyWaiters = 200;

TEST(SerialQueue, hasItsLabel) {
    EXPECT_EQ(SerialQueue("cindral.test").label(), "cindral.test");
}

TEST(SerialQueue, runsTasksInTheOrderInWhichTheyCame) {
    std::vector<int> order;
    SerialQueue queue("cindral.test");
    for (int i = 0; i < 1000; ++i) queue.async([&order, i] { order.push_back(i); });
    queue.sync([] {});
    std::vector<int> expected(1000);
    std::iota(expected.begin(), expected.end(), 0);
    EXPECT_EQ(order, expected);
}

TEST(SerialQueue, runsOneTaskAtATime) {
    constexpr int kThreads = 6;
    constexpr int kTasks = 500;
    int count = 0;  // Not atomic: a race is a lost count, and an error under the thread sanitizer.
    SerialQueue queue("cindral.test");
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) {
        threads.emplace_back([&] {
            for (int task = 0; task < kTasks; ++task) {
                queue.async([&] { ++count; });
                queue.sync([&] { ++count; });
            }
        });
    }
    for (std::thread& thread : threads) thread.join();
    queue.sync([&] { EXPECT_EQ(count, 2 * kThreads * kTasks); });
}

// Each thread's own tasks stay in order, whichever way they were put on.
TEST(SerialQueue, keepsTheOrderOfEachCaller) {
    SerialQueue queue("cindral.test");
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) {
        threads.emplace_back([&] {
            int last = 0;
            for (int task = 1; task <= 300; ++task) {
                const auto step = [&last, task] { EXPECT_EQ(std::exchange(last, task), task - 1); };
                if (task % 3 == 0) {
                    queue.sync(step);
                } else {
                    queue.async(step);
                }
            }
        });
    }
    for (std::thread& thread : threads) thread.join();
}

TEST(SerialQueue, syncRunsAfterWhatWasPutOnBefore) {
    std::vector<std::string> order;
    Gate gate;
    SerialQueue queue("cindral.test");
    queue.async([&] {
        gate.pass();
        order.emplace_back("first");
    });
    std::thread opener([&] { gate.open(); });
    queue.sync([&] { order.emplace_back("second"); });
    EXPECT_THAT(order, ElementsAre("first", "second"));
    opener.join();
}

TEST(SerialQueue, syncRunsTheTaskOnTheCallersThread) {
    SerialQueue queue("cindral.test");
    std::thread::id idle;
    queue.sync([&] { idle = std::this_thread::get_id(); });
    EXPECT_EQ(idle, std::this_thread::get_id());

    Gate gate;
    queue.async([&] { gate.pass(); });
    std::thread opener([&] { gate.open(); });
    std::thread::id busy;
    queue.sync([&] { busy = std::this_thread::get_id(); });
    EXPECT_EQ(busy, std::this_thread::get_id());
    opener.join();
}

TEST(SerialQueue, runsWhatASynchronousTaskPutOnAfterIt) {
    std::vector<std::string> order;
    SerialQueue queue("cindral.test");
    queue.sync([&] {
        queue.async([&] { order.emplace_back("put on"); });
        order.emplace_back("synchronous");
    });
    queue.sync([] {});
    EXPECT_THAT(order, ElementsAre("synchronous", "put on"));
}

TEST(SerialQueue, isCurrentInItsTasksOnly) {
    SerialQueue queue("cindral.test");
    SerialQueue other("cindral.other");
    EXPECT_FALSE(queue.isCurrent());
    queue.sync([&] {
        queue.assertCurrent();
        EXPECT_TRUE(queue.isCurrent());
        EXPECT_FALSE(other.isCurrent());
    });
    queue.async([&] {
        queue.assertCurrent();
        EXPECT_TRUE(queue.isCurrent());
        EXPECT_FALSE(other.isCurrent());
        std::thread([&] { EXPECT_FALSE(queue.isCurrent()); }).join();
    });
    queue.sync([] {});
    EXPECT_FALSE(queue.isCurrent());
}

TEST(SerialQueue, staysCurrentWhileItsTaskIsInAnotherQueue) {
    SerialQueue queue("cindral.test");
    SerialQueue other("cindral.other");
    queue.sync([&] {
        other.sync([&] {
            queue.assertCurrent();
            other.assertCurrent();
        });
        EXPECT_FALSE(other.isCurrent());
    });
}

TEST(SerialQueue, namesTheThreadAfterItsLabel) {
    std::string first;
    std::string second;
    SerialQueue queue("cindral.app-refresh.queue");
    SerialQueue shortLabel("main-like");
    queue.async([&] { first = threadName(); });
    queue.sync([] {});
    shortLabel.async([&] { second = threadName(); });
    shortLabel.sync([] {});
    EXPECT_EQ(first, "cindral.app-ref");
    EXPECT_EQ(second, "main-like");
}

TEST(SerialQueue, syncLeavesTheCallersNameAlone) {
    const std::string before = threadName();
    SerialQueue queue("cindral.test");
    queue.sync([&] { EXPECT_EQ(threadName(), before); });
    EXPECT_EQ(threadName(), before);
}

TEST(SerialQueue, destroyingWaitsForItsTasks) {
    std::vector<std::string> order;
    Gate gate;
    std::optional<std::thread> opener;
    {
        SerialQueue queue("cindral.test");
        queue.async([&] {
            gate.pass();
            order.emplace_back("first");
            queue.async([&] { order.emplace_back("put on by the first"); });
        });
        opener.emplace([&] { gate.open(); });
    }
    EXPECT_THAT(order, ElementsAre("first", "put on by the first"));
    opener->join();
}

// What a task holds may use the queue as it goes, and is gone when the queue is.
TEST(SerialQueue, destroysATaskOnTheQueue) {
    struct Held {
        explicit Held(const SerialQueue& itsQueue, bool& itsFlag) : queue(itsQueue), wasOnQueue(itsFlag) {}
        ~Held() { wasOnQueue = queue.isCurrent(); }
        const SerialQueue& queue;
        bool& wasOnQueue;
    };
    bool wasOnQueue = false;
    {
        SerialQueue queue("cindral.test");
        queue.async([held = std::make_shared<Held>(queue, wasOnQueue)] {});
    }
    EXPECT_TRUE(wasOnQueue);
}

TEST(SerialQueue, destroyedByItsOwnTaskDropsTheRest) {
    bool rest = false;
    Gate gate;
    DispatchSemaphore done(0);
    auto* queue = new SerialQueue("cindral.test");
    queue->async([&, queue] {
        gate.pass();
        delete queue;
        done.signal();
    });
    queue->async([&, held = std::make_shared<int>(1)] { rest = true; });
    gate.open();
    done.wait();
    EXPECT_FALSE(rest);
}

TEST(SerialQueue, mayBeDestroyedByASynchronousTask) {
    auto queue = std::make_unique<SerialQueue>("cindral.test");
    SerialQueue& reference = *queue;
    reference.sync([&] { queue.reset(); });
    EXPECT_EQ(queue, nullptr);
}

// The last reference to the owner of a queue often goes with a task on that queue.
TEST(SerialQueue, mayGoWithItsOwnerInATask) {
    struct Owner {
        explicit Owner(DispatchSemaphore& itsGone) : gone(itsGone) {}
        ~Owner() { gone.signal(); }
        DispatchSemaphore& gone;
        SerialQueue queue{"cindral.test"};
    };
    DispatchSemaphore gone(0);
    for (int i = 0; i < 100; ++i) {
        auto owner = std::make_shared<Owner>(gone);
        SerialQueue& queue = owner->queue;
        queue.async([owner = std::move(owner)] {});
        gone.wait();
    }
}

// Two threads at least run at once, and a queue that never ends takes turns with the others.
TEST(SerialQueue, aBusyQueueStarvesNoOther) {
    std::atomic<bool> ends = false;
    std::function<void(SerialQueue&)> goOn = [&](SerialQueue& queue) {
        if (!ends) queue.async([&] { goOn(queue); });
    };
    std::vector<std::unique_ptr<SerialQueue>> busy;
    for (unsigned i = 0; i < 2 * std::max(2U, std::thread::hardware_concurrency()); ++i) {
        busy.push_back(std::make_unique<SerialQueue>("cindral.busy"));
        goOn(*busy.back());
    }
    SerialQueue queue("cindral.test");
    queue.async([&] { ends = true; });
}

TEST(SerialQueue, waitingTasksStarveNobody) {
    std::vector<std::unique_ptr<Gate>> gates;
    std::vector<std::unique_ptr<SerialQueue>> queues;
    for (std::size_t i = 0; i < kManyWaiters; ++i) gates.push_back(std::make_unique<Gate>());
    for (std::size_t i = 0; i < kManyWaiters; ++i) {
        queues.push_back(std::make_unique<SerialQueue>("cindral.waiter"));
        // Each waits for the one after it; the last waits for nobody.
        queues.back()->async([&gates, i] {
            if (i + 1 < kManyWaiters) gates[i + 1]->pass();
            gates[i]->open();
        });
    }
    gates.front()->pass();
}

// A chain of queues, each entering the next one synchronously while that is busy waiting for its turn too.
TEST(SerialQueue, synchronousChainsStarveNobody) {
    std::vector<std::unique_ptr<SerialQueue>> queues;
    for (std::size_t i = 0; i < kManyWaiters; ++i) queues.push_back(std::make_unique<SerialQueue>("cindral.chain"));
    Gate gate;
    queues.back()->async([&] { gate.pass(); });
    DispatchGroup group;
    for (std::size_t i = 0; i + 1 < kManyWaiters; ++i) {
        group.enter();
        queues[i]->async([&, i] {
            queues[i + 1]->sync([] {});
            group.leave();
        });
    }
    dispatchAsync([&] { gate.open(); });
    group.wait();
}

TEST(SerialQueue, destroyingAQueueInATaskStarvesNobody) {
    Gate gate;
    DispatchGroup group;
    for (std::size_t i = 0; i < kManyWaiters; ++i) {
        group.enter();
        dispatchAsync([&] {
            std::make_unique<SerialQueue>("cindral.inner")->async([&] { gate.pass(); });
            group.leave();
        });
    }
    dispatchAsync([&] { gate.open(); });
    group.wait();
}

TEST(SerialQueue, costsNoThreadWithoutTasks) {
    const std::size_t before = threadCount();
    std::vector<std::unique_ptr<SerialQueue>> queues;
    for (int i = 0; i < 1000; ++i) {
        queues.push_back(std::make_unique<SerialQueue>("cindral.idle"));
        queues.back()->sync([] {});
    }
    EXPECT_LE(threadCount(), before);
}

TEST(SerialQueue, letsGoOfThreadsThatABurstNeeded) {
    DispatchGroup group;
    DispatchSemaphore arrived(0);
    Gate gate;
    for (std::size_t i = 0; i < kManyWaiters; ++i) {
        group.enter();
        dispatchAsync([&] {
            arrived.signal();
            gate.pass();
            group.leave();
        });
    }
    for (std::size_t i = 0; i < kManyWaiters; ++i) arrived.wait();
    EXPECT_GT(threadCount(), kManyWaiters);
    gate.open();
    group.wait();
    while (threadCount() >= kManyWaiters / 2) std::this_thread::yield();
}

TEST(SerialQueue, theMainQueueIsOneSerialQueue) {
    EXPECT_EQ(SerialQueue::main().label(), "main");
    EXPECT_EQ(&SerialQueue::main(), &SerialQueue::main());
    std::string name;
    SerialQueue::main().async([&] {
        SerialQueue::main().assertCurrent();
        name = threadName();
    });
    SerialQueue::main().sync([] {});
    EXPECT_EQ(name, "main");
}

TEST(DispatchAsync, runsTasksBesideEachOther) {
    // Each waits for the other: one after the other they would never end.
    Gate first;
    Gate second;
    DispatchGroup group;
    group.enter();
    group.enter();
    dispatchAsync([&] {
        first.open();
        second.pass();
        group.leave();
    });
    dispatchAsync([&] {
        second.open();
        first.pass();
        group.leave();
    });
    group.wait();
}

TEST(DispatchAsync, runsOnThreadsOfThePool) {
    std::string name;
    DispatchGroup group;
    group.enter();
    dispatchAsync([&] {
        name = threadName();
        group.leave();
    });
    group.wait();
    EXPECT_EQ(name, "cindral.pool");
}

// Each wait makes room for one other, however many regions the waiting task is in.
TEST(ThreadPool, blockingRegionsMayBeNested) {
    const std::size_t tasks = std::thread::hardware_concurrency() + 2;
    DispatchGroup group;
    for (std::size_t i = 0; i < tasks; ++i) {
        group.enter();
        dispatchAsync([&] {
            const ThreadPool::BlockingRegion outer;
            SerialQueue queue("cindral.test-inner");
            Gate gate;
            queue.async([&] {
                const ThreadPool::BlockingRegion inner;
                gate.open();
            });
            const ThreadPool::BlockingRegion inner;
            gate.pass();
            queue.sync([] {});
            group.leave();
        });
    }
    group.wait();
}

// Tasks beyond the bound wait for a thread and are run all the same.
TEST(DispatchAsync, neverUsesMoreThreadsThanTheBound) {
    constexpr std::size_t kTasks = ThreadPool::kThreadsMax + 50;
    Gate gate;
    DispatchGroup group;
    DispatchSemaphore arrived(0);
    std::atomic<std::size_t> inside = 0;
    for (std::size_t i = 0; i < kTasks; ++i) {
        group.enter();
        dispatchAsync([&] {
            ++inside;
            arrived.signal();
            gate.pass();
            --inside;
            group.leave();
        });
    }
    for (std::size_t i = 0; i < ThreadPool::kThreadsMax; ++i) arrived.wait();
    EXPECT_EQ(inside, ThreadPool::kThreadsMax);
    gate.open();
    group.wait();
    EXPECT_EQ(inside, 0U);
}

class SerialQueueDeathTest : public ::testing::Test {
protected:
    SerialQueueDeathTest() { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(SerialQueueDeathTest, abortsWhenEnteredFromItself) {
    SerialQueue queue("cindral.test");
    EXPECT_DEATH(queue.sync([&] { queue.sync([] {}); }),
                 "queue \"cindral.test\" is entered synchronously from one of its own tasks");
}

TEST_F(SerialQueueDeathTest, abortsWhenEnteredFromItselfByWayOfAnother) {
    SerialQueue queue("cindral.test");
    SerialQueue other("cindral.other");
    const auto enterTwice = [&] {
        queue.async([&] { other.sync([&] { queue.sync([] {}); }); });
        queue.sync([] {});
    };
    EXPECT_DEATH(enterTwice(), "queue \"cindral.test\" is entered synchronously from one of its own tasks");
}

TEST_F(SerialQueueDeathTest, abortsWhenTheCallerIsNoTaskOfIt) {
    const SerialQueue queue("cindral.test");
    EXPECT_DEATH(queue.assertCurrent(), "not on queue \"cindral.test\"");
}

TEST_F(SerialQueueDeathTest, endsTheProcessForAnExceptionOfATask) {
    SerialQueue queue("cindral.test");
    EXPECT_DEATH(queue.sync([] { throw std::runtime_error("thrown by a task"); }), "thrown by a task");
    const auto throwAsynchronously = [&] {
        queue.async([] { throw std::runtime_error("thrown by a task"); });
        queue.sync([] {});
    };
    EXPECT_DEATH(throwAsynchronously(), "thrown by a task");
}

// Threads of the pool still run tasks while static objects are destroyed and the process ends.
TEST_F(SerialQueueDeathTest, letsTheProcessEndInTheMiddleOfTasks) {
    const auto exitWhileBusy = [] {
        for (int i = 0; i < 8; ++i) {
            auto* const queue = new SerialQueue("cindral.busy");
            static std::array<std::atomic<SerialQueue*>, 8> reachable;
            reachable[static_cast<std::size_t>(i)] = queue;
            static void (*goOn)(SerialQueue&) = [](SerialQueue& own) { own.async([&own] { goOn(own); }); };
            goOn(*queue);
        }
        SerialQueue::main().async([] { DispatchSemaphore(0).wait(); });
        std::exit(7);
    };
    EXPECT_EXIT(exitWhileBusy(), ::testing::ExitedWithCode(7), "");
}

}  // namespace
}  // namespace cindral
