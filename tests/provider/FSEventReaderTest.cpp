#include "provider/fs/FSEventReader.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fmt/format.h>

#include <algorithm>

#include "platform/foundation/Dispatch.h"
#include "provider/HistoryFixture.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/fs/FSGatherWitness.h"

namespace cindral::test {
namespace {

/// Writes down what is reported.
class RecordingDelegate : public FSEventReaderDelegate {
public:
    LookFurther readerDidReceiveEvent(FSEventReader& reader, const Event& /*event*/, std::string_view path) override {
        reader.assertOnQueue();
        return looksFurther && (path.empty() || path != skippedPath) ? LookFurther::yes : LookFurther::no;
    }
    bool readerShouldMakeItem(FSEventReader& /*reader*/, const Event& /*event*/, const KsURL& entry) override {
        return entry.path() != itemlessPath;
    }
    void readerDidUpdateItem(FSEventReader& reader, const Event& event, const TesselItemIdentifier& identifier,
                             const std::shared_ptr<const TesselItem>& item) override {
        EXPECT_LT(reader.lastProcessedFSEventID(), event.id);
        note(reader, "update " + identifier + " " + item->filename());
        items.push_back(item);
    }
    void readerDidDeleteItem(FSEventReader& reader, const Event& /*event*/,
                             const TesselItemIdentifier& identifier) override {
        note(reader, "delete " + identifier);
    }
    void readerDidDropEvent(FSEventReader& reader, const Event& /*event*/,
                            const TesselItemIdentifier& identifier) override {
        note(reader, "drop " + identifier);
    }
    void readerMustScan(FSEventReader& reader, const Event& /*event*/) override { note(reader, "scan"); }
    void readerDidMoveDirectory(FSEventReader& reader, const Event& /*event*/) override { note(reader, "move"); }
    void readerDidLoseEvents(FSEventReader& reader, const Event& /*event*/) override { note(reader, "lose"); }
    void readerDidFail(FSEventReader& reader, const KsError& error) override {
        note(reader, "fail " + error.description());
        done.signal();
    }
    void readerDidFinishHistory(FSEventReader& reader, std::uint64_t eventID) override {
        note(reader, fmt::format("done {}", eventID));
        done.signal();
    }

    std::vector<std::string> reports;
    TesselItems items;
    bool looksFurther = true;
    std::string skippedPath;
    std::string itemlessPath;
    std::size_t stopsAfter = SIZE_MAX;
    DispatchSemaphore done{0};

private:
    void note(FSEventReader& reader, std::string report) {
        reader.assertOnQueue();
        reports.push_back(std::move(report));
        if (reports.size() == stopsAfter) {
            reader.stop();
            done.signal();
        }
    }
};

class FSEventReaderTest : public HistoryTest {
protected:
    std::shared_ptr<FSEventReader> reader(FSEventReaderMode mode = FSEventReaderMode::pathBased, bool verbose = false) {
        auto made = FSEventReader::create({storageURL()}, mode, verbose, since_);
        made->setDelegate(delegate_);
        return made;
    }
    /// What one replay reports.
    std::vector<std::string> replay(FSEventReader& reader) {
        reader.start();
        delegate_->done.wait();
        reader.stop();
        return std::exchange(delegate_->reports, {});
    }
    std::vector<std::string> replay() { return replay(*reader()); }
    std::vector<std::string> replayDocuments() {
        return replay(*reader(FSEventReaderMode::docIDBased, /*verbose=*/true));
    }
    std::string done() const { return fmt::format("done {}", history_->currentEventID()); }
    std::string fid(std::string_view name) const { return fmt::format("fid={}", fileID(name)); }

