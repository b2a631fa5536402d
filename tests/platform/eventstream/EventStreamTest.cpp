#include "platform/eventstream/EventStream.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <mutex>

#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Mutex.h"

namespace cindral {
namespace {

/// A history that a test writes.
class ScriptedHistory final : public EventHistory {
public:
    KsUUID volumeUUID() const override { return {}; }
    std::uint64_t currentEventID() const override {
        const MutexLock lock(mutex_);
        return events_.empty() ? 0 : events_.back().id;
    }
    Result<void> drain() override {
        const MutexLock lock(mutex_);
        if (drainError_) return *drainError_;
        for (Event& event : std::exchange(underWay_, {})) events_.push_back(std::move(event));
        return {};
    }
    bool canReplayAfter(std::uint64_t eventID) const override { return eventID >= begin_; }
    Result<Batch> pathEvents(std::uint64_t after, std::size_t max) const override { return read(after, max, false); }
    Result<Batch> documentEvents(std::uint64_t after, std::size_t max) const override { return read(after, max, true); }
    std::uint64_t addObserver(std::function<void()> observer) override {
        const MutexLock lock(mutex_);
        observer_ = std::move(observer);
        return 1;
    }
    void removeObserver(std::uint64_t /*observer*/) override {
        const MutexLock lock(mutex_);
        observer_ = nullptr;
    }

    void add(std::uint64_t id, std::string path) {
        std::function<void()> observer;
        {
            const MutexLock lock(mutex_);
            events_.push_back({.path = std::move(path), .id = id});
            observer = observer_;
        }
        if (observer) observer();
    }
    /// What the kernel knows and the history doesn't yet.
    void addUnderWay(std::uint64_t id, std::string path) {
        const MutexLock lock(mutex_);
        underWay_.push_back({.path = std::move(path), .id = id});
    }
    void beginAt(std::uint64_t id) { begin_ = id; }
    void failToDrain(const KsError& error) {
        const MutexLock lock(mutex_);
        drainError_ = error;
    }
    bool isObserved() const {
        const MutexLock lock(mutex_);
        return observer_ != nullptr;
    }

private:
    Result<Batch> read(std::uint64_t after, std::size_t max, bool ofDocuments) const {
        const MutexLock lock(mutex_);
        Batch batch;
        batch.isLast = true;
        for (const Event& event : events_) {
            if (event.id <= after || event.path.starts_with("/.docid") != ofDocuments) continue;
            if (batch.events.size() == max) {
                batch.isLast = false;
                break;
            }
            batch.events.push_back(event);
            batch.upTo = event.id;
        }
        if (batch.isLast && !events_.empty()) batch.upTo = events_.back().id;
        return batch;
    }

    mutable Mutex mutex_;
    std::vector<Event> events_ GUARDED_BY(mutex_);
    std::vector<Event> underWay_ GUARDED_BY(mutex_);
    std::optional<KsError> drainError_ GUARDED_BY(mutex_);
    std::function<void()> observer_ GUARDED_BY(mutex_);
    std::uint64_t begin_ = 0;
};

class EventStreamTest : public ::testing::Test {
protected:
    EventStreamTest() { EventHistory::setShared(history_); }
    ~EventStreamTest() override {
        if (stream_) stream_->invalidate();
        // A call that was under way uses what goes now.
        queue_->sync([] {});
        EventHistory::setShared(nullptr);
    }

    void start(std::vector<std::string> paths, std::uint64_t since, std::chrono::milliseconds latency = {}) {
        stream_ = EventStream::create(std::move(paths), since, latency, 0x51, callback());
        run();
    }
    void startOnDocuments(std::uint64_t since) {
        stream_ = EventStream::createRelativeToDevice(7, {"/.docid"}, since, {}, 0x51, callback());
        run();
    }
    EventStream::Callback callback() {
        return [this](std::span<const Event> events) {
            for (const Event& event : events) {
                {
                    const MutexLock lock(mutex_);
                    events_.push_back(event);
                }
                if (event.flags & EventFlags::historyDone) done_.signal();
                came_.signal();
            }
        };
    }
    void run() {
        stream_->setDispatchQueue(queue_);
        stream_->start();
        done_.wait();
    }
    /// Paths of the events so far, flags where there is no path.
    std::vector<std::string> told() {
        const MutexLock lock(mutex_);
        std::vector<std::string> out;
        for (const Event& event : events_) {
            out.push_back(event.flags & EventFlags::historyDone   ? "done"
                          : event.flags & EventFlags::userDropped ? "dropped"
                                                                  : event.path);
        }
        return out;
    }
    void waitFor(std::size_t count) {
        while (told().size() < count) came_.wait();
    }

