#include "provider/fs/FSChangesEnumerator.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <random>

#include "platform/revisions/VolumeIndex.h"
#include "platform/tessel/TesselManager.h"
#include "provider/HistoryFixture.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/LocalFileEnumerator.h"

namespace cindral::test {
namespace {

class FSChangesEnumeratorTest : public HistoryTest {
protected:
    std::shared_ptr<LocalFileEnumerator> root() {
        return LocalFileEnumerator::initWithContainer(kTesselRootContainerItemIdentifier, {storageURL()});
    }
    std::shared_ptr<LocalFileEnumerator> workingSet() {
        return LocalFileEnumerator::initWithContainer(kTesselWorkingSetContainerItemIdentifier, {storageURL()});
    }
    std::shared_ptr<LocalFileEnumerator> allDirectories() {
        return LocalFileEnumerator::initWithContainer(kTesselAllDirectoriesContainerItemIdentifier, {storageURL()});
    }
    std::shared_ptr<LocalFileEnumerator> folder(std::string_view name) {
        return LocalFileEnumerator::initWithContainer(identifier(name), {url(name)});
    }
    ClientView viewOf(LocalFileEnumerator& listed) {
        TesselSyncAnchor anchor = anchorOf(listed);
        return {all(listed), std::move(anchor)};
    }
    /// Applies all changes, and compares with a listing.
    void expectCurrent(ClientView& view, LocalFileEnumerator& listed) {
        view.apply(allChanges(listed, view.anchor()));
        EXPECT_EQ(view.contents(), ClientView::contentsOf(all(listed))) << listed.container();
    }
    FSChangeToken tokenAt(std::uint64_t eventID, std::uint64_t offset = 0) const {
        FSChangeToken token;
        token.deviceUUID = store_->uuid();
        token.streamEventID = eventID;
        token.offset = offset;
        return token;
    }
    void files(int count, std::string_view prefix = "file") {
        for (int i = 0; i < count; ++i) {
            const std::string name = fmt::format("{}{:03}", prefix, i);
            storage_.file(name);
            changed(name);
        }
    }
    /// As the recorder does with what nobody has listed yet.
    void recordUnlisted(std::string_view name) {
        const std::filesystem::path path = storage_ / name;
        const Result<FileStatus> status = sys::statx(AT_FDCWD, path.c_str());
        const std::string objectName = path.filename();
        IndexedObject object;
        object.fileID = FileID{status->fileID};
        object.birthTime = status->birthStamp();
        object.parent = FileID{sys::statx(AT_FDCWD, path.parent_path().c_str())->fileID};
        object.name = objectName;
        object.kind = kindOf(name);
        object.changeTime = 1;
        IndexChanges changes(IndexChanges::Journal::no);
        changes.put(object);
        ASSERT_TRUE(store_->apply(changes, {}).ok());
    }
    std::string did(std::string_view name) const { return identifier(name); }
    std::string fid(std::string_view name) const { return fmt::format("fid={}", fileID(name)); }
    static std::string fid(std::uint64_t number) { return fmt::format("fid={}", number); }

