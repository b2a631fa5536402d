#include "provider/ChangesAhead.h"

#include <fmt/format.h>
#include <gmock/gmock.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <functional>
#include <memory>
#include <thread>

#include "provider/HistoryFixture.h"
#include "provider/LocalFileEnumerator.h"

namespace cindral::test {
namespace {

// What was found is handed over as it came.

TEST(ChangesAhead, handsOverWhatWasFoundInItsOrder) {
    ChangesAhead ahead(FSChangeToken(), 7);
    EXPECT_EQ(ahead.currentEventID(), 7U);
    ahead.didDeleteItemsWithIdentifiers({"fid=1"});
    ahead.didUpdateItems({});
    ahead.didDeleteItemsWithIdentifiers({"fid=2", "fid=3"});
    int calls = 0;
    ahead.whenDone([&] { ++calls; });
    EXPECT_EQ(calls, 0) << "it is under way";
    ahead.finishEnumeratingChangesUpToSyncAnchor(Bytes(3, std::byte{1}), true);
    EXPECT_EQ(calls, 1);
    RecordingChangeObserver observer;
    EXPECT_TRUE(ahead.handTo(observer));
    EXPECT_EQ(observer.given.deleted, (std::vector<TesselItemIdentifier>{"fid=1", "fid=2", "fid=3"}));
    EXPECT_EQ(observer.given.anchor, Bytes(3, std::byte{1}));
    EXPECT_TRUE(observer.given.moreComing);
    EXPECT_EQ(observer.finishes(), 1);
}

TEST(ChangesAhead, callsBackAtOnceWhenItIsDone) {
    ChangesAhead ahead(FSChangeToken(), 0);
    ahead.finishEnumeratingChangesUpToSyncAnchor({}, false);
    bool isCalled = false;
    ahead.whenDone([&] { isCalled = true; });
    EXPECT_TRUE(isCalled);
}

TEST(ChangesAhead, keepsAnErrorToItselfUnlessItWasStopped) {
    RecordingChangeObserver observer;
    ChangesAhead failed(FSChangeToken(), 0);
    failed.finishEnumeratingWithError(KsError::posix(EIO));
    EXPECT_FALSE(failed.handTo(observer));
    EXPECT_EQ(observer.finishes(), 0);
    ChangesAhead stopped(FSChangeToken(), 0);
    stopped.finishEnumeratingWithError(KsError::posix(ECANCELED));
    EXPECT_TRUE(stopped.handTo(observer));
    EXPECT_TRUE(observer.given.error->isPosix(ECANCELED));
}

/// An enumerator that reads ahead, beside one that doesn't.
class ReadingAheadTest : public HistoryTest {
protected:
    ReadingAheadTest() {
        history_->onRead([this] {
            const int number = ++reads_;
            if (onRead_) onRead_(number);
        });
    }
    // What is read ahead for nobody ends before what it uses.
    ~ReadingAheadTest() override { ahead_->invalidate(); }

    std::shared_ptr<LocalFileEnumerator> workingSet(LocalFileEnumerator::ReadsAhead readsAhead) {
        return LocalFileEnumerator::initWithContainer(kTesselWorkingSetContainerItemIdentifier, {storageURL()},
                                                      readsAhead);
    }
    void files(int count) {
        for (int i = 0; i < count; ++i) {
            storage_.file(nameOf(i));
            changed(nameOf(i));
        }
    }
    void holdTheSecondReading() {
        onRead_ = [this](int number) {
            if (number != 2) return;
            isReading_.signal();
            mayRead_.wait();
        };
    }
    static std::string nameOf(int i) { return fmt::format("file{:03}", i); }
    TesselSyncAnchor begin() const {
        FSChangeToken token;
        token.deviceUUID = store_->uuid();
        token.streamEventID = since_;
        return token.encode();
    }

