#include "provider/fs/FSChangesNotifier.h"

#include <fmt/format.h>

#include "platform/tessel/TesselManager.h"
#include "provider/HistoryFixture.h"
#include "provider/LocalFileEnumerator.h"

namespace cindral::test {
namespace {

/// A host that writes signals down, and answers them as the test says.
class SignalledHost : public TesselManager::Host {
public:
    void signalEnumerator(const TesselItemIdentifier& container, TesselManager::Completion completion) override {
        {
            const MutexLock lock(mutex_);
            signals_.push_back(container);
        }
        if (answers) {
            completion(error);
        } else {
            const MutexLock lock(mutex_);
            kept_.push_back(std::move(completion));
        }
        signalled.signal();
    }
    void deleteSearchableItems(const std::vector<std::string>& /*domains*/,
                               TesselManager::Completion completion) override {
        completion(std::nullopt);
    }
    std::vector<std::string> signals() const {
        const MutexLock lock(mutex_);
        return signals_;
    }
    std::vector<TesselManager::Completion> takeKept() {
        const MutexLock lock(mutex_);
        return std::exchange(kept_, {});
    }

    std::atomic<bool> answers = true;
    std::optional<KsError> error;
    DispatchSemaphore signalled{0};

private:
    mutable Mutex mutex_;
    std::vector<std::string> signals_ GUARDED_BY(mutex_);
    std::vector<TesselManager::Completion> kept_ GUARDED_BY(mutex_);
};

class FSChangesNotifierTest : public HistoryTest {
protected:
    FSChangesNotifierTest() { TesselManager::defaultManager().setHost(host_); }
    ~FSChangesNotifierTest() override { TesselManager::defaultManager().setHost(nullptr); }

    std::shared_ptr<FSChangesNotifier> notifier(std::chrono::milliseconds answerWait = std::chrono::seconds(60)) {
        auto made = FSChangesNotifier::create(kTesselRootContainerItemIdentifier, {storageURL()},
                                              {.answerWait = answerWait, .startDelay = std::chrono::milliseconds(0)});
        made->setClient(client_);
        return made;
    }
    void waitForLine(std::string_view part) {
        while (log_.count(part) == 0) std::this_thread::yield();
    }

    const std::shared_ptr<SignalledHost> host_ = std::make_shared<SignalledHost>();
    const std::shared_ptr<LocalFileEnumerator> client_ =
        LocalFileEnumerator::initWithContainer(kTesselRootContainerItemIdentifier, {storageURL()});
};

using FSChangesNotifierDeathTest = FSChangesNotifierTest;
using Strings = std::vector<std::string>;

TEST_F(FSChangesNotifierDeathTest, needsAURL) {
    EXPECT_DEATH((void)FSChangesNotifier::create("fid=1", {}), "require at least one URL to init a change notifier");
}

TEST_F(FSChangesNotifierTest, needsAVolume) {
    RvStorageManager::defaultManager().setStore(nullptr);
    EXPECT_EQ(FSChangesNotifier::create("fid=1", {storageURL()}), nullptr);
    EXPECT_TRUE(
        log_.contains(LogLevel::error, "[ERROR] can't get volume UUID for \"" + storageURL().description() + "\""));
    RvStorageManager::defaultManager().setStore(store_);
    EXPECT_EQ(notifier()->deviceUUID(), store_->uuid());
}

TEST_F(FSChangesNotifierTest, signalsItsContainer) {
    const auto made = notifier();
    made->start();
    storage_.file("a.txt");
    const std::uint64_t eventID = changed("a.txt");
    host_->signalled.wait();
    EXPECT_EQ(host_->signals(), (Strings{kTesselRootContainerItemIdentifier}));
    waitForLine(fmt::format("[DEBUG] notified changes up to FSEventID {}", eventID));
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, " notifies changes on [" + storageURL().description() + "]"));
    made->stop();
    EXPECT_EQ(history_->observers(), 0U);
}

TEST_F(FSChangesNotifierTest, signalsOnceUntilTheHostHasEnumerated) {
    const auto made = notifier();
    made->start();
    storage_.file("a.txt");
    changed("a.txt");
    host_->signalled.wait();
    for (int i = 0; i < 10; ++i) changed("a.txt");
    made->hostDidEnumerate();
    // Reported after the ten, and the first to be signalled since.
    changed("a.txt");
    host_->signalled.wait();
    EXPECT_LE(host_->signals().size(), 2U);
    made->stop();
}