    const std::uint64_t since_ = history_->currentEventID();
};

using FSChangesEnumeratorDeathTest = FSChangesEnumeratorTest;
using Log = std::vector<std::pair<char, std::string>>;

TEST_F(FSChangesEnumeratorDeathTest, needsAURL) {
    EXPECT_DEATH((void)FSChangesEnumerator::create("fid=1", {}, nullptr, FSChangeToken(), 0),
                 "require at least one URL to init a change enumerator");
}

TEST_F(FSChangesEnumeratorDeathTest, needsTheFirstReadersBookmark) {
    // The reader's queue needs the pool's threads, which a copy of this process by fork would be without.
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    const auto observer = std::make_shared<RecordingChangeObserver>();
    const auto enumerator = FSChangesEnumerator::create("fid=1", {storageURL()}, observer, tokenAt(since_), since_);
    const auto reader = FSEventReader::create({storageURL()}, FSEventReaderMode::docIDBased, true, since_);
    EXPECT_DEATH(
        {
            reader->async([&] { enumerator->readerDidFinishHistory(*reader, since_); });
            DispatchSemaphore(0).wait();
        },
        "path based reader bookmark is missing");
}

TEST_F(FSChangesEnumeratorDeathTest, isCalledOnTheReadersQueueOnly) {
    const auto observer = std::make_shared<RecordingChangeObserver>();
    const auto enumerator = FSChangesEnumerator::create("fid=1", {storageURL()}, observer, tokenAt(since_), since_);
    const auto reader = FSEventReader::create({storageURL()}, FSEventReaderMode::pathBased, true, since_);
    EXPECT_DEATH(enumerator->readerDidDeleteItem(*reader, Event(), "fid=1"), "cindral.fsevents-stream");
}

// Batches and positions.

TEST_F(FSChangesEnumeratorTest, anAnchorAtThePresentHasNoChanges) {
    const auto listed = root();
    changed("");
    history_->setCurrent(since_ + 50);
    const GivenChanges given = changes(*listed, tokenAt(since_ + 20).encode());
    EXPECT_TRUE(given.log.empty());
    EXPECT_FALSE(given.moreComing);
    EXPECT_EQ(given.token(), tokenAt(since_ + 50)) << "the event ID when the request came";
    EXPECT_TRUE(
        log_.contains(LogLevel::debug, fmt::format("[DEBUG] fetching changes did catch up (eventID:{})", since_ + 50)));
}

TEST_F(FSChangesEnumeratorTest, theWorkingSetsAnchorComesBackUnchangedWithoutChanges) {
    history_->setCurrent(since_ + 50);
    FSChangeToken token = tokenAt(since_ + 20, 3);
    token.appLibraryVersionToken = 7;
    const GivenChanges given = changes(*workingSet(), token.encode());
    EXPECT_FALSE(given.moreComing);
    EXPECT_EQ(given.token(), token);
}

TEST_F(FSChangesEnumeratorTest, aBatchIsFullAtTheHundredthChange) {
    files(99);
    EXPECT_FALSE(changes(*root(), tokenAt(since_).encode()).moreComing);
    files(1, "last");
    const GivenChanges given = changes(*root(), tokenAt(since_).encode());
    EXPECT_EQ(given.log.size(), 100U);
    EXPECT_TRUE(given.moreComing);
    EXPECT_EQ(given.token(), tokenAt(since_ + 100));
    const GivenChanges rest = changes(*root(), *given.anchor);
    EXPECT_TRUE(rest.log.empty());
    EXPECT_FALSE(rest.moreComing);
    EXPECT_EQ(log_.count("invalid number of changes"), 0U);
}

TEST_F(FSChangesEnumeratorTest, manyChangesComeInBatchesInOrder) {
    files(250);
    const auto listed = root();
    std::vector<std::size_t> sizes;
    std::vector<std::string> names;
    TesselSyncAnchor anchor = tokenAt(since_).encode();
    while (true) {
        const GivenChanges given = changes(*listed, anchor);
        sizes.push_back(given.log.size());
        for (const auto& [kind, name] : given.log) names.push_back(name);
        EXPECT_EQ(given.token().offset, 0U);
        anchor = *given.anchor;
        if (!given.moreComing) break;
    }
    EXPECT_EQ(sizes, (std::vector<std::size_t>{100, 100, 50}));
    EXPECT_EQ(names.size(), 250U);
    EXPECT_TRUE(std::ranges::is_sorted(names));
    EXPECT_EQ(FSChangeToken::decode(anchor)->streamEventID, history_->currentEventID());
}

TEST_F(FSChangesEnumeratorTest, theLogSaysWhatWasReplayed) {
    files(2);
    (void)changes(*root(), tokenAt(since_).encode());
    EXPECT_TRUE(
        log_.contains(LogLevel::debug, "[DEBUG] replayed 2 fsevents from <FSEventReader pathBased> (offset:0)"));
    EXPECT_TRUE(
        log_.contains(LogLevel::debug, "[DEBUG] replayed 0 fsevents from <FSEventReader docIDBased> (offset:0)"));
}

TEST_F(FSChangesEnumeratorTest, anOffsetSkipsWhatAnEarlierBatchDelivered) {
    files(150);
    const GivenChanges given = changes(*root(), tokenAt(since_, 30).encode());
    EXPECT_EQ(given.log.size(), 100U);
    EXPECT_EQ(given.log.front().second, "file030");
    EXPECT_EQ(given.token(), tokenAt(since_ + 130));
    const GivenChanges beyond = changes(*root(), tokenAt(since_, 500).encode());
    EXPECT_TRUE(beyond.log.empty());
    EXPECT_FALSE(beyond.moreComing);
}

TEST_F(FSChangesEnumeratorTest, theFirstReaderNeverFinishesByItself) {
    storage_.file("a.txt");
    record("a.txt");
    files(120);
    documentWent(documentID("a.txt"), 1, fileID("a.txt"));
    const GivenChanges given = changes(*root(), tokenAt(since_).encode());
    EXPECT_EQ(given.log.size(), 101U) << "a batch of each reader's";
    EXPECT_EQ(given.log.back(), (std::pair<char, std::string>{'u', "a.txt"}));
    EXPECT_TRUE(given.moreComing);
    EXPECT_EQ(given.token(), tokenAt(since_ + 100));
}

TEST_F(FSChangesEnumeratorTest, theEarlierPositionWins) {
    for (int i = 0; i < 120; ++i) documentWent(DocumentID{static_cast<std::uint32_t>(1000 + i)}, 1, 0);
    files(5);
    const GivenChanges given = changes(*root(), tokenAt(since_).encode());
    EXPECT_EQ(given.log.size(), 105U);
    EXPECT_EQ(given.token(), tokenAt(since_ + 100)) << "where the documents' reader stopped";
    EXPECT_TRUE(given.moreComing);
    const GivenChanges rest = changes(*root(), *given.anchor);
    EXPECT_EQ(rest.log.size(), 25U);
    EXPECT_FALSE(rest.moreComing);
}

// What happens between the two readers' ends is of neither.
TEST_F(FSChangesEnumeratorTest, theSecondReadersPresentIsNotTheFirsts) {
    storage_.file("late.txt");
    documentWent(DocumentID{1000}, 1, 0);
    const auto listed = root();
    int drains = 0;
    const TesselSyncAnchor anchor = tokenAt(since_).encode();
    history_->onDrain([&]() -> Result<void> {
        if (++drains == 2) changed("late.txt");
        return {};
    });
    const GivenChanges given = changes(*listed, anchor);
    history_->onDrain(nullptr);
    EXPECT_EQ(given.log, (Log{{'d', "did=1000"}}));
    const GivenChanges rest = changes(*listed, *given.anchor);
    EXPECT_EQ(rest.updatedNames(), (std::vector<std::string>{"late.txt"}));
}

TEST_F(FSChangesEnumeratorTest, carriesTheAppLibraryVersionThrough) {
    files(1);
    FSChangeToken token = tokenAt(since_);
    token.appLibraryVersionToken = 42;
    EXPECT_EQ(changes(*root(), token.encode()).token().appLibraryVersionToken, 42U);
}

// How it ends otherwise.

TEST_F(FSChangesEnumeratorTest, lostEventsExpireTheAnchor) {
    files(3);
    Event event;
    event.flags = EventFlags::userDropped;
    event.path = storage_.path();
    history_->add(event);
    const GivenChanges given = changes(*root(), tokenAt(since_).encode());
    ASSERT_TRUE(given.error);
    EXPECT_TRUE(given.error->is("TesselErrorDomain", -1002));
    EXPECT_TRUE(log_.contains(LogLevel::info, "[INFO] fetching changes did finish after reset"));
}

TEST_F(FSChangesEnumeratorTest, anAnchorThatCannotBeReplayedIsExpired) {
    history_->trim(since_ + 5);
    history_->setCurrent(since_ + 10);
    for (const std::uint64_t eventID : {since_, since_ + 11}) {
        const GivenChanges given = changes(*workingSet(), tokenAt(eventID).encode());
        ASSERT_TRUE(given.error);
        EXPECT_TRUE(given.error->is("TesselErrorDomain", -1002));
    }
}

TEST_F(FSChangesEnumeratorTest, aStoreThatFailsIsAnErrorAndNoLoss) {
    files(3);
    const auto listed = root();
    RvStorageManager::defaultManager().setStore(nullptr);
    const auto observer = std::make_shared<RecordingChangeObserver>();
    FSChangesEnumerator::create(listed->container(), {storageURL()}, observer, tokenAt(since_), since_);
    const auto enumerator =
        FSChangesEnumerator::create(listed->container(), {storageURL()}, observer, tokenAt(since_), since_);
    enumerator->start();
    EXPECT_TRUE(observer->wait().error->isPosix(EAGAIN));
    RvStorageManager::defaultManager().setStore(store_);
    EXPECT_EQ(changes(*listed, tokenAt(since_).encode()).log.size(), 3U);
}

TEST_F(FSChangesEnumeratorTest, stoppingFinishesTheObserver) {
    DispatchSemaphore isDraining(0);
    DispatchSemaphore goesOn(0);
    const auto listed = root();
    const TesselSyncAnchor anchor = anchorOf(*listed);
    history_->onDrain([&]() -> Result<void> {
        isDraining.signal();
        goesOn.wait();
        return {};
    });
    files(3);
    const auto observer = std::make_shared<RecordingChangeObserver>();
    listed->enumerateChangesForObserver(observer, anchor);
    isDraining.wait();
    listed->stop();
    goesOn.signal();
    EXPECT_TRUE(observer->wait().error->isPosix(ECANCELED));
    EXPECT_TRUE(observer->given.log.empty());
    EXPECT_EQ(observer->finishes(), 1);
}

TEST_F(FSChangesEnumeratorTest, nothingIsLeftBehind) {
    std::weak_ptr<LocalFileEnumerator> weak;
    {
        const auto listed = root();
        weak = listed;
        files(3);
        (void)allChanges(*listed, tokenAt(since_).encode());
        listed->invalidate();
    }
    while (history_->observers() > 0 || !weak.expired()) std::this_thread::yield();
}

// Events bear the paths of now: what lies below a folder that moves during the replay may be taken for another's.
TEST_F(FSChangesEnumeratorTest, aFolderThatMovesMeanwhileIsAskedForAgain) {
    storage_.file("folder/a.txt");
    const auto listed = folder("folder");
    changed("folder/a.txt");
    history_->onRead([&] {
        history_->onRead(nullptr);
        std::filesystem::rename(storage_ / "folder", storage_ / "moved");
    });
    const GivenChanges given = changes(*listed, tokenAt(since_).encode());
    EXPECT_TRUE(given.moreComing);
    EXPECT_EQ(given.token(), tokenAt(since_));
    record("moved");
    const auto again = LocalFileEnumerator::initWithContainer(listed->container(), {url("moved")});
    changed("moved/a.txt");
    EXPECT_EQ(allChanges(*again, *given.anchor).updatedNames(), (std::vector<std::string>{"a.txt"}));
}

// What is given.

TEST_F(FSChangesEnumeratorTest, itemsAreThoseOfAListing) {
    storage_.file("folder/a.txt", "hello");
    storage_.file("folder/.hidden");
    storage_.folder("folder/inner/deeper");
    storage_.file("folder/report.folio/index", "contents");
    ASSERT_EQ(::symlink("a.txt", (storage_ / "folder/link").c_str()), 0);
    ASSERT_EQ(::mkfifo((storage_ / "folder/fifo").c_str(), 0600), 0);
    storage_.file("folder/\xff\xfe\n");
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(storage_ / "folder")) {
        names.push_back(entry.path().filename().string());
        changed("folder/" + names.back());
    }
    const auto listed = folder("folder");
    const TesselItems given = allChanges(*listed, tokenAt(since_).encode()).updated;
    const TesselItems all = HistoryTest::all(*listed);
    EXPECT_EQ(given.size(), names.size());
    EXPECT_EQ(ClientView::contentsOf(given), ClientView::contentsOf(all));
    for (const auto& item : given) {
        const auto same = find(all, item->filename());
        ASSERT_TRUE(same);
        EXPECT_EQ(*item->fileURL(), *same->fileURL());
        EXPECT_EQ(item->creationDate(), same->creationDate());
        EXPECT_EQ(item->contentModificationDate(), same->contentModificationDate());
        EXPECT_EQ(item->lastUsedDate(), same->lastUsedDate());
        EXPECT_EQ(item->tags(), same->tags());
        EXPECT_EQ(item->favoriteRank(), same->favoriteRank());
        EXPECT_EQ(item->documentSize(), same->documentSize());
        EXPECT_EQ(item->childItemCount(), same->childItemCount());
        EXPECT_EQ(item->isUbiquitous(), same->isUbiquitous());
        EXPECT_EQ(item->isAppLibrary(), same->isAppLibrary());
    }
}

TEST_F(FSChangesEnumeratorTest, aFolderIsToldOfItsDirectChildrenOnly) {
    storage_.file("folder/a.txt");
    storage_.file("folder/inner/b.txt");
    storage_.file("beside.txt");
    const auto listed = folder("folder");
    for (const char* name : {"folder/a.txt", "folder/inner", "folder/inner/b.txt", "beside.txt", "folder"})
        changed(name);
    EXPECT_EQ(allChanges(*listed, tokenAt(since_).encode()).updatedNames(),
              (std::vector<std::string>{"a.txt", "inner"}));
    EXPECT_EQ(allChanges(*root(), tokenAt(since_).encode()).updatedNames(),
              (std::vector<std::string>{"beside.txt", "folder"}));
    EXPECT_EQ(allChanges(*workingSet(), tokenAt(since_).encode()).updatedNames(),
              (std::vector<std::string>{"a.txt", "inner", "b.txt", "beside.txt", "folder"}));
}

TEST_F(FSChangesEnumeratorTest, allDirectoriesAreToldOfPlainFoldersOnly) {
    storage_.file("folder/inner/a.txt");
    storage_.file("report.folio/index");
    ASSERT_EQ(::symlink("folder", (storage_ / "link").c_str()), 0);
    for (const char* name : {"folder", "folder/inner", "folder/inner/a.txt", "report.folio", "link"}) changed(name);
    documentWent(DocumentID{77}, 1, 0);
    const GivenChanges given = allChanges(*allDirectories(), tokenAt(since_).encode());
    EXPECT_EQ(given.log, (Log{{'u', "folder"}, {'u', "inner"}}));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] dropping fsevent at " + (storage_ / "folder/inner/a.txt") +
                                                   "; item is not a directory"));
    EXPECT_EQ(log_.count("; item is not a directory"), 4U);
}

