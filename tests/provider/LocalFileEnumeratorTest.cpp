#include "provider/LocalFileEnumerator.h"

#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <set>

#include "platform/eventstream/EventStream.h"
#include "platform/foundation/Dispatch.h"
#include "provider/HistoryFixture.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/LocalTesselKitError.h"
#include "provider/fs/FSListingPositions.h"

namespace cindral::test {
namespace {

class LocalFileEnumeratorTest : public ProviderTest {
protected:
    std::shared_ptr<LocalFileEnumerator> enumerator(std::string_view folder = "") {
        if (folder.empty())
            return LocalFileEnumerator::initWithContainer(kTesselRootContainerItemIdentifier, {storageURL()});
        KsURL container = url(folder);
        return LocalFileEnumerator::initWithContainer(*itemIdentifier(container), {container});
    }
    std::shared_ptr<LocalFileEnumerator> workingSet() {
        return LocalFileEnumerator::initWithContainer(kTesselWorkingSetContainerItemIdentifier, {storageURL()});
    }
    void files(int count) {
        for (int i = 0; i < count; ++i) storage_.file("file" + std::to_string(i));
    }
    std::vector<std::string> allNames(TesselEnumerator& listed) {
        std::vector<std::string> names;
        for (const auto& item : all(listed)) names.push_back(item->filename());
        std::ranges::sort(names);
        return names;
    }
    static FSChangeToken anchorOf(TesselEnumerator& listed) {
        std::optional<TesselSyncAnchor> anchor;
        listed.currentSyncAnchorWithCompletionHandler(
            [&](std::optional<TesselSyncAnchor> given) { anchor = std::move(given); });
        return *FSChangeToken::decode(*anchor);
    }
    static void expectExpired(const ListedPage& page) {
        ASSERT_TRUE(page.error);
        EXPECT_TRUE(page.error->is("TesselErrorDomain", -1002)) << page.error->description();
        EXPECT_TRUE(page.items.empty());
    }
    LogCapture log_;
};

using LocalFileEnumeratorDeathTest = LocalFileEnumeratorTest;

TEST_F(LocalFileEnumeratorDeathTest, needsAURL) {
    EXPECT_DEATH((void)LocalFileEnumerator::initWithContainer("fid=1", {}),
                 "can't create enumerator for an empty list of URLs");
}

TEST_F(LocalFileEnumeratorTest, twoHundredEntriesAreAFullPageAndAnEmptyOne) {
    files(200);
    const auto listed = enumerator();
    const ListedPage first = firstPage(*listed);
    EXPECT_EQ(first.items.size(), 200U);
    ASSERT_TRUE(first.next);
    EXPECT_EQ(FSChangeToken::decode(*first.next)->offset, 200U);
    const ListedPage second = page(*listed, *first.next);
    EXPECT_FALSE(second.error);
    EXPECT_TRUE(second.items.empty());
    EXPECT_FALSE(second.next);
}

TEST_F(LocalFileEnumeratorTest, oneLessIsOnePage) {
    files(199);
    const ListedPage only = firstPage(*enumerator());
    EXPECT_EQ(only.items.size(), 199U);
    EXPECT_FALSE(only.next);
}

TEST_F(LocalFileEnumeratorTest, trashIsNeverListedAndCounts) {
    files(199);
    storage_.file(".Trash/x");
    const auto listed = enumerator();
    const ListedPage first = firstPage(*listed);
    EXPECT_EQ(first.items.size(), 199U);
    ASSERT_TRUE(first.next) << "the page is full all the same";
    EXPECT_EQ(FSChangeToken::decode(*first.next)->offset, 200U);
    EXPECT_FALSE(find(all(*listed), ".Trash"));
}

TEST_F(LocalFileEnumeratorTest, pagesListEverythingOnce) {
    files(1050);
    const TesselItems items = all(*enumerator());
    std::set<std::string> names;
    std::set<std::string> identifiers;
    for (const auto& item : items) {
        names.insert(item->filename());
        identifiers.insert(item->itemIdentifier());
    }
    EXPECT_EQ(items.size(), 1050U);
    EXPECT_EQ(names.size(), 1050U);
    EXPECT_EQ(identifiers.size(), 1050U);
}

TEST_F(LocalFileEnumeratorTest, aListingIsWhatALookupSays) {
    storage_.file("a.txt", "hello");
    storage_.folder("folder/inner");
    storage_.folder("report.folio");
    ASSERT_EQ(::symlink("a.txt", (storage_ / "link").c_str()), 0);
    for (const auto& item : all(*enumerator())) {
        KsURL looked = url(item->filename());
        EXPECT_EQ(itemIdentifier(looked), item->itemIdentifier());
        EXPECT_EQ(fileURLWithItemIdentifier(item->itemIdentifier()), looked);
        EXPECT_EQ(item->parentItemIdentifier(), kTesselRootContainerItemIdentifier);
        EXPECT_EQ(*item->fileURL(), looked);
    }
}

TEST_F(LocalFileEnumeratorTest, bothInitialPagesListAlike) {
    files(10);
    const auto listed = enumerator();
    EXPECT_EQ(page(*listed, tesselInitialPageSortedByDate()).names(),
              page(*listed, tesselInitialPageSortedByName()).names());
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, "enumerate items for Documents with page initialPageSortedByDate"));
}