    const std::uint64_t since_ = history_->currentEventID();
    const std::shared_ptr<LocalFileEnumerator> ahead_ = workingSet(LocalFileEnumerator::ReadsAhead::yes);
    std::atomic<int> reads_ = 0;
    std::function<void(int)> onRead_;  ///< with the number of the reading
    DispatchSemaphore isReading_{0};
    DispatchSemaphore mayRead_{0};
};

TEST_F(ReadingAheadTest, givesTheSameBatchesAndReadsNothingTwice) {
    files(350);
    const auto plain = workingSet(LocalFileEnumerator::ReadsAhead::no);
    std::vector<GivenChanges> expected;
    TesselSyncAnchor anchor = begin();
    do {
        expected.push_back(changes(*plain, anchor));
        anchor = *expected.back().anchor;
    } while (expected.back().moreComing);
    ASSERT_EQ(expected.size(), 4U);
    const int reads = reads_.exchange(0);
    anchor = begin();
    for (const GivenChanges& one : expected) {
        const GivenChanges given = changes(*ahead_, anchor);
        EXPECT_EQ(given.log, one.log);
        EXPECT_EQ(given.anchor, one.anchor);
        EXPECT_EQ(given.moreComing, one.moreComing);
        anchor = *given.anchor;
    }
    EXPECT_EQ(reads_, reads);
}

TEST_F(ReadingAheadTest, givesNothingThatIsOlderThanTheQuestion) {
    files(350);
    const GivenChanges first = changes(*ahead_, begin());
    // What was read ahead is there by then: each batch drains twice, and who asks for the next once before it is given it.
    history_->onDrain([&]() -> Result<void> {
        if (history_->drains() != 5) return {};
        storage_.file("file120", std::string(1000, 'x'));
        changed("file120");
        return {};
    });
    const GivenChanges second = changes(*ahead_, *first.anchor);
    history_->onDrain(nullptr);
    const auto item = std::ranges::find(second.updated, "file120", [](const auto& one) { return one->filename(); });
    ASSERT_NE(item, second.updated.end());
    EXPECT_EQ((*item)->documentSize(), 1000U);
}

TEST_F(ReadingAheadTest, endsWithTheViewOfAListingWhateverHappensBetweenTheBatches) {
    ClientView view(all(*ahead_), anchorOf(*ahead_));
    files(450);
    for (int round = 0; round < 20; ++round) {
        const GivenChanges given = changes(*ahead_, view.anchor());
        view.apply(given);
        if (!given.moreComing) break;
        if (round % 2 == 1) continue;
        remove(nameOf(round * 7 + 110));
        move(nameOf(round * 7 + 210), fmt::format("moved {}", round));
    }
    view.apply(allChanges(*ahead_, view.anchor()));
    EXPECT_EQ(view.contents(), ClientView::contentsOf(all(*ahead_)));
}

TEST_F(ReadingAheadTest, readsInVainOnlyOnceWhereMuchIsHappening) {
    files(950);
    TesselSyncAnchor anchor = begin();
    int batches = 0;
    for (bool moreComing = true; moreComing; ++batches) {
        const GivenChanges given = changes(*ahead_, anchor);
        anchor = *given.anchor;
        moreComing = given.moreComing;
        if (moreComing) changed(nameOf(batches));
    }
    ASSERT_GT(batches, 5);
    // One for each batch, one for the batch that was read ahead, and one that finds the end.
    EXPECT_LE(reads_, batches + 2);
}

TEST_F(ReadingAheadTest, asksAnewFromAnotherAnchor) {
    files(350);
    const GivenChanges first = changes(*ahead_, begin());
    const GivenChanges again = changes(*ahead_, begin());
    EXPECT_EQ(again.log, first.log);
    EXPECT_EQ(changes(*ahead_, *again.anchor).log.size(), 100U);
}

TEST_F(ReadingAheadTest, leavesAScanToWhoAsks) {
    files(150);
    storage_.folder("scanned");
    storage_.file("scanned/in it");
    record("scanned");
    Event scan;
    scan.path = storageURL().path() + "/scanned";
    scan.flags = EventFlags::mustScanSubdirectories;
    history_->add(scan);
    const GivenChanges first = changes(*ahead_, begin());
    EXPECT_TRUE(first.moreComing);
    const GivenChanges rest = allChanges(*ahead_, *first.anchor);
    // Two for each batch, one for what was read ahead and given up before its second reader, one for the question.
    EXPECT_EQ(history_->drains(), 6);
    EXPECT_THAT(rest.updatedNames(), ::testing::Contains("in it"));
    EXPECT_EQ(rest.updatedNames().size(), 52U);
}

TEST_F(ReadingAheadTest, whoWaitsForWhatIsReadAheadIsToldThatItWasStopped) {
    files(350);
    holdTheSecondReading();
    const GivenChanges first = changes(*ahead_, begin());
    isReading_.wait();
    const auto observer = std::make_shared<RecordingChangeObserver>();
    ahead_->enumerateChangesForObserver(observer, *first.anchor);
    EXPECT_EQ(observer->finishes(), 0);
    ahead_->stop();
    changed(nameOf(1));
    mayRead_.signal();
    const GivenChanges& given = observer->wait();
    ASSERT_TRUE(given.error);
    EXPECT_TRUE(given.error->isPosix(ECANCELED));
    EXPECT_TRUE(given.log.empty());
    EXPECT_EQ(changes(*ahead_, *first.anchor).log.size(), 100U) << "it can be asked again";
}

TEST_F(ReadingAheadTest, whoIsBeingGivenWhatWasReadAheadIsStoppedToo) {
    files(350);
    const GivenChanges first = changes(*ahead_, begin());
    history_->onDrain([&]() -> Result<void> {
        if (history_->drains() == 5) ahead_->stop();
        return {};
    });
    const GivenChanges stopped = changes(*ahead_, *first.anchor);
    history_->onDrain(nullptr);
    ASSERT_TRUE(stopped.error);
    EXPECT_TRUE(stopped.error->isPosix(ECANCELED));
    EXPECT_TRUE(stopped.log.empty());
}

TEST_F(ReadingAheadTest, endsWhatItReadsBeforeItIsLetGoOf) {
    files(350);
    holdTheSecondReading();
    (void)changes(*ahead_, begin());
    isReading_.wait();
    std::atomic<bool> isInvalidated = false;
    std::thread thread([&] {
        ahead_->invalidate();
        isInvalidated = true;
    });
    EXPECT_FALSE(isInvalidated);
    mayRead_.signal();
    thread.join();
    EXPECT_EQ(reads_, 2);
}

}  // namespace
}  // namespace cindral::test