TEST_F(FSChangesEnumeratorTest, aDeletionBearsTheIdentifierThatTheObjectHad) {
    storage_.file("a.txt");
    storage_.folder("folder");
    record("a.txt");
    record("folder");
    const std::string document = did("a.txt");
    const std::uint64_t folder = fileID("folder");
    remove("a.txt");
    remove("folder");
    EXPECT_EQ(allChanges(*root(), tokenAt(since_).encode()).log, (Log{{'d', document}, {'d', fid(folder)}}));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] forward deletion of " + document));
}

TEST_F(FSChangesEnumeratorTest, aMoveInsideAContainerIsNoDeletion) {
    storage_.file("one/a.txt");
    storage_.folder("two");
    record("one");
    record("two");
    record("one/a.txt");
    const std::string document = did("one/a.txt");
    const auto one = folder("one");
    const auto two = folder("two");
    move("one/a.txt", "two/b.txt");
    const GivenChanges inAll = allChanges(*workingSet(), tokenAt(since_).encode());
    EXPECT_EQ(std::ranges::count(inAll.deleted, document), 0);
    EXPECT_EQ(find(inAll.updated, "b.txt")->parentItemIdentifier(), fid("two"));
    const GivenChanges inOne = allChanges(*one, tokenAt(since_).encode());
    EXPECT_EQ(std::ranges::count(inOne.deleted, document), 1);
    EXPECT_TRUE(inOne.updated.empty());
    EXPECT_EQ(allChanges(*two, tokenAt(since_).encode()).log, (Log{{'u', "b.txt"}}));
}

