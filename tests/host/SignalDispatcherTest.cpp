#include "host/SignalDispatcher.h"

#include <gtest/gtest.h>

#include <thread>

#include "platform/foundation/Dispatch.h"

namespace cindral {
namespace {

TEST(SignalDispatcher, tellsEverySubscriber) {
    SignalDispatcher dispatcher;
    std::vector<std::string> one;
    std::vector<std::string> other;
    const auto subscription = dispatcher.subscribe([&](const std::string& container) { one.push_back(container); });
    dispatcher.subscribe([&](const std::string& container) { other.push_back(container); });
    dispatcher.signalEnumerator("fid=1", {});
    dispatcher.unsubscribe(subscription);
    dispatcher.unsubscribe(subscription);
    dispatcher.signalEnumerator("fid=2", {});
    EXPECT_EQ(one, (std::vector<std::string>{"fid=1"}));
    EXPECT_EQ(other, (std::vector<std::string>{"fid=1", "fid=2"}));
}

TEST(SignalDispatcher, completesAtOnce) {
    SignalDispatcher dispatcher;
    int completions = 0;
    const auto complete = [&](const std::optional<KsError>& error) { completions += error ? 0 : 1; };
    dispatcher.signalEnumerator("fid=1", complete);
    dispatcher.deleteSearchableItems({"com.example"}, complete);
    dispatcher.deleteSearchableItems({"com.example"}, {});
    EXPECT_EQ(completions, 2);
}

TEST(SignalDispatcher, isUnsubscribedFromWhenNoCallIsUnderWay) {
    SignalDispatcher dispatcher;
    DispatchSemaphore isCalled(0);
    DispatchSemaphore goesOn(0);
    std::atomic<bool> isOver = false;
    const auto subscription = dispatcher.subscribe([&](const std::string&) {
        isCalled.signal();
        goesOn.wait();
        isOver = true;
    });
    std::thread signaller([&] { dispatcher.signalEnumerator("fid=1", {}); });
    isCalled.wait();
    std::thread other([&] { goesOn.signal(); });
    dispatcher.unsubscribe(subscription);
    EXPECT_TRUE(isOver);
    signaller.join();
    other.join();
}

}  // namespace
}  // namespace cindral