    const std::uint64_t since_ = history_->currentEventID();
    const std::shared_ptr<RecordingDelegate> delegate_ = std::make_shared<RecordingDelegate>();
};

using FSEventReaderDeathTest = FSEventReaderTest;
using Strings = std::vector<std::string>;

TEST_F(FSEventReaderTest, reportsItemsOfWhatIsThere) {
    storage_.file("a.txt", "hello");
    storage_.folder("folder");
    changed("a.txt");
    changed("folder");
    EXPECT_EQ(replay(), (Strings{"update " + fid("a.txt") + " a.txt", "update " + fid("folder") + " folder", done()}));
    EXPECT_TRUE(log_.contains(LogLevel::info, "[INFO] done processing history"));
}

TEST_F(FSEventReaderTest, takesAFileForWhatTheRecorderSaw) {
    storage_.file("a.txt", "hello");
    storage_.file("folder/inner/b.txt", "hello");
    // Each is looked at, too, so that what is told of it is known.
    changed("a.txt");
    changed("folder/inner/b.txt");
    (void)replay();
    const TesselItems looked = std::exchange(delegate_->items, {});
    ASSERT_EQ(looked.size(), 2U);
    const std::uint64_t since = history_->currentEventID();
    for (const char* name : {"a.txt", "folder/inner/b.txt"}) {
        Event event{.path = storage_ / name, .fileID = FileID{fileID(name)}, .kind = ObjectKind::file};
        event.seen = std::make_shared<const FileStatus>(*sys::statx(AT_FDCWD, event.path.c_str()));
        event.folder = FileID{sys::statx(AT_FDCWD, event.path.substr(0, event.path.rfind('/')).c_str())->fileID};
        history_->add(event);
        ASSERT_EQ(::unlink((storage_ / name).c_str()), 0);
    }
    const auto reader = FSEventReader::create({storageURL()}, FSEventReaderMode::pathBased, /*verbose=*/false, since);
    reader->setDelegate(delegate_);
    (void)replay(*reader);
    ASSERT_EQ(delegate_->items.size(), 2U);
    for (std::size_t i = 0; i < looked.size(); ++i) {
        const TesselItem& item = *delegate_->items[i];
        EXPECT_EQ(item.itemIdentifier(), looked[i]->itemIdentifier());
        EXPECT_EQ(item.parentItemIdentifier(), looked[i]->parentItemIdentifier());
        EXPECT_EQ(item.filename(), looked[i]->filename());
        EXPECT_EQ(item.documentSize(), looked[i]->documentSize());
        ASSERT_TRUE(item.versionIdentifier() && looked[i]->versionIdentifier());
        EXPECT_TRUE(std::ranges::equal(*item.versionIdentifier(), *looked[i]->versionIdentifier()));
        EXPECT_EQ(item.capabilities(), looked[i]->capabilities());
        EXPECT_EQ(item.typeIdentifier(), looked[i]->typeIdentifier());
        EXPECT_EQ(*item.fileURL(), *looked[i]->fileURL());
    }
}

TEST_F(FSEventReaderTest, looksAtAFileOfWhichNotEverythingWasSeen) {
    storage_.file("folder/text", "hello");
    storage_.file("folder/closed.txt", "hello");
    ASSERT_EQ(::chmod((storage_ / "folder/closed.txt").c_str(), 0444), 0);
    for (const char* name : {"folder/text", "folder/closed.txt"}) {
        Event event{.path = storage_ / name, .fileID = FileID{fileID(name)}, .kind = ObjectKind::file};
        event.seen = std::make_shared<const FileStatus>(*sys::statx(AT_FDCWD, event.path.c_str()));
        event.folder = FileID{fileID("folder")};
        history_->add(event);
    }
    const std::string text = fid("folder/text");
    const std::string closed = fid("folder/closed.txt");
    // The folder goes, and others have its files' names.
    ASSERT_EQ(::rename((storage_ / "folder").c_str(), (storage_ / "moved").c_str()), 0);
    storage_.file("folder/text", "\x89PNG\r\n\x1A\n");
    storage_.file("folder/closed.txt", "hello");
    EXPECT_EQ(replay(), (Strings{"drop " + text, "drop " + closed, done()}));
}

TEST_F(FSEventReaderTest, recordsNoFileThatLeftTheIndexSinceItWasSeen) {
    storage_.file("a.txt", "hello");
    const std::string path = storage_ / "a.txt";
    const FileID gone{fileID("a.txt")};
    Event event{.path = path, .fileID = gone, .kind = ObjectKind::file};
    event.seen = std::make_shared<const FileStatus>(*sys::statx(AT_FDCWD, path.c_str()));
    event.folder = FileID{sys::statx(AT_FDCWD, storage_.path().c_str())->fileID};
    history_->add(event);
    ASSERT_EQ(::unlink(path.c_str()), 0);
    ASSERT_FALSE(store_->object(gone));
    const std::uint64_t documents = store_->counts().documents;
    EXPECT_EQ(replay(), (Strings{fmt::format("drop fid={}", static_cast<std::uint64_t>(gone)), done()}));
    EXPECT_FALSE(store_->object(gone));
    EXPECT_EQ(store_->counts().documents, documents);
}

TEST_F(FSEventReaderTest, looksAtAFileThatWasSeenOnAnotherDevice) {
    storage_.file("a.txt", "hello");
    Event event{.path = storage_ / "a.txt", .fileID = FileID{fileID("a.txt")}, .kind = ObjectKind::file};
    FileStatus status = *sys::statx(AT_FDCWD, event.path.c_str());
    ++status.device;
    event.seen = std::make_shared<const FileStatus>(status);
    event.folder = FileID{sys::statx(AT_FDCWD, storage_.path().c_str())->fileID};
    history_->add(event);
    ASSERT_EQ(::unlink((storage_ / "a.txt").c_str()), 0);
    EXPECT_EQ(replay(), (Strings{"delete " + fmt::format("fid={}", static_cast<std::uint64_t>(event.fileID)), done()}));
}

TEST_F(FSEventReaderTest, givesDocumentsTheirIDsTogether) {
    for (int i = 0; i < 50; ++i) {
        storage_.file(std::to_string(i));
        changed(std::to_string(i));
    }
    const std::uint64_t before = store_->transactionCount();
    EXPECT_EQ(replay().size(), 51U);
    EXPECT_EQ(store_->transactionCount() - before, 1U);
    for (const auto& item : delegate_->items) EXPECT_TRUE(item->itemIdentifier().starts_with("did="));
}

TEST_F(FSEventReaderTest, reportsADeletionByTheEventsOwnNumber) {
    left("gone.txt", 4711);
    Event present;
    present.path = storage_ / "never.txt";
    present.fileID = FileID{4712};
    history_->add(present);
    EXPECT_EQ(replay(), (Strings{"delete fid=4711", "delete fid=4712", done()}));
}

TEST_F(FSEventReaderTest, dropsAGonePathWithoutANumber) {
    left("gone.txt", 0);
    EXPECT_EQ(replay(), (Strings{done()}));
    EXPECT_TRUE(log_.contains(LogLevel::debug,
                              "[DEBUG] dropping fsevent at \"" + (storage_ / "gone.txt") + "\"; No object at path"));
}

TEST_F(FSEventReaderTest, dropsAFileReplacedByAnotherAtTheSamePath) {
    storage_.file("a.txt");
    Event event;
    event.path = storage_ / "a.txt";
    event.fileID = FileID{4711};
    history_->add(event);
    EXPECT_EQ(replay(), (Strings{"drop fid=4711", done()}));
    EXPECT_TRUE(log_.contains(LogLevel::debug, fmt::format("[DEBUG] dropping fsevent at {}; fileObjectIDs don't match "
                                                           "({}, 4711)",
                                                           storage_ / "a.txt", fileID("a.txt"))));
}

TEST_F(FSEventReaderTest, dropsTheLeavingOfWhatIsThereAgain) {
    storage_.file("a.txt");
    left("a.txt", fileID("a.txt"));
    EXPECT_EQ(replay(), (Strings{"drop " + fid("a.txt"), done()}));
}

TEST_F(FSEventReaderTest, dropsWhatIsBesideTheMonitoredDirectory) {
    storage_.outside().file("Documents2/a.txt");
    Event event;
    event.path = storage_.path() + "2/a.txt";
    event.fileID = FileID{1};
    history_->add(event);
    EXPECT_EQ(replay(), (Strings{done()})) << "the stream itself tells nothing of it";
    storage_.folder("folder");
    changed("folder");
    delegate_->done.wait(std::chrono::seconds(0));
    const auto inner = FSEventReader::create({url("folder")}, FSEventReaderMode::pathBased, false, since_);
    inner->setDelegate(delegate_);
    EXPECT_EQ(replay(*inner), (Strings{done()})) << "the directory itself is not under it";
    EXPECT_TRUE(log_.contains(LogLevel::debug,
                              "[DEBUG] dropping fsevent at " + (storage_ / "folder") + "; URL is not monitored"));
}

TEST_F(FSEventReaderTest, dropsWhatNoItemCanBeMadeOf) {
    storage_.file("a.txt");
    record("a.txt");
    // One item, under the name that it was first seen by.
    ASSERT_EQ(::link((storage_ / "a.txt").c_str(), (storage_ / "b.txt").c_str()), 0);
    changed("b.txt");
    EXPECT_EQ(replay(), (Strings{"drop " + fid("a.txt"), done()}));
    EXPECT_TRUE(log_.contains(LogLevel::debug,
                              "[DEBUG] dropping fsevent at " + (storage_ / "b.txt") + "; can't create local item"));
}

TEST_F(FSEventReaderTest, dropsWhatNoListingComesUpon) {
    storage_.file("report.folio/index");
    changed("report.folio/index");
    EXPECT_EQ(replay(), (Strings{"drop " + fid("report.folio/index"), done()}));
}

TEST_F(FSEventReaderTest, looksNoFurtherThanItsDelegateWants) {
    storage_.file("a.txt");
    storage_.file("b.txt");
    storage_.file("c.txt");
    for (const char* name : {"a.txt", "b.txt", "c.txt"}) changed(name);
    delegate_->skippedPath = storage_ / "a.txt";
    delegate_->itemlessPath = storage_ / "b.txt";
    EXPECT_EQ(replay(), (Strings{"update " + fid("c.txt") + " c.txt", done()}));
    delegate_->looksFurther = false;
    EXPECT_EQ(replay(), (Strings{done()}));
}

TEST_F(FSEventReaderTest, saysWhenEventsWereLost) {
    history_->trim(since_ + 1);
    history_->setCurrent(since_ + 2);
    EXPECT_EQ(replay(), (Strings{"lose", done()}));
    EXPECT_TRUE(log_.contains(LogLevel::info, "[INFO] dropped fsevents"));
}

TEST_F(FSEventReaderTest, saysWhenIDsBeganAnew) {
    for (const EventFlags flags :
         {EventFlags::idsWrapped, EventFlags::kernelDropped, EventFlags::idsWrapped | EventFlags::userDropped}) {
        Event event;
        event.path = storage_ / "a.txt";
        event.flags = flags;
        history_->add(event);
    }
    EXPECT_EQ(replay(), (Strings{"lose", "lose", "lose", done()}));
    EXPECT_EQ(log_.count("[INFO] fsevents id wrapped"), 2U);
    EXPECT_EQ(log_.count("[INFO] dropped fsevents"), 2U);
}

TEST_F(FSEventReaderTest, passesScansOnWhereverTheyAre) {
    for (const std::string& path : {storage_ / "folder", storage_.path(), storage_.outside().path()}) {
        Event event;
        event.path = path;
        event.flags = EventFlags::mustScanSubdirectories;
        history_->add(event);
    }
    EXPECT_EQ(replay(), (Strings{"scan", "scan", "scan", done()}));
}

TEST_F(FSEventReaderTest, saysWhenTheDirectoryMayHaveMoved) {
    Event event;
    event.path = storage_.outside().path();
    event.flags = EventFlags::removed;
    event.fileID = FileID{7};
    history_->add(event);
    event.path = storage_.path();
    event.id = 0;
    history_->add(event);
    EXPECT_EQ(replay(), (Strings{"move", "move", done()}));
}

TEST_F(FSEventReaderTest, readsWhatIsInAPackageForTheDirectoriesInIt) {
    storage_.file("outer.folio/inner/a.txt");
    changed("outer.folio");
    changed("outer.folio/inner/a.txt");
    const auto inside = FSEventReader::create({url("outer.folio/inner")}, FSEventReaderMode::pathBased, false, since_);
    inside->setDelegate(delegate_);
    EXPECT_EQ(replay(*inside), (Strings{"update " + fid("outer.folio/inner/a.txt") + " a.txt", done()}));
}

TEST_F(FSEventReaderTest, readsDocumentChanges) {
    storage_.file("a.txt");
    record("a.txt");
    const DocumentID document = documentID("a.txt");
    documentWent(document, 100, fileID("a.txt"));
    const std::string did = fmt::format("did={}", static_cast<std::uint32_t>(document));
    EXPECT_EQ(replayDocuments(), (Strings{"update " + did + " a.txt", done()}));
    documentWent(document, fileID("a.txt"), 0);
    EXPECT_EQ(replayDocuments(), (Strings{"update " + did + " a.txt", "delete " + did, done()}));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] did delete " + did));
}

TEST_F(FSEventReaderTest, dropsADocumentOfWhichNoItemIsToBeMade) {
    storage_.file("a.txt");
    record("a.txt");
    documentWent(documentID("a.txt"), 100, fileID("a.txt"));
    delegate_->itemlessPath = storage_ / "a.txt";
    const std::string did = fmt::format("did={}", static_cast<std::uint32_t>(documentID("a.txt")));
    EXPECT_EQ(replayDocuments(), (Strings{"drop " + did, done()}));
}

TEST_F(FSEventReaderTest, keepsQuietAboutADeletedDocumentUnlessVerbose) {
    documentWent(DocumentID{42}, 100, 0);
    EXPECT_EQ(replay(*reader(FSEventReaderMode::docIDBased, /*verbose=*/false)), (Strings{"delete did=42", done()}));
    EXPECT_EQ(log_.count("did delete"), 0U);
}

TEST_F(FSEventReaderTest, dropsDocumentPathsThatDoNotParse) {
    for (const char* path :
         {"/.docid/7/changed/1/dst=3", "/.docid/7/changed/1/src=2", "/.docid/7/changed/1/src=2,dst=3/x",
          "/.docid/7/changed/1/src=2,dst=99999999999999999999"}) {
        Event event;
        event.path = path;
        history_->addDocument(event);
        EXPECT_EQ(replayDocuments().back(), done());
        EXPECT_TRUE(log_.contains(LogLevel::error,
                                  std::string("[ERROR] can't parse docID path \"") + path +
                                      "\"; expected format is \"/.docid/$dev/changed/$docid/src=$src,dst=$dst\""));
    }
    EXPECT_TRUE(delegate_->items.empty());
}

TEST_F(FSEventReaderTest, dropsDocumentsWhoseFileIsUnknown) {
    documentWent(DocumentID{42}, 100, 4'000'000'000);
    EXPECT_EQ(replayDocuments(), (Strings{done()}));
    EXPECT_TRUE(log_.contains(LogLevel::debug, "[DEBUG] can't compute url for did=42"));
}

TEST_F(FSEventReaderTest, dropsDocumentsThatAreElsewhere) {
    storage_.folder("folder");
    storage_.file("a.txt");
    record("a.txt");
    documentWent(documentID("a.txt"), 100, fileID("a.txt"));
    const auto inner = FSEventReader::create({url("folder")}, FSEventReaderMode::docIDBased, true, since_);
    inner->setDelegate(delegate_);
    EXPECT_EQ(replay(*inner), (Strings{done()}));
    EXPECT_TRUE(log_.contains(LogLevel::debug,
                              "[DEBUG] dropping fsevent at " + (storage_ / "a.txt") + "; URL is not monitored"));
}

TEST_F(FSEventReaderTest, reportsADocumentWhoseFileIsGoneAsDeleted) {
    storage_.file("a.txt");
    record("a.txt");
    const DocumentID document = documentID("a.txt");
    const std::uint64_t file = fileID("a.txt");
    ASSERT_EQ(::unlink((storage_ / "a.txt").c_str()), 0);
    documentWent(document, 100, file);
    EXPECT_EQ(replayDocuments(), (Strings{fmt::format("delete did={}", static_cast<std::uint32_t>(document)), done()}));
}

TEST_F(FSEventReaderTest, reportsNothingAfterItWasStoppedByItsDelegate) {
    for (int i = 0; i < 20; ++i) {
        storage_.file(std::to_string(i));
        changed(std::to_string(i));
    }
    delegate_->stopsAfter = 5;
    const auto stopped = reader();
    EXPECT_EQ(replay(*stopped).size(), 5U);
    EXPECT_FALSE(stopped->isStarted());
    EXPECT_EQ(history_->observers(), 0U);
}

TEST_F(FSEventReaderTest, goesOnAfterTheLastEventHandled) {
    storage_.file("a.txt");
    storage_.file("b.txt");
    changed("a.txt");
    const auto restarted = reader();
    EXPECT_EQ(replay(*restarted), (Strings{"update " + fid("a.txt") + " a.txt", done()}));
    changed("b.txt");
    EXPECT_EQ(replay(*restarted), (Strings{"update " + fid("b.txt") + " b.txt", done()}));
    EXPECT_EQ(restarted->lastProcessedFSEventID(), history_->currentEventID());
}

TEST_F(FSEventReaderTest, tellsWhatComesAfterTheHistory) {
    const auto live = reader();
    live->start();
    delegate_->done.wait();
    storage_.file("a.txt");
    delegate_->stopsAfter = 2;
    changed("a.txt");
    delegate_->done.wait();
    EXPECT_EQ(delegate_->reports.back(), "update " + fid("a.txt") + " a.txt");
}

TEST_F(FSEventReaderTest, failsWhereNoDocumentIDsCanBeGiven) {
    storage_.file("a.txt");
    changed("a.txt");
    RvStorageManager::defaultManager().setStore(nullptr);
    const auto reports = replay();
    RvStorageManager::defaultManager().setStore(store_);
    ASSERT_EQ(reports.size(), 1U) << "nothing more is reported, not even the end";
    EXPECT_TRUE(reports.front().starts_with("fail "));
}

TEST_F(FSEventReaderTest, saysWhenItIsLetGoOfWithoutBeingStopped) {
    auto forgotten = reader();
    forgotten->start();
    delegate_->done.wait();
    forgotten.reset();
    // The queue may still hold on to it, until its task is over.
    while (log_.count("stream deleted without being stopped;") == 0) std::this_thread::yield();
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "[ERROR] stream deleted without being stopped;"));
    auto stopped = reader();
    stopped->start();
    stopped->stop();
    stopped.reset();
    EXPECT_EQ(log_.count("stream deleted without being stopped;"), 1U);
}

