#include "provider/LocalChangesObserverContext.h"

#include "provider/HistoryFixture.h"
#include "provider/LocalFileEnumerator.h"
#include "provider/fs/FSChangesEnumerator.h"

namespace cindral::test {
namespace {

class RefusingStorageManager : public RvStorageManager {
public:
    Result<std::uint32_t> permanentStorageForItem(const KsURL& /*url*/, AllocateIfNone allocate) override {
        ++requests;
        EXPECT_EQ(allocate, AllocateIfNone::no) << "listing gives document IDs, not this";
        return KsError::posix(EIO);
    }
    int requests = 0;
};

class LocalChangesObserverContextTest : public HistoryTest {
protected:
    LocalChangesObserverContextTest() {
        manager_.setStore(store_);
        RvStorageManager::replaceDefaultManager(&manager_);
        storage_.file("a.txt");
    }
    ~LocalChangesObserverContextTest() override { RvStorageManager::replaceDefaultManager(nullptr); }

    std::shared_ptr<LocalChangesObserverContext> context(bool shouldUpdateFileIDInPalimp = false) {
        auto made = std::make_shared<LocalChangesObserverContext>(observer_, listed_, shouldUpdateFileIDInPalimp);
        enumerator_ = FSChangesEnumerator::create("fid=1", {storageURL()}, made, FSChangeToken(), 0);
        made->setFSChangesEnumerator(enumerator_);
        return made;
    }
    TesselItems items() { return all(*listed_); }

    RefusingStorageManager manager_;
    const std::shared_ptr<RecordingChangeObserver> observer_ = std::make_shared<RecordingChangeObserver>();
    const std::shared_ptr<LocalFileEnumerator> listed_ =
        LocalFileEnumerator::initWithContainer(kTesselRootContainerItemIdentifier, {storageURL()});
    std::shared_ptr<FSChangesEnumerator> enumerator_;
};

TEST_F(LocalChangesObserverContextTest, passesEverythingOn) {
    const auto made = context();
    made->didUpdateItems(items());
    made->didDeleteItemsWithIdentifiers({"fid=1", "did=2"});
    made->finishEnumeratingChangesUpToSyncAnchor(FSChangeToken().encode(), true);
    EXPECT_EQ(observer_->given.log,
              (std::vector<std::pair<char, std::string>>{{'u', "a.txt"}, {'d', "fid=1"}, {'d', "did=2"}}));
    EXPECT_EQ(observer_->given.anchor, FSChangeToken().encode());
    EXPECT_TRUE(observer_->given.moreComing);
    EXPECT_EQ(manager_.requests, 0);
}

TEST_F(LocalChangesObserverContextTest, refreshesTheStoragesRecordsFirst) {
    const auto made = context(/*shouldUpdateFileIDInPalimp=*/true);
    const TesselItems updated = items();
    made->didUpdateItems(updated);
    EXPECT_EQ(manager_.requests, 1) << "and what it answers, an error, is nothing to the update";
    EXPECT_EQ(observer_->given.updated.size(), 1U);
    EXPECT_TRUE(
        log_.contains(LogLevel::debug, "[DEBUG] updating fileID in palimp for " + updated.front()->description()));
}

TEST_F(LocalChangesObserverContextTest, passesTheFirstEndOnAndNoOther) {
    const auto made = context();
    made->finishEnumeratingWithError(KsError::posix(EIO));
    made->finishEnumeratingWithError(KsError::posix(EACCES));
    made->finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor(), false);
    EXPECT_EQ(observer_->finishes(), 1);
    EXPECT_TRUE(observer_->given.error->isPosix(EIO));
}

TEST_F(LocalChangesObserverContextTest, endsForNobodyOnceItsEnumerationIsGone) {
    const auto made = context();
    // The enumeration holds its observer; let go of by everybody else, it goes.
    std::weak_ptr<FSChangesEnumerator> weak = enumerator_;
    enumerator_.reset();
    ASSERT_TRUE(weak.expired());
    made->finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor(), false);
    made->finishEnumeratingWithError(KsError::posix(EIO));
    EXPECT_EQ(observer_->finishes(), 0);
}

}  // namespace
}  // namespace cindral::test