TEST_F(FSChangesEnumeratorTest, aFolderThatBecameAPackageGoesAndComes) {
    storage_.file("report/index");
    const auto listed = workingSet();
    ClientView view = viewOf(*listed);
    const std::string before = fid("report");
    move("report", "report.folio");
    const GivenChanges given = allChanges(*listed, view.anchor());
    EXPECT_EQ(given.log, (Log{{'d', before}, {'u', "report.folio"}}));
    expectCurrent(view, *listed);
    const std::string package = did("report.folio");
    move("report.folio", "report");
    const GivenChanges back = allChanges(*listed, view.anchor());
    EXPECT_EQ(back.log, (Log{{'d', package}, {'u', "report"}}));
    changed("report/index");
    expectCurrent(view, *listed);
}

TEST_F(FSChangesEnumeratorTest, trashIsNeverGivenAndWhatIsInItIs) {
    storage_.file(".Trash/old.txt");
    const auto listed = workingSet();
    ClientView view = viewOf(*listed);
    changed(".Trash");
    storage_.file(".Trash/new.txt");
    changed(".Trash/new.txt");
    changed(".Trash");
    const GivenChanges given = allChanges(*listed, view.anchor());
    EXPECT_EQ(given.log, (Log{{'u', "new.txt"}})) << "nothing of the folder itself: that would take its inside away";
    expectCurrent(view, *listed);
    EXPECT_TRUE(allChanges(*root(), tokenAt(since_).encode()).log.empty());
}