// Whoever lets go of a reader does not wait for what its replay waits for.
TEST_F(FSEventReaderTest, isLetGoOfWhileTheHistoryIsNotReady) {
    // The replay outlives the reader, and with it what it waits for.
    const auto waits = std::make_shared<DispatchSemaphore>(0);
    const auto goesOn = std::make_shared<DispatchSemaphore>(0);
    history_->onDrain([waits, goesOn]() -> Result<void> {
        waits->signal();
        goesOn->wait();
        return {};
    });
    auto made = reader();
    made->start();
    waits->wait();
    made->stop();
    made.reset();
    history_->onDrain(nullptr);
    goesOn->signal();
    EXPECT_EQ(replay(), (Strings{done()}));
}

TEST_F(FSEventReaderDeathTest, isCalledOnItsQueueOnly) {
    EXPECT_DEATH(reader()->assertOnQueue(), "cindral.fsevents-stream");
}

// The question whether a listing may go on.

class ResumeCheckTest : public FSEventReaderTest {
protected:
    FSEventReaderGatherPhaseResumeStatus check(std::uint64_t since) {
        return FSEventReader::canResumeGatherPhase({storageURL()}, since);
    }
    template <typename Status>
    bool is(std::uint64_t since) {
        return std::holds_alternative<Status>(check(since));
    }
};

