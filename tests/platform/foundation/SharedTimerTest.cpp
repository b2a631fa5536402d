#include "platform/foundation/SharedTimer.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>

#include <array>
#include <chrono>
#include <vector>

#include "platform/foundation/Dispatch.h"

namespace cindral {
namespace {

using namespace std::chrono_literals;
using ::testing::ElementsAre;

std::chrono::steady_clock::time_point now() {
    return std::chrono::steady_clock::now();
}

TEST(SharedTimer, callsAtAMomentThatHasPassed) {
    DispatchSemaphore called(0);
    SharedTimer::shared().callAt(now() - 1h, [&] { called.signal(); });
    called.wait();
}

TEST(SharedTimer, callsNotBeforeTheMoment) {
    DispatchSemaphore called(0);
    const auto moment = now() + 2ms;
    std::chrono::steady_clock::time_point calledAt;
    SharedTimer::shared().callAt(moment, [&] {
        calledAt = now();
        called.signal();
    });
    called.wait();
    EXPECT_GE(calledAt, moment);
}

// A sleep until the far moment must not hold up a near one that comes later.
TEST(SharedTimer, callsANearMomentBeforeAFarOneThatCameFirst) {
    DispatchSemaphore called(0);
    SharedTimer::shared().callAt(now() + 24h, [] { FAIL() << "a day has not passed"; });
    SharedTimer::shared().callAt(now() + 1ms, [&] { called.signal(); });
    called.wait();
}

TEST(SharedTimer, callsInTheOrderOfTheMoments) {
    std::vector<int> order;
    DispatchSemaphore done(0);
    const auto moment = now();
    // Holds up the timer's thread until all are there.
    DispatchSemaphore go(0);
    SharedTimer::shared().callAt(moment - 1h, [&] { go.wait(); });
    SharedTimer::shared().callAt(moment, [&] {
        order.push_back(3);
        done.signal();
    });
    SharedTimer::shared().callAt(moment - 2ms, [&] { order.push_back(1); });
    SharedTimer::shared().callAt(moment - 1ms, [&] { order.push_back(2); });
    go.signal();
    done.wait();
    EXPECT_THAT(order, ElementsAre(1, 2, 3));
}

TEST(SharedTimer, mayBeAskedFromACallback) {
    DispatchSemaphore called(0);
    SharedTimer::shared().callAt(now(), [&] { SharedTimer::shared().callAt(now(), [&] { called.signal(); }); });
    called.wait();
}

TEST(SharedTimer, runsOnAThreadThatTakesNoSignalsOfTheProcess) {
    DispatchSemaphore called(0);
    sigset_t signals;
    std::array<char, 64> name{};
    SharedTimer::shared().callAt(now(), [&] {
        ::pthread_sigmask(SIG_SETMASK, nullptr, &signals);
        ::pthread_getname_np(::pthread_self(), name.data(), name.size());
        called.signal();
    });
    called.wait();
    EXPECT_STREQ(name.data(), "cindral.timer");
    EXPECT_EQ(::sigismember(&signals, SIGTERM), 1);
    EXPECT_EQ(::sigismember(&signals, SIGCHLD), 1);
    EXPECT_EQ(::sigismember(&signals, SIGSEGV), 0);
    // The mask of the thread that asked is as it was.
    ::pthread_sigmask(SIG_SETMASK, nullptr, &signals);
    EXPECT_EQ(::sigismember(&signals, SIGTERM), 0);
}

}  // namespace
}  // namespace cindral