TEST_F(LocalFileEnumeratorTest, listingCostsOneTransactionAPageAndThenNone) {
    files(450);
    const std::uint64_t before = store_->transactionCount();
    (void)all(*enumerator());
    EXPECT_EQ(store_->transactionCount() - before, 3U);
    (void)all(*enumerator());
    EXPECT_EQ(store_->transactionCount() - before, 3U);
}

TEST_F(LocalFileEnumeratorTest, listingLeavesFilesAsTheyAre) {
    const std::string path = storage_.file("folder/noextension", "#!/bin/sh\n");
    struct stat before;
    struct stat folderBefore;
    ASSERT_EQ(::stat(path.c_str(), &before), 0);
    ASSERT_EQ(::stat((storage_ / "folder").c_str(), &folderBefore), 0);
    (void)all(*workingSet());
    struct stat after;
    struct stat folderAfter;
    ASSERT_EQ(::stat(path.c_str(), &after), 0);
    ASSERT_EQ(::stat((storage_ / "folder").c_str(), &folderAfter), 0);
    EXPECT_EQ(KsDate::from(after.st_atim), KsDate::from(before.st_atim));
    EXPECT_EQ(KsDate::from(after.st_ctim), KsDate::from(before.st_ctim));
    EXPECT_EQ(KsDate::from(folderAfter.st_atim), KsDate::from(folderBefore.st_atim));
    EXPECT_EQ(KsDate::from(folderAfter.st_ctim), KsDate::from(folderBefore.st_ctim));
}

TEST_F(LocalFileEnumeratorTest, aPageThatIsNoTokenIsExpired) {
    files(3);
    for (const std::string_view bytes : {"", "x", "bplist00", "TesselInitialPage"}) {
        const auto view = bytesOf(bytes);
        expectExpired(page(*enumerator(), TesselPage(view.begin(), view.end())));
    }
    EXPECT_EQ(log_.count("[ERROR] can't create change token from anchor data, resetting"), 4U);
}

TEST_F(LocalFileEnumeratorTest, aPageOfAnotherVolumeIsServedFromTheStart) {
    files(250);
    const auto listed = enumerator();
    FSChangeToken token = *FSChangeToken::decode(*firstPage(*listed).next);
    token.deviceUUID = KsUUID::random();
    const ListedPage restarted = page(*listed, token.encode());
    EXPECT_FALSE(restarted.error);
    EXPECT_EQ(restarted.items.size(), 200U);
    ASSERT_TRUE(restarted.next);
    EXPECT_EQ(FSChangeToken::decode(*restarted.next)->offset, 200U);
    EXPECT_EQ(FSChangeToken::decode(*restarted.next)->deviceUUID, store_->uuid());
    EXPECT_TRUE(log_.containsPart(LogLevel::info, "[INFO] device UUID changed ("));
}

TEST_F(LocalFileEnumeratorTest, aPageExpiresWhenSomethingChanged) {
    files(250);
    const auto listed = enumerator();
    const ListedPage first = firstPage(*listed);
    ASSERT_EQ(::unlink((storage_ / "file17").c_str()), 0);
    expectExpired(page(*listed, *first.next));
    EXPECT_TRUE(log_.contains(LogLevel::info,
                              "[INFO] can't replay historical FSEvents, need to re-start gather phase from scratch"));
    EXPECT_EQ(all(*listed).size(), 249U);
    expectExpired(page(*listed, *first.next));
}