// Its inside is listed before and after; the recorder tells of all of it.
TEST_F(FSChangesEnumeratorTest, aFolderThatBecomesTheTrashLeavesItsInside) {
    storage_.file("bin/inner/a.txt");
    storage_.file("bin/b.txt");
    const auto listed = workingSet();
    const auto directories = allDirectories();
    const auto top = root();
    ClientView view = viewOf(*listed);
    ClientView directoryView = viewOf(*directories);
    ClientView topView = viewOf(*top);
    move("bin", ".Trash");
    for (const char* name : {".Trash/inner", ".Trash/inner/a.txt", ".Trash/b.txt"}) changed(name);
    expectCurrent(view, *listed);
    expectCurrent(directoryView, *directories);
    expectCurrent(topView, *top);
    EXPECT_EQ(view.contents().size(), 3U);
    move(".Trash", "bin");
    for (const char* name : {"bin/inner", "bin/inner/a.txt", "bin/b.txt"}) changed(name);
    expectCurrent(view, *listed);
    expectCurrent(directoryView, *directories);
    expectCurrent(topView, *top);
}

TEST_F(FSChangesEnumeratorTest, aNumberThatGoesToAnotherObjectIsNotTheObject) {
    storage_.file("a.txt");
    record("a.txt");
    // What was a folder of the same number has left.
    left("folder", fileID("a.txt"), ObjectKind::folder);
    const GivenChanges given = allChanges(*root(), tokenAt(since_).encode());
    EXPECT_EQ(given.log, (Log{{'d', fid("a.txt")}}));
}

TEST_F(FSChangesEnumeratorTest, aFoldersNumberThatIsALinksNowIsAnotherItem) {
    ASSERT_EQ(::symlink("nowhere", (storage_ / "link").c_str()), 0);
    record("link");
    left("folder", fileID("link"), ObjectKind::folder);
    changed("link");
    EXPECT_EQ(allChanges(*workingSet(), tokenAt(since_).encode()).log, (Log{{'d', fid("link")}, {'u', "link"}}));
}

TEST_F(FSChangesEnumeratorTest, aFileReplacedByAnotherIsAskedAbout) {
    storage_.file("a.txt");
    record("a.txt");
    const std::string before = did("a.txt");
    const std::uint64_t file = fileID("a.txt");
    const DocumentID document = documentID("a.txt");
    storage_.file("a.tmp");
    std::filesystem::rename(storage_ / "a.tmp", storage_ / "a.txt");
    record("a.txt");
    // An event from before the replacement, whose object is no longer at the path.
    Event event;
    event.path = storage_ / "a.txt";
    event.fileID = FileID{file};
    event.documentID = document;
    event.kind = ObjectKind::file;
    history_->add(event);
    EXPECT_EQ(allChanges(*root(), tokenAt(since_).encode()).log, (Log{{'d', before}}));
}