    std::shared_ptr<ScriptedHistory> history_ = std::make_shared<ScriptedHistory>();
    std::shared_ptr<SerialQueue> queue_ = std::make_shared<SerialQueue>("test.events");
    std::shared_ptr<EventStream> stream_;
    DispatchSemaphore done_{0};
    DispatchSemaphore came_{0};
    Mutex mutex_;
    std::vector<Event> events_ GUARDED_BY(mutex_);
};

using Texts = std::vector<std::string>;

TEST_F(EventStreamTest, replaysWhatCameAfterTheEvent) {
    history_->add(1, "/d/a");
    history_->add(2, "/d/b");
    history_->add(3, "/d/c");
    start({"/d"}, 1);
    EXPECT_EQ(told(), (Texts{"/d/b", "/d/c", "done"}));
}

TEST_F(EventStreamTest, replaysMoreThanItDeliversAtOnce) {
    for (std::uint64_t i = 1; i <= 1'000; ++i) history_->add(i, "/d/" + std::to_string(i));
    start({"/d"}, 0);
    EXPECT_EQ(told().size(), 1'001u);
    EXPECT_EQ(told().back(), "done");
}

TEST_F(EventStreamTest, leavesOutWhatIsNotBelowItsPaths) {
    history_->add(1, "/d/a");
    history_->add(2, "/dd/b");
    history_->add(3, "/e/f/c");
    start({"/d", "/e/f"}, 0);
    EXPECT_EQ(told(), (Texts{"/d/a", "/e/f/c", "done"}));
}

TEST_F(EventStreamTest, saysDoneAfterWhatWasUnderWayAtTheStart) {
    history_->addUnderWay(1, "/d/a");
    start({"/d"}, 0);
    EXPECT_EQ(told(), (Texts{"/d/a", "done"}));
}

TEST_F(EventStreamTest, saysWhereTheHistoryEnded) {
    history_->add(4, "/elsewhere/a");
    start({"/d"}, 1);
    const MutexLock lock(mutex_);
    ASSERT_EQ(events_.size(), 1u);
    EXPECT_EQ(events_[0].id, 4u);
}

TEST_F(EventStreamTest, tellsThatAHistoryCantBeReplayed) {
    history_->beginAt(5);
    history_->add(6, "/d/a");
    start({"/d"}, 3);
    EXPECT_EQ(told(), (Texts{"dropped", "done"}));
}

TEST_F(EventStreamTest, tellsThatAHistoryCantBeBroughtUpToDate) {
    history_->failToDrain(KsError::posix(ENOSPC));
    start({"/d"}, 0);
    EXPECT_EQ(told(), (Texts{"dropped", "done"}));
}

TEST_F(EventStreamTest, tellsOfDroppedEventsWithoutAHistory) {
    EventHistory::setShared(nullptr);
    start({"/d"}, 0);
    EXPECT_EQ(told(), (Texts{"dropped", "done"}));
}

TEST_F(EventStreamTest, deliversWhatComesAfterwards) {
    start({"/d"}, 0);
    history_->add(1, "/d/a");
    history_->add(2, "/d/b");
    waitFor(3);
    EXPECT_EQ(told(), (Texts{"done", "/d/a", "/d/b"}));
}

TEST_F(EventStreamTest, readsTheTreeOfDocuments) {
    history_->add(1, "/d/a");
    history_->add(2, "/.docid/7/changed/1/src=2,dst=3");
    startOnDocuments(0);
    EXPECT_EQ(told(), (Texts{"/.docid/7/changed/1/src=2,dst=3", "done"}));
}

TEST_F(EventStreamTest, deliversNothingOnceItIsStopped) {
    start({"/d"}, 0);
    queue_->sync([this] { stream_->stop(); });
    EXPECT_FALSE(history_->isObserved());
    history_->add(1, "/d/a");
    queue_->sync([] {});
    EXPECT_EQ(told(), (Texts{"done"}));
}

TEST_F(EventStreamTest, canBeStoppedFromItsCallback) {
    history_->add(1, "/d/a");
    std::shared_ptr<EventStream> stream;
    DispatchSemaphore called(0);
    int calls = 0;
    stream = EventStream::create({"/d"}, 0, {}, 0x51, [&](std::span<const Event>) {
        ++calls;
        stream->invalidate();
        called.signal();
    });
    stream->setDispatchQueue(queue_);
    stream->start();
    called.wait();
    queue_->sync([] {});
    EXPECT_EQ(calls, 1);
}

TEST_F(EventStreamTest, knowsNoPositionWithoutAHistoryAndAStore) {
    EventHistory::setShared(nullptr);
    EXPECT_EQ(EventStream::currentEventID(), 0u);
}

}  // namespace
}  // namespace cindral