TEST_F(LocalFileEnumeratorTest, aPageOfAnEarlierProcessIsExpired) {
    files(250);
    FSChangeToken token = *FSChangeToken::decode(*firstPage(*enumerator()).next);
    token.streamEventID += 1'000'000;
    expectExpired(page(*enumerator(), token.encode()));
}

TEST_F(LocalFileEnumeratorTest, twoListingsBetweenWhichSomethingChangedAreToldApart) {
    files(250);
    const auto listed = enumerator();
    const ListedPage older = firstPage(*listed);
    storage_.file("new");
    const ListedPage newer = firstPage(*listed);
    EXPECT_NE(FSChangeToken::decode(*older.next)->streamEventID, FSChangeToken::decode(*newer.next)->streamEventID);
    expectExpired(page(*listed, *older.next));
    EXPECT_FALSE(page(*listed, *newer.next).error);
}

TEST_F(LocalFileEnumeratorTest, pagesGoOnThroughAnotherEnumeratorOfTheSameFolder) {
    files(450);
    const ListedPage first = firstPage(*enumerator());
    const ListedPage second = page(*enumerator(), *first.next);
    EXPECT_EQ(second.items.size(), 200U);
    const ListedPage third = page(*enumerator(), *second.next);
    EXPECT_EQ(third.items.size(), 50U);
    EXPECT_FALSE(third.next);
}

TEST_F(LocalFileEnumeratorTest, aPageCanBeAskedForTwice) {
    files(450);
    const auto listed = enumerator();
    const ListedPage first = firstPage(*listed);
    const ListedPage second = page(*listed, *first.next);
    EXPECT_EQ(page(*listed, *first.next).names(), second.names());
    EXPECT_EQ(page(*listed, *first.next).next, second.next);
}

TEST_F(LocalFileEnumeratorTest, pageAndAnchorDifferInOffsetOnly) {
    files(200);
    const auto listed = enumerator();
    const FSChangeToken page = *FSChangeToken::decode(*firstPage(*listed).next);
    FSChangeToken anchor = anchorOf(*listed);
    EXPECT_EQ(anchor.offset, 0U);
    EXPECT_EQ(anchor.deviceUUID, store_->uuid());
    anchor.offset = page.offset;
    EXPECT_EQ(anchor, page);
}

TEST_F(LocalFileEnumeratorTest, theAppLibraryVersionIsCarriedThrough) {
    files(450);
    const auto listed = enumerator();
    FSChangeToken token = *FSChangeToken::decode(*firstPage(*listed).next);
    token.appLibraryVersionToken = 42;
    const ListedPage next = page(*listed, token.encode());
    EXPECT_EQ(FSChangeToken::decode(*next.next)->appLibraryVersionToken, 42U);
}

TEST_F(LocalFileEnumeratorTest, withoutAStoreThereIsNoVolume) {
    files(1);
    RvStorageManager::defaultManager().setStore(nullptr);
    const ListedPage page = firstPage(*enumerator());
    ASSERT_TRUE(page.error);
    EXPECT_EQ(*page.error, errorFor(LocalTesselKitError::unableToGetDeviceUUID));
    EXPECT_TRUE(log_.contains(LogLevel::error, "[ERROR] can't get volume UUID for " + storageURL().description()));
    bool called = false;
    enumerator()->currentSyncAnchorWithCompletionHandler([&](const std::optional<TesselSyncAnchor>& anchor) {
        called = true;
        EXPECT_FALSE(anchor);
    });
    EXPECT_TRUE(called);
    EXPECT_TRUE(
        log_.contains(LogLevel::error, "[ERROR] can't get volume UUID for \"" + storageURL().description() + "\""));
}

TEST_F(LocalFileEnumeratorTest, aContainerThatIsGoneIsAPosixError) {
    storage_.folder("folder");
    const auto listed = enumerator("folder");
    ASSERT_EQ(::rmdir((storage_ / "folder").c_str()), 0);
    const ListedPage gone = firstPage(*listed);
    ASSERT_TRUE(gone.error);
}