TEST_F(FSChangesNotifierTest, neverSignalsWhatCameBeforeItWasMade) {
    storage_.file("a.txt");
    changed("a.txt");
    const auto made = notifier();
    made->start();
    while (log_.count("[INFO] done processing history") == 0) std::this_thread::yield();
    made->stop();
    EXPECT_TRUE(host_->signals().empty());
}

TEST_F(FSChangesNotifierTest, signalsWhatCameBetweenItsMakingAndItsStart) {
    const auto made = notifier();
    storage_.file("a.txt");
    changed("a.txt");
    made->start();
    host_->signalled.wait();
    made->stop();
}

TEST_F(FSChangesNotifierTest, signalsOnlyWhatItsContainerLists) {
    storage_.file("folder/a.txt");
    const auto made = notifier();
    changed("folder/a.txt");
    made->start();
    while (log_.count("[INFO] done processing history") == 0) std::this_thread::yield();
    EXPECT_TRUE(host_->signals().empty());
    changed("folder");
    host_->signalled.wait();
    made->stop();
}

TEST_F(FSChangesNotifierTest, signalsLostEventsScansAndMoves) {
    for (const auto& [path, flags] :
         std::vector<std::pair<std::string, EventFlags>>{{storage_.path(), EventFlags::kernelDropped},
                                                         {storage_.path(), EventFlags::mustScanSubdirectories},
                                                         {storage_.outside().path(), EventFlags::removed}}) {
        const auto made = notifier();
        Event event;
        event.path = path;
        event.flags = flags;
        event.fileID = FileID{1};
        history_->add(event);
        made->start();
        host_->signalled.wait();
        made->stop();
    }
}

TEST_F(FSChangesNotifierTest, aHostThatDoesNotAnswerIsSignalledAgain) {
    host_->answers = false;
    const auto made = notifier(std::chrono::milliseconds(0));
    storage_.file("a.txt");
    const std::uint64_t first = changed("a.txt");
    made->start();
    host_->signalled.wait();
    waitForLine(fmt::format("[DEBUG] notifying changes up to FSEventID {} timed out", first));
    // The answers that come too late, and twice, are nobody's any more.
    for (auto& completion : host_->takeKept()) {
        completion(std::nullopt);
        completion(KsError::posix(EIO));
    }
    const std::uint64_t second = changed("a.txt");
    host_->signalled.wait();
    waitForLine(fmt::format("[DEBUG] notifying changes up to FSEventID {} timed out", second));
    made->stop();
    EXPECT_EQ(log_.count("can't signal changes for"), 0U);
}

TEST_F(FSChangesNotifierTest, aRefusedSignalIsSentAgain) {
    host_->error = KsError::posix(EIO);
    const auto made = notifier();
    storage_.file("a.txt");
    changed("a.txt");
    made->start();
    host_->signalled.wait();
    EXPECT_TRUE(
        log_.contains(LogLevel::error, "[ERROR] can't signal changes for \"TesselRootContainerItemIdentifier\"; " +
                                           KsError::posix(EIO).description()));
    changed("a.txt");
    host_->signalled.wait();
    made->stop();
}

TEST_F(FSChangesNotifierTest, signalsForNobodyOnceItsClientIsGone) {
    const auto made = notifier();
    made->setClient({});
    storage_.file("a.txt");
    changed("a.txt");
    made->start();
    while (log_.count("[INFO] done processing history") == 0) std::this_thread::yield();
    made->stop();
    EXPECT_TRUE(host_->signals().empty());
}

TEST_F(FSChangesNotifierTest, costsNoStreamWhenItIsStoppedAtOnce) {
    const auto made = FSChangesNotifier::create(kTesselRootContainerItemIdentifier, {storageURL()});
    made->start();
    made->stop();
    EXPECT_EQ(history_->observers(), 0U);
    EXPECT_EQ(history_->drains(), 0);
}

// An enumerator's live updates.

TEST_F(FSChangesNotifierTest, anEnumeratorSignalsFromStartToStop) {
    storage_.file("a.txt");
    client_->start();
    client_->start();
    changed("a.txt");
    host_->signalled.wait();
    (void)allChanges(*client_, anchorOf(*client_));
    changed("a.txt");
    host_->signalled.wait();
    (void)all(*client_);
    changed("a.txt");
    host_->signalled.wait();
    EXPECT_EQ(host_->signals().size(), 3U) << "each time after the host has enumerated";
    client_->invalidate();
    while (history_->observers() > 0) std::this_thread::yield();
}

}  // namespace
}  // namespace cindral::test