TEST_F(FSChangesEnumeratorTest, aDocumentThatIsThereGoesByItsDocumentChange) {
    storage_.file("a.txt");
    record("a.txt");
    const DocumentID document = documentID("a.txt");
    documentWent(document, 1, fileID("a.txt"));
    EXPECT_EQ(allChanges(*root(), tokenAt(since_).encode()).log, (Log{{'u', "a.txt"}}));
    // The file is another document's.
    documentWent(DocumentID{4711}, 1, fileID("a.txt"));
    EXPECT_EQ(allChanges(*root(), tokenAt(since_).encode()).log, (Log{{'u', "a.txt"}, {'d', "did=4711"}}));
    // Said to be gone while it is there: it is there.
    documentWent(document, 1, 0);
    EXPECT_EQ(allChanges(*root(), tokenAt(since_ + 2).encode()).log, (Log{{'u', "a.txt"}}));
    storage_.folder("folder");
    EXPECT_EQ(allChanges(*folder("folder"), tokenAt(since_ + 2).encode()).log,
              (Log{{'d', fmt::format("did={}", static_cast<std::uint32_t>(document))}}));
}

// What takes it over may be where nothing is listed: a file whose name is the trash's.
TEST_F(FSChangesEnumeratorTest, aDocumentThatWentToWhatIsListedNowhereIsGone) {
    storage_.file(".Trash~");
    storage_.file(".Trash");
    record(".Trash~");
    record(".Trash");
    const DocumentID document = documentID(".Trash~");
    const std::string before = did(".Trash~");
    IndexChanges changes;
    changes.handOver(document, FileID{fileID(".Trash")});
    ASSERT_TRUE(store_->apply(changes, {}).ok());
    record(".Trash~");
    changed(".Trash~");
    documentWent(document, fileID(".Trash~"), fileID(".Trash"));
    const Log expected{{'u', ".Trash~"}, {'d', before}};
    EXPECT_EQ(allChanges(*root(), tokenAt(since_).encode()).log, expected);
    EXPECT_EQ(allChanges(*workingSet(), tokenAt(since_).encode()).log, expected);
    EXPECT_EQ(log_.count("item is not a directory"), 0U);
    EXPECT_TRUE(allChanges(*allDirectories(), tokenAt(since_).encode()).log.empty());
    EXPECT_EQ(log_.count("item is not a directory"), 2U);
}

// Where a document was that ended with its object, the event before says: elsewhere, nobody need be told.
TEST_F(FSChangesEnumeratorTest, aDocumentThatEndedWithItsObjectIsToldWhereItWas) {
    storage_.file("folder/a.txt");
    record("folder/a.txt");
    const std::string document = did("folder/a.txt");
    const DocumentID number = documentID("folder/a.txt");
    const std::uint64_t file = fileID("folder/a.txt");
    const auto inside = folder("folder");
    ASSERT_EQ(::unlink((storage_ / "folder/a.txt").c_str()), 0);
    left("folder/a.txt", file, ObjectKind::file, number);
    documentWent(number, file, 0);
    changed("folder");
    EXPECT_EQ(allChanges(*root(), tokenAt(since_).encode()).log, (Log{{'u', "folder"}}));
    EXPECT_EQ(allChanges(*inside, tokenAt(since_).encode()).log, (Log{{'d', document}}));
    EXPECT_EQ(allChanges(*workingSet(), tokenAt(since_).encode()).log, (Log{{'d', document}, {'u', "folder"}}));
    // A document that ended while its object went on is told everywhere: nothing says where it was.
    documentWent(DocumentID{4711}, fileID("folder"), 0);
    EXPECT_EQ(allChanges(*root(), tokenAt(since_ + 3).encode()).log, (Log{{'d', "did=4711"}}));
}

// A folder on the way was renamed while the events were read: what is below it is still listed.
TEST_F(FSChangesEnumeratorTest, anObjectBelowAFolderThatJustMovedIsNoDeletion) {
    storage_.file("folder/a.txt");
    record("folder");
    record("folder/a.txt");
    const auto listed = workingSet();
    changed("folder/a.txt");
    history_->onRead([&] {
        history_->onRead(nullptr);
        std::filesystem::rename(storage_ / "folder", storage_ / "moved");
    });
    // The recorder comes to it with the next barrier.
    const std::uint64_t number = fileID("folder");
    int drains = 0;
    history_->onDrain([&]() -> Result<void> {
        if (++drains != 2) return {};
        record("moved");
        left("folder", number, ObjectKind::folder);
        changed("moved");
        return {};
    });
    const GivenChanges given = allChanges(*listed, tokenAt(since_).encode());
    history_->onDrain(nullptr);
    ASSERT_FALSE(given.updated.empty());
    EXPECT_EQ(given.updated.front()->filename(), "a.txt");
    EXPECT_EQ(std::ranges::count(given.deleted, did("moved/a.txt")), 0);
}

// Nothing tells later of what came into a folder before that moved.
TEST_F(FSChangesEnumeratorTest, whatCameIntoAFolderThatJustMovedIsTold) {
    storage_.file("folder/a.txt");
    storage_.folder("folder/inside");
    recordUnlisted("folder");
    recordUnlisted("folder/a.txt");
    recordUnlisted("folder/inside");
    changed("folder/a.txt");
    changed("folder/inside");
    std::filesystem::rename(storage_ / "folder", storage_ / "moved");
    int drains = 0;
    history_->onDrain([&]() -> Result<void> {
        if (++drains == 3) recordUnlisted("moved");
        return {};
    });
    const GivenChanges given = changes(*workingSet(), tokenAt(since_).encode());
    EXPECT_EQ(given.updatedNames(), (std::vector<std::string>{"a.txt", "inside"}));
    EXPECT_TRUE(given.deleted.empty());
    drains = 0;
    std::filesystem::rename(storage_ / "moved", storage_ / "again");
    history_->onDrain([&]() -> Result<void> {
        if (++drains == 3) recordUnlisted("again");
        return {};
    });
    EXPECT_EQ(changes(*allDirectories(), tokenAt(since_).encode()).updatedNames(),
              (std::vector<std::string>{"inside"}));
}