TEST_F(LocalFileEnumeratorTest, aFileIsNoContainer) {
    storage_.file("a.txt");
    const ListedPage page = firstPage(*enumerator("a.txt"));
    ASSERT_TRUE(page.error);
    EXPECT_TRUE(page.error->isPosix(ENOTDIR)) << page.error->description();
}

TEST_F(LocalFileEnumeratorTest, anUnreadableFolderIsAPosixError) {
    storage_.file("secret/a.txt");
    storage_.file("unsearchable/a.txt");
    const auto secret = enumerator("secret");
    const auto unsearchable = enumerator("unsearchable");
    ASSERT_EQ(::chmod((storage_ / "secret").c_str(), 0), 0);
    ASSERT_EQ(::chmod((storage_ / "unsearchable").c_str(), 0444), 0);
    if (::geteuid() == 0) {
        ASSERT_EQ(::chmod(storage_.outside().path().c_str(), 0755), 0);
        ASSERT_EQ(::chmod(storage_.path().c_str(), 0755), 0);
        ASSERT_EQ(::seteuid(65534), 0);
    }
    const ListedPage unreadable = firstPage(*secret);
    const ListedPage unseen = firstPage(*unsearchable);
    if (::getuid() == 0) {
        ASSERT_EQ(::seteuid(0), 0);
    }
    ::chmod((storage_ / "secret").c_str(), 0700);
    ::chmod((storage_ / "unsearchable").c_str(), 0700);
    ASSERT_TRUE(unreadable.error);
    EXPECT_TRUE(unreadable.error->isPosix(EACCES)) << unreadable.error->description();
    ASSERT_TRUE(unseen.error);
    EXPECT_TRUE(unseen.error->isPosix(EACCES)) << unseen.error->description();
}

TEST_F(LocalFileEnumeratorTest, aFolderListsItsDirectChildren) {
    storage_.file("folder/a.txt");
    storage_.file("folder/inner/b.txt");
    EXPECT_EQ(allNames(*enumerator("folder")), (std::vector<std::string>{"a.txt", "inner"}));
}

TEST_F(LocalFileEnumeratorTest, aPackageListsItsDirectChildren) {
    storage_.file("report.folio/index");
    storage_.file("report.folio/Media/a.png");
    EXPECT_EQ(allNames(*enumerator("report.folio")), (std::vector<std::string>{"Media", "index"}));
    EXPECT_EQ(allNames(*enumerator("report.folio/Media")), (std::vector<std::string>{"a.png"}));
}

TEST_F(LocalFileEnumeratorTest, theWorkingSetListsEverythingBelow) {
    storage_.file("folder/inner/b.txt");
    storage_.file("report.folio/index");
    storage_.file(".Trash/old.txt");
    storage_.file(".Trash/gone/older.txt");
    const auto listed = workingSet();
    EXPECT_EQ(allNames(*listed),
              (std::vector<std::string>{"b.txt", "folder", "gone", "inner", "old.txt", "older.txt", "report.folio"}));
    EXPECT_TRUE(find(all(*listed), "older.txt")->isTrashed());
    EXPECT_EQ(find(all(*listed), "b.txt")->parentItemIdentifier(), find(all(*listed), "inner")->itemIdentifier());
}

TEST_F(LocalFileEnumeratorTest, allDirectoriesListsPlainFolders) {
    storage_.file("folder/inner/b.txt");
    storage_.file("report.folio/Media/a.png");
    ASSERT_EQ(::symlink("folder", (storage_ / "link").c_str()), 0);
    EXPECT_EQ(
        allNames(*LocalFileEnumerator::initWithContainer(kTesselAllDirectoriesContainerItemIdentifier, {storageURL()})),
        (std::vector<std::string>{"folder", "inner"}));
}

TEST_F(LocalFileEnumeratorTest, theWorkingSetIsPagedWithoutLossOnANestedTree) {
    std::vector<std::string> expected;
    for (int i = 0; i < 30; ++i) {
        const std::string folder = "f" + std::to_string(i);
        expected.push_back(folder);
        for (int j = 0; j < 40; ++j) {
            storage_.file(folder + "/" + folder + "-" + std::to_string(j));
            expected.push_back(folder + "-" + std::to_string(j));
        }
    }
    std::ranges::sort(expected);
    EXPECT_EQ(allNames(*workingSet()), expected);
}

