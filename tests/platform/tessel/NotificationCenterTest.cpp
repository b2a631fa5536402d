#include "platform/tessel/NotificationCenter.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "platform/foundation/Dispatch.h"

namespace cindral {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr std::string_view kRegistered = kApplicationRegisteredNotification;
constexpr std::string_view kUnregistered = kApplicationUnregisteredNotification;

class NotificationCenterTest : public ::testing::Test {
protected:
    /// An observer that notes its name and the notification's.
    struct Observer {
        NotificationCenterTest* test;
        std::string name;
        static void callback(const void* token, std::string_view notification) {
            const auto* const self = static_cast<const Observer*>(token);
            self->test->calls_.push_back(self->name + " " + std::string(notification));
        }
    };

    void add(const Observer& observer, std::string_view name,
             SuspensionBehavior behavior = SuspensionBehavior::coalesce) {
        center_.addObserver(&observer, Observer::callback, name, behavior);
    }

    /// What has been called since the last look.
    std::vector<std::string> calls() { return std::exchange(calls_, {}); }

    std::vector<std::string> calls_;
    NotificationCenter center_;
    const Observer a_{this, "a"};
    const Observer b_{this, "b"};
};

TEST_F(NotificationCenterTest, postsToWhoAskedForTheName) {
    add(a_, "x");
    add(b_, "y");
    center_.post("x");
    EXPECT_THAT(calls(), ElementsAre("a x"));
    center_.post("y");
    EXPECT_THAT(calls(), ElementsAre("b y"));
    center_.post("z");
    EXPECT_THAT(calls(), IsEmpty());
}

TEST_F(NotificationCenterTest, callsInTheOrderOfRegistration) {
    add(b_, "x");
    add(a_, "y");
    add(a_, "x");
    center_.post("x");
    EXPECT_THAT(calls(), ElementsAre("b x", "a x"));
}

TEST_F(NotificationCenterTest, callsOnceForEachRegistration) {
    add(a_, "x");
    add(a_, "x");
    center_.post("x");
    EXPECT_THAT(calls(), ElementsAre("a x", "a x"));
}

TEST_F(NotificationCenterTest, callsOnTheThreadThatPosts) {
    std::thread::id called;
    center_.addObserver(
        &called,
        [](const void* token, std::string_view) {
            *const_cast<std::thread::id*>(static_cast<const std::thread::id*>(token)) = std::this_thread::get_id();
        },
        "x", SuspensionBehavior::drop);
    center_.post("x");
    EXPECT_EQ(called, std::this_thread::get_id());
}

TEST_F(NotificationCenterTest, removesEveryRegistrationOfAToken) {
    add(a_, kRegistered);
    add(b_, kRegistered);
    add(a_, kUnregistered);
    center_.removeEveryObserver(&a_);
    center_.post(kRegistered);
    center_.post(kUnregistered);
    EXPECT_THAT(calls(), ElementsAre(std::string("b ") += kRegistered));
}

TEST_F(NotificationCenterTest, removesWhatNeverWasWithoutAWord) {
    center_.removeEveryObserver(&a_);
    center_.removeEveryObserver(nullptr);
    center_.post("x");
    EXPECT_THAT(calls(), IsEmpty());
}

TEST_F(NotificationCenterTest, keepsPostsAsTheirObserversAskedWhileSuspended) {
    add(a_, "coalesced");
    add(a_, "dropped", SuspensionBehavior::drop);
    add(a_, "immediate", SuspensionBehavior::deliverImmediately);
    center_.suspend();
    for (int i = 0; i < 2; ++i) {
        center_.post("coalesced");
        center_.post("dropped");
        center_.post("immediate");
    }
    EXPECT_THAT(calls(), ElementsAre("a immediate", "a immediate"));
    center_.resume();
    EXPECT_THAT(calls(), ElementsAre("a coalesced"));
    center_.resume();
    EXPECT_THAT(calls(), IsEmpty());
    center_.post("dropped");
    EXPECT_THAT(calls(), ElementsAre("a dropped"));
}

TEST_F(NotificationCenterTest, coalescesEachNameForItself) {
    add(a_, kRegistered);
    add(a_, kUnregistered);
    center_.suspend();
    center_.post(kUnregistered);
    center_.post(kRegistered);
    center_.post(kUnregistered);
    center_.resume();
    EXPECT_THAT(calls(), ElementsAre(std::string("a ") += kRegistered, std::string("a ") += kUnregistered));
}

TEST_F(NotificationCenterTest, forgetsWhatItKeptForARemovedObserver) {
    add(a_, "x");
    center_.suspend();
    center_.post("x");
    center_.removeEveryObserver(&a_);
    center_.resume();
    EXPECT_THAT(calls(), IsEmpty());
}

TEST_F(NotificationCenterTest, callsNobodyThatACallbackBeforeItRemoved) {
    struct Remover {
        NotificationCenter& center;
        const void* other;
    } remover{center_, &a_};
    center_.addObserver(
        &remover,
        [](const void* token, std::string_view) {
            const auto* const self = static_cast<const Remover*>(token);
            self->center.removeEveryObserver(self->other);
        },
        "x", SuspensionBehavior::drop);
    add(a_, "x");
    center_.post("x");
    EXPECT_THAT(calls(), IsEmpty());
}

TEST_F(NotificationCenterTest, mayBeUsedFromACallback) {
    struct User {
        NotificationCenter& center;
        const Observer& other;
        mutable int calls = 0;
    } user{center_, a_};
    center_.addObserver(
        &user,
        [](const void* token, std::string_view) {
            const auto* const self = static_cast<const User*>(token);
            ++self->calls;
            self->center.addObserver(&self->other, Observer::callback, "y", SuspensionBehavior::drop);
            self->center.post("y");
            // Itself: waiting for the callback that is running would never end.
            self->center.removeEveryObserver(self);
        },
        "x", SuspensionBehavior::drop);
    center_.post("x");
    EXPECT_THAT(calls(), ElementsAre("a y"));
    center_.post("x");
    EXPECT_EQ(user.calls, 1);
}

/// An observer whose callback stays inside until it is let go.
struct SlowObserver {
    mutable DispatchSemaphore entered{0};
    mutable DispatchSemaphore letGo{0};
    mutable std::atomic<bool> isDone = false;
    static void callback(const void* token, std::string_view) {
        const auto* const self = static_cast<const SlowObserver*>(token);
        self->entered.signal();
        self->letGo.wait();
        self->isDone = true;
    }
};

TEST_F(NotificationCenterTest, removalWaitsForACallbackThatIsRunning) {
    SlowObserver slow;
    center_.addObserver(&slow, SlowObserver::callback, "x", SuspensionBehavior::drop);
    std::thread poster([&] { center_.post("x"); });
    slow.entered.wait();
    std::thread opener([&] { slow.letGo.signal(); });
    center_.removeEveryObserver(&slow);
    EXPECT_TRUE(slow.isDone);
    opener.join();
    poster.join();
}

TEST_F(NotificationCenterTest, removalDoesNotWaitForAnotherToken) {
    SlowObserver slow;
    center_.addObserver(&slow, SlowObserver::callback, "x", SuspensionBehavior::drop);
    add(a_, "x");
    std::thread poster([&] { center_.post("x"); });
    slow.entered.wait();
    center_.removeEveryObserver(&a_);
    slow.letGo.signal();
    poster.join();
    EXPECT_THAT(calls(), IsEmpty());
}

TEST_F(NotificationCenterTest, postsBesideACallbackThatIsRunning) {
    SlowObserver slow;
    center_.addObserver(&slow, SlowObserver::callback, "x", SuspensionBehavior::drop);
    add(a_, "y");
    std::thread poster([&] { center_.post("x"); });
    slow.entered.wait();
    center_.post("y");
    EXPECT_THAT(calls(), ElementsAre("a y"));
    slow.letGo.signal();
    poster.join();
}

// What a token points to may go as soon as its removal has returned.
TEST_F(NotificationCenterTest, callsNothingThatIsGone) {
    struct Counter {
        mutable std::atomic<std::uint64_t> count = 0;
    };
    std::atomic<bool> ends = false;
    std::vector<std::thread> posters;
    for (int i = 0; i < 2; ++i) {
        posters.emplace_back([&] {
            while (!ends) center_.post("x");
        });
    }
    for (int i = 0; i < 100; ++i) {
        auto counter = std::make_unique<Counter>();
        center_.addObserver(
            counter.get(), [](const void* token, std::string_view) { ++static_cast<const Counter*>(token)->count; },
            "x", SuspensionBehavior::coalesce);
        while (counter->count == 0) std::this_thread::yield();
        center_.removeEveryObserver(counter.get());
    }
    ends = true;
    for (std::thread& poster : posters) poster.join();
}

TEST(NotificationCenter, hasOneDistributedCenter) {
    ASSERT_NE(NotificationCenter::distributedCenter(), nullptr);
    EXPECT_EQ(NotificationCenter::distributedCenter(), NotificationCenter::distributedCenter());
}

}  // namespace
}  // namespace cindral