// And what came and went is not.
TEST_F(FSChangesEnumeratorTest, whatNobodyHasSeenIsNoDeletion) {
    storage_.file("a.txt");
    recordUnlisted("a.txt");
    changed("a.txt");
    ASSERT_EQ(::unlink((storage_ / "a.txt").c_str()), 0);
    EXPECT_TRUE(allChanges(*workingSet(), tokenAt(since_).encode()).log.empty());
}

TEST_F(FSChangesEnumeratorTest, aRecordThatIsWrongForGoodIsADeletion) {
    storage_.file("a.txt");
    record("a.txt");
    const std::string document = did("a.txt");
    changed("a.txt");
    ASSERT_EQ(::unlink((storage_ / "a.txt").c_str()), 0);
    EXPECT_EQ(allChanges(*root(), tokenAt(since_).encode()).log, (Log{{'d', document}}));
}

TEST_F(FSChangesEnumeratorTest, anObjectThatNeverStandsStillIsAskedForAgain) {
    storage_.file("a.txt");
    record("a.txt");
    const std::uint64_t file = fileID("a.txt");
    changed("a.txt");
    std::string now = "a.txt";
    int moves = 0;
    history_->onDrain([&]() -> Result<void> {
        // Recorded, and gone elsewhere by the time it is looked for.
        record(now);
        const std::string next = fmt::format("{}.txt", ++moves);
        std::filesystem::rename(storage_ / now, storage_ / next);
        now = next;
        return {};
    });
    const GivenChanges given = changes(*root(), tokenAt(since_).encode());
    history_->onDrain(nullptr);
    EXPECT_TRUE(given.log.empty());
    EXPECT_TRUE(given.moreComing);
    EXPECT_EQ(given.token(), tokenAt(since_));
    EXPECT_EQ(moves, 5) << "one drain of the replay, and one for each look but the last";
    record(now);
    left("a.txt", file, ObjectKind::file, documentID(now));
    changed(now);
    EXPECT_EQ(allChanges(*root(), *given.anchor).updatedNames().back(), now);
}

TEST_F(FSChangesEnumeratorTest, whatIsInAPackageIsNotGiven) {
    storage_.file("folder/index");
    storage_.folder("folder/Media");
    record("folder/index");
    record("folder/Media");
    std::filesystem::rename(storage_ / "folder", storage_ / "report.folio");
    storage_.file("report.folio/other");
    for (const char* name : {"report.folio/index", "report.folio/Media", "report.folio/other"}) changed(name);
    EXPECT_EQ(allChanges(*workingSet(), tokenAt(since_).encode()).log,
              (Log{{'d', did("report.folio/index")}, {'d', fid("report.folio/Media")}}))
        << "and nothing of what nobody was ever told of";
}

TEST_F(FSChangesEnumeratorTest, aPackagesOwnViewFollowsWhatIsInIt) {
    storage_.file("report.folio/Media/a.png");
    const auto package = folder("report.folio");
    const auto inner = folder("report.folio/Media");
    changed("report.folio/Media/a.png");
    changed("report.folio/Media");
    changed("report.folio");
    EXPECT_EQ(changes(*package, tokenAt(since_).encode()).updatedNames(), (std::vector<std::string>{"Media"}));
    EXPECT_EQ(changes(*inner, tokenAt(since_).encode()).updatedNames(), (std::vector<std::string>{"a.png"}));
}

TEST_F(FSChangesEnumeratorTest, aFolderThatCannotBeReadTakesItsInsideAlong) {
    storage_.file("secret/a.txt");
    record("secret");
    record("secret/a.txt");
    const std::string document = did("secret/a.txt");
    changed("secret/a.txt");
    const auto listed = workingSet();
    ASSERT_EQ(::chmod((storage_ / "secret").c_str(), 0), 0);
    ASSERT_EQ(::chmod(storage_.outside().path().c_str(), 0755), 0);
    const bool isRoot = ::geteuid() == 0;
    GivenChanges given;
    if (isRoot) {
        ASSERT_EQ(::seteuid(65534), 0);
    }
    given = allChanges(*listed, tokenAt(since_).encode());
    if (isRoot) {
        ASSERT_EQ(::seteuid(0), 0);
    }
    ::chmod((storage_ / "secret").c_str(), 0700);
    EXPECT_EQ(std::ranges::count(given.deleted, document), 1);
    EXPECT_TRUE(given.updated.empty());
}

// Scans.