TEST_F(LocalFileEnumeratorTest, aDeletionDeepBelowExpiresTheWorkingSetsPage) {
    for (int j = 0; j < 250; ++j) storage_.file("folder/inner/" + std::to_string(j));
    const auto listed = workingSet();
    const ListedPage first = firstPage(*listed);
    ASSERT_EQ(::unlink((storage_ / "folder/inner/3").c_str()), 0);
    expectExpired(page(*listed, *first.next));
}

TEST_F(LocalFileEnumeratorTest, entriesOfEveryKindAndNameAreListed) {
    storage_.file("new\nline");
    storage_.file("\xff\xfe");
    ASSERT_EQ(::mkfifo((storage_ / "fifo").c_str(), 0600), 0);
    ASSERT_EQ(::symlink("loop", (storage_ / "loop").c_str()), 0);
    ASSERT_EQ(::symlink("nowhere", (storage_ / "dangling").c_str()), 0);
    const TesselItems items = all(*enumerator());
    EXPECT_EQ(items.size(), 5U);
    EXPECT_EQ(find(items, "fifo")->typeIdentifier(), "inode/fifo");
    EXPECT_EQ(find(items, "loop")->typeIdentifier(), "inode/symlink");
    EXPECT_TRUE(find(items, "\xff\xfe")->itemIdentifier().starts_with("did="));
    EXPECT_TRUE(find(items, "new\nline"));
}

// More changes than the kernel keeps: all that was listed before is in doubt, and nothing that is listed after.
TEST_F(LocalFileEnumeratorTest, lostChangesExpireEarlierListingsOnly) {
    for (int j = 0; j < 250; ++j) storage_.file("folder/" + std::to_string(j));
    const auto listed = workingSet();
    const ListedPage before = firstPage(*listed);
    for (int i = 0; i < 20'000; ++i) {
        ASSERT_EQ(::rename((storage_ / "folder/7").c_str(), (storage_ / "folder/x").c_str()), 0);
        ASSERT_EQ(::rename((storage_ / "folder/x").c_str(), (storage_ / "folder/7").c_str()), 0);
    }
    const ListedPage after = firstPage(*listed);
    expectExpired(page(*listed, *before.next));
    EXPECT_FALSE(page(*listed, *after.next).error);
}

TEST_F(LocalFileEnumeratorTest, manyListingsAreWatchedAtOnce) {
    for (int i = 0; i < 80; ++i) {
        for (int j = 0; j < 3; ++j) storage_.file("f" + std::to_string(i) + "/inner/" + std::to_string(j));
    }
    for (int i = 0; i < 80; ++i) {
        const std::string name = "f" + std::to_string(i);
        const auto one = LocalFileEnumerator::initWithContainer(kTesselWorkingSetContainerItemIdentifier, {url(name)});
        EXPECT_EQ(all(*one).size(), 4U);
    }
    for (int j = 0; j < 250; ++j) storage_.file("f0/inner/more" + std::to_string(j));
    const auto listed = workingSet();
    const ListedPage first = firstPage(*listed);
    ASSERT_TRUE(first.next);
    EXPECT_FALSE(page(*listed, *first.next).error);
}

// Nobody records events: that nothing changed can't be promised, so it is not.
TEST_F(LocalFileEnumeratorTest, everyAnchorIsExpiredWhileNoHistoryIsKept) {
    const auto listed = enumerator();
    FSChangeToken elsewhere = anchorOf(*listed);
    elsewhere.deviceUUID = KsUUID::random();
    for (const TesselSyncAnchor& anchor : {anchorOf(*listed).encode(), elsewhere.encode(), Bytes()}) {
        const auto observer = std::make_shared<RecordingChangeObserver>();
        listed->enumerateChangesForObserver(observer, anchor);
        const GivenChanges& given = observer->wait();
        ASSERT_TRUE(given.error);
        EXPECT_TRUE(given.error->is("TesselErrorDomain", -1002));
        EXPECT_TRUE(given.log.empty());
    }
    EXPECT_EQ(log_.count("[ERROR] can't create change token from anchor data, resetting"), 1U);
    EXPECT_EQ(log_.count("[INFO] device UUID changed ("), 1U);
}