TEST_F(ResumeCheckTest, mayGoOnWhereNothingHappened) {
    EXPECT_TRUE(is<CanResume>(since_));
    EXPECT_EQ(history_->observers(), 0U);
}

TEST_F(ResumeCheckTest, mayGoOnAfterWhatCameAndChanged) {
    storage_.file("a.txt");
    changed("a.txt");
    // Another event tells that it is gone.
    ASSERT_EQ(::unlink((storage_ / "a.txt").c_str()), 0);
    EXPECT_TRUE(is<CanResume>(since_));
}

TEST_F(ResumeCheckTest, namesTheFirstDeletion) {
    left("folder/first.txt", 1);
    left("second.txt", 2);
    const auto status = check(since_);
    ASSERT_TRUE(std::holds_alternative<DeletionOccurred>(status));
    EXPECT_EQ(std::get<DeletionOccurred>(status).path, storage_ / "folder/first.txt");
    EXPECT_TRUE(is<DeletionOccurred>(since_)) << "also when it is asked again";
    EXPECT_TRUE(is<CanResume>(since_ + 2));
}

TEST_F(ResumeCheckTest, asksOnlyForWhatCameSinceItWasAskedLast) {
    storage_.file("a.txt");
    changed("a.txt");
    EXPECT_TRUE(is<CanResume>(since_));
    // What was seen need not be replayed: it may even be forgotten.
    history_->trim(history_->currentEventID());
    history_->setCurrent(history_->currentEventID());
    left("a.txt", 1);
    EXPECT_FALSE(is<CanResume>(since_));
}