TEST_F(FSChangesEnumeratorTest, aScanGivesAllThatIsListedAndIsNeverCut) {
    for (int i = 0; i < 150; ++i) storage_.file(fmt::format("folder/{:03}.txt", i));
    storage_.file("folder/inner/a.txt");
    storage_.file("folder/report.folio/index");
    storage_.file("beside.txt");
    Event event;
    event.path = storage_ / "folder";
    event.fileID = FileID{fileID("folder")};
    event.flags = EventFlags::mustScanSubdirectories;
    record("folder");
    history_->add(event);
    changed("beside.txt");

    const GivenChanges given = changes(*workingSet(), tokenAt(since_).encode());
    EXPECT_EQ(given.log.size(), 154U);
    EXPECT_TRUE(given.moreComing);
    EXPECT_EQ(given.token(), tokenAt(since_ + 1));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] scanning folder " + (storage_ / "folder")));
    EXPECT_TRUE(
        log_.contains(LogLevel::error, "[ERROR] invalid number of changes (154 - 0 shouldn't be greater than 100)"));
    EXPECT_EQ(allChanges(*workingSet(), *given.anchor).updatedNames(), (std::vector<std::string>{"beside.txt"}));

    EXPECT_EQ(allChanges(*root(), tokenAt(since_).encode()).updatedNames(),
              (std::vector<std::string>{"folder", "beside.txt"}));
    EXPECT_EQ(allChanges(*allDirectories(), tokenAt(since_).encode()).updatedNames(),
              (std::vector<std::string>{"folder", "inner"}));
    EXPECT_EQ(allChanges(*folder("folder"), tokenAt(since_).encode()).log.size(), 152U);
}

TEST_F(FSChangesEnumeratorTest, aScanAboveTheContainerIsOfAllOfIt) {
    storage_.file("folder/a.txt");
    Event event;
    event.path = storage_.path();
    event.flags = EventFlags::mustScanSubdirectories;
    history_->add(event);
    EXPECT_EQ(allChanges(*folder("folder"), tokenAt(since_).encode()).updatedNames(),
              (std::vector<std::string>{"a.txt"}));
    EXPECT_EQ(allChanges(*workingSet(), tokenAt(since_).encode()).updated.size(), 2U);
}

// The working set brings the store's records up to date.

class CountingStorageManager : public RvStorageManager {
public:
    Result<std::uint32_t> permanentStorageForItem(const KsURL& url, AllocateIfNone allocate) override {
        asked.push_back(url.path());
        return RvStorageManager::permanentStorageForItem(url, allocate);
    }
    std::vector<std::string> asked;
};

TEST_F(FSChangesEnumeratorTest, onlyTheWorkingSetAsksForPermanentStorage) {
    CountingStorageManager manager;
    manager.setStore(store_);
    RvStorageManager::replaceDefaultManager(&manager);
    files(3);
    (void)allChanges(*root(), tokenAt(since_).encode());
    EXPECT_TRUE(manager.asked.empty());
    (void)allChanges(*workingSet(), tokenAt(since_).encode());
    EXPECT_EQ(manager.asked,
              (std::vector<std::string>{storage_ / "file000", storage_ / "file001", storage_ / "file002"}));
    EXPECT_EQ(log_.count("[DEBUG] updating fileID in palimp for "), 3U);
    RvStorageManager::replaceDefaultManager(nullptr);
}

// Whatever is done, in whatever order: applying the changes is as good as listing.
TEST_F(FSChangesEnumeratorTest, anySequenceOfChangesLeadsToTheListing) {
    const auto seed = static_cast<unsigned>(::testing::UnitTest::GetInstance()->random_seed());
    SCOPED_TRACE(seed);
    std::mt19937 random(seed);
    const std::vector<std::string> folders{"", "one/", "two/", "one/inner/", ".Trash/"};
    storage_.folder("one/inner");
    storage_.folder("two");
    storage_.folder(".Trash");
    const std::vector<std::shared_ptr<LocalFileEnumerator>> listed{root(), workingSet(), allDirectories(),
                                                                   folder("one"), folder(".Trash")};
    std::vector<ClientView> views;
    for (const auto& each : listed) views.push_back(viewOf(*each));
    const auto place = [&] {
        static const char* const kNames[] = {"a.txt", "b.txt", "c", "d.folio", "e"};
        return folders[random() % folders.size()] + kNames[random() % 5];
    };
    const auto exists = [&](const std::string& name) { return std::filesystem::exists(storage_ / name); };
    for (int round = 0; round < 30; ++round) {
        for (int i = 0; i < 8; ++i) {
            const std::string name = place();
            const std::string other = place();
            if (!exists(name) && random() % 3 == 0) {
                storage_.folder(name);
                made(name);
            } else if (!exists(name)) {
                storage_.file(name, "x");
                made(name);
            } else if (random() % 3 == 0) {
                remove(name);
            } else if (!exists(other)) {
                move(name, other);
            }
        }
        for (std::size_t i = 0; i < views.size(); ++i) expectCurrent(views[i], *listed[i]);
        if (HasFailure()) return;
    }
}

}  // namespace
}  // namespace cindral::test