TEST_F(LocalFileEnumeratorTest, withoutAStoreThereAreNoChanges) {
    const auto listed = enumerator();
    const TesselSyncAnchor anchor = anchorOf(*listed).encode();
    RvStorageManager::defaultManager().setStore(nullptr);
    const auto observer = std::make_shared<RecordingChangeObserver>();
    listed->enumerateChangesForObserver(observer, anchor);
    EXPECT_EQ(observer->wait().error, errorFor(LocalTesselKitError::unableToGetDeviceUUID));
    EXPECT_TRUE(enumerator()->notifier() == nullptr);
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "; enumeration will have no live update"));
}

// With a history.

class GatherWithHistoryTest : public HistoryTest {
protected:
    std::shared_ptr<LocalFileEnumerator> enumerator() {
        return LocalFileEnumerator::initWithContainer(kTesselRootContainerItemIdentifier, {storageURL()});
    }
    void files(int count) {
        for (int i = 0; i < count; ++i) storage_.file("file" + std::to_string(i));
    }
    static FSChangeToken tokenOf(const ListedPage& page) { return *FSChangeToken::decode(*page.next); }
};

TEST_F(GatherWithHistoryTest, aPageGoesOnAfterWhatCameAndChanged) {
    files(250);
    const auto listed = enumerator();
    const ListedPage first = firstPage(*listed);
    EXPECT_EQ(tokenOf(first).streamEventID, history_->currentEventID());
    storage_.file("new");
    made("new");
    const ListedPage second = page(*listed, *first.next);
    EXPECT_FALSE(second.error);
    EXPECT_TRUE(log_.contains(LogLevel::debug, fmt::format("[DEBUG] safe to resume gather phase from FSEventID {}",
                                                           tokenOf(first).streamEventID)));
}

TEST_F(GatherWithHistoryTest, aPageExpiresAfterADeletion) {
    files(250);
    const auto listed = enumerator();
    const ListedPage first = firstPage(*listed);
    remove("file17");
    const ListedPage second = page(*listed, *first.next);
    ASSERT_TRUE(second.error);
    EXPECT_TRUE(second.error->is("TesselErrorDomain", -1002));
    EXPECT_TRUE(log_.contains(LogLevel::info,
                              "[INFO] deletion of " + (storage_ / "file17") + " requires to re-gather from scratch"));
}