TEST_F(ResumeCheckTest, cannotTellWhereEventsAreMissing) {
    Event event;
    event.flags = EventFlags::kernelDropped;
    event.path = storage_.path();
    history_->add(event);
    EXPECT_TRUE(is<CantReplayHistoricalFSEvents>(since_));
}

TEST_F(ResumeCheckTest, cannotTellWhereAFolderIsToBeScanned) {
    Event event;
    event.flags = EventFlags::mustScanSubdirectories;
    event.path = storage_ / "folder";
    history_->add(event);
    EXPECT_TRUE(is<CantReplayHistoricalFSEvents>(since_));
}

TEST_F(ResumeCheckTest, waitsForNothingThatCannotBeReplayed) {
    history_->trim(since_ + 5);
    history_->setCurrent(since_ + 10);
    const int drains = history_->drains();
    EXPECT_TRUE(is<CantReplayHistoricalFSEvents>(since_));
    EXPECT_TRUE(is<CantReplayHistoricalFSEvents>(since_ + 1'000'000)) << "of the future";
    EXPECT_EQ(history_->drains(), drains);
}

TEST_F(ResumeCheckTest, aListingFromBeforeTheHistoryIsJudgedByWhatItSaw) {
    storage_.file("a.txt");
    FSEntryFinder finder({storageURL()});
    const auto found = finder.find(storage_ / "a.txt");
    const DirectoryReference* folder = found->url->directory().get();
    const auto eventID = FSGatherWitness::shared().begin({storageURL()}, {&folder, 1});
    ASSERT_TRUE(eventID.ok());
    history_->setCurrent(*eventID + 10);
    history_->trim(*eventID + 5);
    EXPECT_TRUE(is<CanResume>(*eventID));
    storage_.file("b.txt");
    EXPECT_TRUE(is<CantReplayHistoricalFSEvents>(*eventID));
    EventHistory::setShared(nullptr);
    EXPECT_TRUE(is<CantReplayHistoricalFSEvents>(*eventID));
}

}  // namespace
}  // namespace cindral::test