// Every deletion moves the entries behind it up.
TEST_F(GatherWithHistoryTest, aFollowersListingGoesBackByWhatWasDeleted) {
    files(1'500);
    const auto listed = enumerator();
    std::set<std::string> seen;
    std::set<std::string> removed;
    std::optional<TesselPage> next = tesselInitialPageForFollowers();
    for (int pages = 0; next; ++pages) {
        ASSERT_LT(pages, 100);
        const ListedPage listing = page(*listed, *next);
        ASSERT_FALSE(listing.error) << listing.error->description();
        const auto names = listing.names();
        seen.insert(names.begin(), names.end());
        next = listing.next;
        // A few, and once more than two pages overlap by.
        for (std::size_t i = 0; i < std::min<std::size_t>(names.size(), pages == 3 ? 90 : 5); ++i) {
            if (removed.insert(names[i]).second) remove(names[i]);
        }
    }
    for (int i = 0; i < 1'500; ++i) {
        const std::string name = "file" + std::to_string(i);
        EXPECT_TRUE(seen.contains(name)) << name;
    }
    EXPECT_GT(removed.size(), 100U);
}

TEST_F(GatherWithHistoryTest, aFollowersListingRepeatsNothingButTheOverlapWhereNothingIsDeleted) {
    files(1'000);
    const auto listed = enumerator();
    std::size_t count = 0;
    std::set<std::string> seen;
    for (std::optional<TesselPage> next = tesselInitialPageForFollowers(); next;) {
        const ListedPage listing = page(*listed, *next);
        ASSERT_FALSE(listing.error);
        const auto names = listing.names();
        seen.insert(names.begin(), names.end());
        count += names.size();
        next = listing.next;
    }
    EXPECT_EQ(seen.size(), 1'000U);
    EXPECT_LE(count, 1'150U);
}

// A folder that moves takes along what its one event does not count.
TEST_F(GatherWithHistoryTest, aFollowersListingOfEverythingBelowExpires) {
    files(250);
    const auto listed =
        LocalFileEnumerator::initWithContainer(kTesselWorkingSetContainerItemIdentifier, {storageURL()});
    const ListedPage first = page(*listed, tesselInitialPageForFollowers());
    ASSERT_TRUE(first.next);
    remove(first.names().front());
    const ListedPage second = page(*listed, *first.next);
    ASSERT_TRUE(second.error);
    EXPECT_TRUE(second.error->is("TesselErrorDomain", -1002));
}

TEST_F(GatherWithHistoryTest, aPageOutlivesItsProcess) {
    files(450);
    const ListedPage first = firstPage(*enumerator());
    FSListingPositions::shared().removeAll();
    reopenStore();
    const ListedPage second = page(*enumerator(), *first.next);
    EXPECT_FALSE(second.error);
    EXPECT_EQ(second.items.size(), 200U);
}

// What was deleted before a listing began, and not yet recorded then, doesn't expire it.
TEST_F(GatherWithHistoryTest, aListingBeginsAfterWhatHappenedBefore) {
    files(250);
    const std::uint64_t gone = fileID("file17");
    ASSERT_EQ(::unlink((storage_ / "file17").c_str()), 0);
    history_->onDrain([&]() -> Result<void> {
        history_->onDrain(nullptr);
        left("file17", gone);
        return {};
    });
    const auto listed = enumerator();
    EXPECT_EQ(all(*listed).size(), 249U);
}

TEST_F(GatherWithHistoryTest, onePageWaitsForNothing) {
    files(20);
    EXPECT_EQ(all(*enumerator()).size(), 20U);
    EXPECT_EQ(history_->drains(), 0);
}

// The first reading of the store is still under way: nothing can be replayed, and listings wait for nothing.
TEST_F(GatherWithHistoryTest, listingsGoOnBeforeThereIsAHistory) {
    files(450);
    history_->trim(UINT64_MAX);
    const auto listed = enumerator();
    EXPECT_EQ(all(*listed).size(), 450U);
    const ListedPage first = firstPage(*listed);
    history_->setCurrent(tokenOf(first).streamEventID + 10);
    history_->trim(tokenOf(first).streamEventID + 10);
    EXPECT_FALSE(page(*listed, *first.next).error) << "also when there is one meanwhile";
    EXPECT_EQ(history_->drains(), 0);
    storage_.file("new");
    EXPECT_TRUE(page(*listed, *first.next).error) << "what can't be replayed is held to what was seen";
}

// Nothing that a page has passed over goes without being told: the next one counts it.
TEST_F(GatherWithHistoryTest, whatIsPassedOverIsIdentifiedToo) {
    files(150);
    for (int i = 0; i < 150; ++i) storage_.folder("folder" + std::to_string(i));
    storage_.file(".Trash/x");
    const auto directories =
        LocalFileEnumerator::initWithContainer(kTesselAllDirectoriesContainerItemIdentifier, {storageURL()});
    const TesselSyncAnchor anchor = *firstPage(*directories).next;
    std::size_t known = 0;
    for (int i = 0; i < 150; ++i) known += store_->object(FileID{fileID("file" + std::to_string(i))}) ? 1 : 0;
    for (int i = 0; i < 150; ++i) known += store_->object(FileID{fileID("folder" + std::to_string(i))}) ? 1 : 0;
    known += store_->object(FileID{fileID(".Trash")}) ? 1 : 0;
    EXPECT_GE(known, 199U) << "all but what is below .Trash";
}

TEST_F(GatherWithHistoryTest, anAnchorIsBehindWhatHappenedBefore) {
    storage_.file("a.txt");
    history_->onDrain([&]() -> Result<void> {
        changed("a.txt");
        return {};
    });
    const FSChangeToken anchor = *FSChangeToken::decode(anchorOf(*enumerator()));
    history_->onDrain(nullptr);
    EXPECT_EQ(anchor.streamEventID, history_->currentEventID());
    EXPECT_EQ(anchor.offset, 0U);
}

}  // namespace
}  // namespace cindral::test
