#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <string>

#include "platform/foundation/KeyedArchive.h"
#include "platform/revisions/VolumeIndex.h"
#include "provider/AppLibraryFixture.h"
#include "provider/EditsFixture.h"
#include "provider/Utilities.h"

namespace cindral::test {
namespace {

class LocalTesselKitOperations : public EditsTest {
protected:
    /// Has the file at the name take the document over, as a save does.
    void handOver(const TesselItemIdentifier& document, std::string_view name) {
        (void)identifier(name);  // Records it.
        struct stat status {};
        ASSERT_EQ(::stat((storage_ / name).c_str(), &status), 0);
        IndexChanges changes;
        changes.handOver(DocumentID{static_cast<std::uint32_t>(std::stoul(document.substr(4)))}, FileID{status.st_ino});
        ASSERT_TRUE(store_->apply(changes, {}).ok());
    }
};

TEST_F(LocalTesselKitOperations, importsIntoAFolder) {
    const TemporaryFolder outside;
    storage_.folder("Letters");
    const auto item = import(outside.file("ada.txt", "Dear Ada"), identifier("Letters"));
    ASSERT_EQ(errorOf(item), "");
    EXPECT_EQ((*item)->filename(), "ada.txt");
    EXPECT_EQ((*item)->parentItemIdentifier(), identifier("Letters"));
    EXPECT_EQ((*item)->documentSize(), 8U);
    EXPECT_EQ(contents("Letters/ada.txt"), "Dear Ada");
    // A copy never shares the original's identifier.
    const auto copy = import(storage_ / "Letters/ada.txt", kTesselTemporaryLocalFolderItemIdentifier);
    ASSERT_EQ(errorOf(copy), "");
    EXPECT_NE((*copy)->itemIdentifier(), (*item)->itemIdentifier());
}

TEST_F(LocalTesselKitOperations, theRootTakesNoNewFiles) {
    const TemporaryFolder outside;
    const LogCapture log;
    const auto refused = import(outside.file("a"), kTesselRootContainerItemIdentifier);
    EXPECT_EQ(errorOf(refused), kNoPermission);
    EXPECT_TRUE(refused.error().userInfo().empty());
    const auto folder = createDirectory("new", kTesselRootContainerItemIdentifier);
    EXPECT_EQ(errorOf(folder), kNoPermission);
    EXPECT_TRUE(folder.error().userInfo().empty());
    EXPECT_TRUE(std::filesystem::is_empty(storage_.path()));
    EXPECT_TRUE(log.containsPart(LogLevel::debug, "import document at \"" + (outside / "a") + "\" to parent \"" +
                                                      kTesselRootContainerItemIdentifier + "\""));
    EXPECT_TRUE(log.containsPart(LogLevel::debug, "create directory with name \"new\" in parent \"" +
                                                      kTesselRootContainerItemIdentifier + "\""));
}

TEST_F(LocalTesselKitOperations, theRootTakesWhatIsMovedThere) {
    const TemporaryFolder outside;
    const auto built = import(outside.file("a", "A"), kTesselTemporaryLocalFolderItemIdentifier);
    ASSERT_EQ(errorOf(built), "");
    const auto moved = reparent((*built)->itemIdentifier(), kTesselRootContainerItemIdentifier, "b");
    ASSERT_EQ(errorOf(moved), "");
    EXPECT_EQ((*moved)->itemIdentifier(), (*built)->itemIdentifier());
    EXPECT_EQ((*moved)->parentItemIdentifier(), kTesselRootContainerItemIdentifier);
    EXPECT_EQ(contents("b"), "A");
}

TEST_F(LocalTesselKitOperations, createsFolders) {
    storage_.folder("Letters");
    const auto item = createDirectory("Old \xff\n", identifier("Letters"));
    ASSERT_EQ(errorOf(item), "");
    EXPECT_EQ((*item)->filename(), "Old \xff\n");
    EXPECT_EQ((*item)->itemIdentifier(), identifier("Letters/Old \xff\n"));
}

TEST_F(LocalTesselKitOperations, aTakenNameIsACollisionWithTheItemInTheWay) {
    const TemporaryFolder outside;
    storage_.folder("Letters/taken");
    storage_.file("a", "A");
    const TesselItemIdentifier inTheWay = identifier("Letters/taken");
    const auto expectCollision = [&](const ItemResult& result) {
        EXPECT_EQ(errorOf(result), kCollision);
        const auto item = result.ok() ? nullptr : collidingItem(result.error());
        ASSERT_NE(item, nullptr);
        EXPECT_EQ(item->itemIdentifier(), inTheWay);
    };
    expectCollision(createDirectory("taken", identifier("Letters")));
    expectCollision(import(outside.file("taken"), identifier("Letters")));
    expectCollision(reparent(identifier("a"), identifier("Letters"), "taken"));
    storage_.file("Letters/other");
    expectCollision(rename(identifier("Letters/other"), "taken"));
    EXPECT_EQ(contents("a"), "A");
}

TEST_F(LocalTesselKitOperations, movesWithAndWithoutANewName) {
    storage_.folder("Letters");
    storage_.file("a", "A");
    storage_.folder("Song.tonemill");
    const TesselItemIdentifier document = identifier("a");
    const TesselItemIdentifier package = identifier("Song.tonemill");
    const TesselItemIdentifier folder = identifier("Letters");
    const LogCapture log;
    auto moved = reparent(document, folder);
    ASSERT_EQ(errorOf(moved), "");
    EXPECT_EQ((*moved)->filename(), "a");
    EXPECT_EQ((*moved)->itemIdentifier(), document);
    EXPECT_TRUE(log.containsPart(LogLevel::debug, "move item \"" + document + "\" to parent \"" + folder + "\""));
    moved = reparent(package, folder, "Tune.tonemill");
    ASSERT_EQ(errorOf(moved), "");
    EXPECT_EQ((*moved)->filename(), "Tune.tonemill");
    EXPECT_EQ((*moved)->itemIdentifier(), package);
    EXPECT_TRUE(exists("Letters/Tune.tonemill"));
    EXPECT_EQ(errorOf(reparent(folder, folder)), "KsPOSIXErrorDomain 22");
}

TEST_F(LocalTesselKitOperations, renames) {
    storage_.file("a", "A");
    const TesselItemIdentifier document = identifier("a");
    const LogCapture log;
    const auto renamed = rename(document, "b");
    ASSERT_EQ(errorOf(renamed), "");
    EXPECT_EQ((*renamed)->itemIdentifier(), document);
    EXPECT_EQ((*renamed)->filename(), "b");
    EXPECT_TRUE(log.containsPart(LogLevel::debug, "rename item \"" + document + "\" to name \"b\""));
    EXPECT_EQ(errorOf(rename(document, "a/b")), "KsPOSIXErrorDomain 22");
    EXPECT_EQ(errorOf(rename(document, "")), "KsPOSIXErrorDomain 22");
    EXPECT_EQ(errorOf(rename(document, std::string(256, 'x'))), "KsPOSIXErrorDomain 36");
}

TEST_F(LocalTesselKitOperations, deletesFilesFoldersAndPackages) {
    for (const std::string name : {"Letters", "Song.tonemill"}) {
        storage_.file(name + "/inside/a");
        EXPECT_EQ(errorOf(remove(identifier(name))), "");
        EXPECT_FALSE(exists(name));
    }
    storage_.file("a");
    const TesselItemIdentifier document = identifier("a");
    const LogCapture log;
    EXPECT_EQ(errorOf(remove(document)), "");
    EXPECT_FALSE(exists("a"));
    EXPECT_TRUE(log.containsPart(LogLevel::debug, "delete item \"" + document + "\""));
}

TEST_F(LocalTesselKitOperations, anUnknownItemIsSaidToBeSoInTwoWays) {
    const LogCapture log;
    storage_.folder("Letters");
    EXPECT_EQ(errorOf(import(storage_ / "Letters", kUnknownIdentifier)), kNoSuchItem);
    EXPECT_EQ(errorOf(createDirectory("new", kUnknownIdentifier)), kNoSuchItem);
    EXPECT_EQ(errorOf(rename(kUnknownIdentifier, "new")), kNoSuchItem);
    EXPECT_EQ(log.count("can't find URL matching identifier "), 0U);
    const auto refused = reparent(kUnknownIdentifier, identifier("Letters"));
    EXPECT_EQ(errorOf(refused), kItemNotFound);
    EXPECT_EQ(refused.error().userInfo().at("identifier"), kUnknownIdentifier);
    EXPECT_EQ(errorOf(reparent(identifier("Letters"), kUnknownIdentifier)), kItemNotFound);
    EXPECT_EQ(log.count("can't find URL matching identifier "), 2U);
    EXPECT_EQ(errorOf(remove(kUnknownIdentifier)), kItemNotFound);
    EXPECT_EQ(log.count(std::string("can't find URL matching identifier ") + kUnknownIdentifier), 3U);
}

TEST_F(LocalTesselKitOperations, theRootStaysWhereItIs) {
    storage_.folder("Letters");
    const auto moved = reparent(kTesselRootContainerItemIdentifier, identifier("Letters"));
    EXPECT_EQ(errorOf(moved), kNoPermission);
    EXPECT_TRUE(moved.error().userInfo().empty());
    EXPECT_EQ(errorOf(rename(kTesselRootContainerItemIdentifier, "new")), kNoPermission);
    EXPECT_EQ(errorOf(remove(kTesselRootContainerItemIdentifier)), kNoPermission);
    EXPECT_EQ(errorOf(remove(kTesselTemporaryLocalFolderItemIdentifier)), kNoPermission);
    EXPECT_TRUE(exists("Letters"));
}

TEST_F(LocalTesselKitOperations, whatIsLeftHalfDoneIsClearedAtTheNextStart) {
    // The one that is there clears once, in its own time.
    provider_->waitUntilReady();
    storage_.folder(".TemporaryLocalFolder/.staging-1-1/item");
    storage_.file(".TemporaryLocalFolder/mine");
    provider_.reset();
    provider_ = LocalTesselKit::init();
    provider_->waitUntilReady();
    EXPECT_FALSE(exists(".TemporaryLocalFolder/.staging-1-1"));
    EXPECT_TRUE(exists(".TemporaryLocalFolder/mine"));
}

class LibrariesAtStart : public AppLibraryTest {};

TEST_F(LibrariesAtStart, whatIsLeftHalfDoneInThemIsClearedToo) {
    install("org.example.Writer");
    apps_.folder("data/org.example.Writer/Documents/.TemporaryLocalFolder/.staging-1-1/item");
    const auto provider = LocalTesselKit::init();
    provider->waitUntilReady();
    EXPECT_TRUE(std::filesystem::is_empty(documents("org.example.Writer") + "/.TemporaryLocalFolder"));
}

TEST_F(LocalTesselKitOperations, aProviderMayGoWhileItsEditsAreUnderWay) {
    storage_.file("tree/a/b");
    const TesselItemIdentifier tree = identifier("tree");
    DispatchSemaphore answered(0);
    provider_->deleteItemWithIdentifier(tree, [&](const std::optional<KsError>& error) {
        EXPECT_EQ(error, std::nullopt);
        answered.signal();
    });
    provider_.reset();
    answered.wait();
    EXPECT_FALSE(exists("tree"));
}

// --- Requests that don't wait for each other -------------------------------------------------------------------------------

TEST_F(LocalTesselKitOperations, anEditIsOfTheItemWhereverThatHasGoneMeanwhile) {
    using std::filesystem::rename;
    storage_.folder("Letters");
    storage_.file("x", "X");
    const auto overtake = [this] {
        rename(storage_ / "a", storage_ / "b");
        rename(storage_ / "x", storage_ / "a");
    };
    const auto prepare = [this] {
        if (exists("a")) rename(storage_ / "a", storage_ / "x");
        storage_.file("a", "A");
        return identifier("a");
    };
    TesselItemIdentifier document = prepare();
    EXPECT_EQ(errorOf(deletionOvertaken(document, overtake)), "");
    EXPECT_EQ(contents("a"), "X");
    EXPECT_FALSE(exists("b"));

    document = prepare();
    auto answer = overtaken(
        [&](auto completion) { provider_->renameItemWithIdentifier(document, "c", std::move(completion)); }, overtake);
    ASSERT_EQ(errorOf(answer), "");
    EXPECT_EQ((*answer)->itemIdentifier(), document);
    EXPECT_EQ(contents("a") + contents("c"), "XA");

    document = prepare();
    answer = overtaken(
        [&, parent = identifier("Letters")](auto completion) {
            provider_->reparentItemWithIdentifier(document, parent, "moved", std::move(completion));
        },
        overtake);
    ASSERT_EQ(errorOf(answer), "");
    EXPECT_EQ((*answer)->itemIdentifier(), document);
    EXPECT_EQ(contents("a") + contents("Letters/moved"), "XA");

    document = prepare();
    answer = overtaken([&](auto completion) { provider_->trashItemWithIdentifier(document, std::move(completion)); },
                       overtake);
    ASSERT_EQ(errorOf(answer), "");
    EXPECT_EQ((*answer)->itemIdentifier(), document);
    EXPECT_EQ(contents("a") + contents(".Trash/b"), "XA");
    // To the place that it had when it was moved.
    EXPECT_EQ(keyed_archive::unarchiveString(*attribute(".Trash/b", kXattrTrashPutBackName)), "b");

    answer = overtaken(
        [&](auto completion) { provider_->untrashItemWithIdentifier(document, std::nullopt, std::move(completion)); },
        [&] {
            rename(storage_ / ".Trash/b", storage_ / ".Trash/d");
            storage_.file(".Trash/b", "B");
        });
    ASSERT_EQ(errorOf(answer), "");
    EXPECT_EQ((*answer)->itemIdentifier(), document);
    EXPECT_EQ(contents(".Trash/b") + contents("d"), "BA");
}

TEST_F(LocalTesselKitOperations, whatIsMadeInAFolderIsMadeWhereverThatHasGoneMeanwhile) {
    using std::filesystem::rename;
    const TemporaryFolder outside;
    outside.file("imported");
    storage_.folder("Letters");
    storage_.folder("Other");
    storage_.file("a");
    const TesselItemIdentifier folder = identifier("Letters");
    const auto overtake = [this, turn = 0]() mutable {
        const std::string now = turn == 0 ? "Letters" : "Moved " + std::to_string(turn);
        rename(storage_ / now, storage_ / ("Moved " + std::to_string(turn + 1)));
        storage_.folder(now);
        ++turn;
    };
    auto next = overtake;
    const auto swap = [&next] { next(); };
    const KsURL imported = KsURL::fileURL(outside / "imported");
    EXPECT_EQ(
        errorOf(overtaken([&](auto done) { provider_->importDocumentAtURL(imported, folder, std::move(done)); }, swap)),
        "");
    EXPECT_EQ(errorOf(overtaken([&](auto done) { provider_->createDirectoryWithName("new", folder, std::move(done)); },
                                swap)),
              "");
    EXPECT_EQ(errorOf(overtaken(
                  [&, document = identifier("a")](auto done) {
                      provider_->reparentItemWithIdentifier(document, folder, std::nullopt, std::move(done));
                  },
                  swap)),
              "");
    for (const char* name : {"imported", "new", "a"}) EXPECT_TRUE(exists(std::string("Moved 3/") + name)) << name;
}

TEST_F(LocalTesselKitOperations, whatIsGoneForGoodMeanwhileIsSaidToBeSo) {
    using std::filesystem::rename;
    storage_.folder("Letters");
    storage_.file("x", "X");
    const auto overtake = [this] { rename(storage_ / "x", storage_ / "a"); };
    const auto prepare = [this] {
        if (exists("a")) rename(storage_ / "a", storage_ / "x");
        storage_.file("a", "A");
        return identifier("a");
    };
    TesselItemIdentifier document = prepare();
    EXPECT_EQ(errorOf(deletionOvertaken(document, overtake)), kItemNotFound);
    document = prepare();
    EXPECT_EQ(errorOf(overtaken([&](auto done) { provider_->renameItemWithIdentifier(document, "c", std::move(done)); },
                                overtake)),
              kNoSuchItem);
    document = prepare();
    EXPECT_EQ(
        errorOf(overtaken([&](auto done) { provider_->trashItemWithIdentifier(document, std::move(done)); }, overtake)),
        kItemNotFound);
    document = prepare();
    const auto moved = overtaken(
        [&, parent = identifier("Letters")](auto done) {
            provider_->reparentItemWithIdentifier(document, parent, std::nullopt, std::move(done));
        },
        overtake);
    EXPECT_EQ(errorOf(moved), kItemNotFound);
    EXPECT_EQ(moved.error().userInfo().at("identifier"), document);
    EXPECT_EQ(contents("a"), "X");

    // The folder that was to take something.
    document = identifier("a");
    const TesselItemIdentifier folder = identifier("Letters");
    const auto refused = overtaken(
        [&](auto done) { provider_->reparentItemWithIdentifier(document, folder, std::nullopt, std::move(done)); },
        [&] { std::filesystem::remove(storage_ / "Letters"); });
    EXPECT_EQ(errorOf(refused), kItemNotFound);
    EXPECT_EQ(refused.error().userInfo().at("identifier"), folder);
    EXPECT_EQ(contents("a"), "X");
}

// A save gives the document's number to another file, in the same place.
TEST_F(LocalTesselKitOperations, anEditIsOfTheDocumentThatWasSavedMeanwhile) {
    storage_.file("a", "before");
    const TesselItemIdentifier document = identifier("a");
    EXPECT_EQ(errorOf(deletionOvertaken(document,
                                        [&] {
                                            storage_.file("saved", "after");
                                            std::filesystem::rename(storage_ / "saved", storage_ / "a");
                                            handOver(document, "a");
                                        })),
              "");
    EXPECT_FALSE(exists("a"));
}

// What took the name can't be told as an item: that is the answer then.
TEST_F(LocalTesselKitOperations, aResultWithoutAnItemIsAnInvalidIdentifier) {
    storage_.folder("Letters");
    const TesselItemIdentifier folder = identifier("Letters");
    // Without a store no document gets an identifier.
    const LogCapture log;
    RvStorageManager::defaultManager().setStore(nullptr);
    EXPECT_EQ(errorOf(import("/proc/self/comm", kTesselTemporaryLocalFolderItemIdentifier)), kInvalidItemIdentifier);
    EXPECT_TRUE(log.containsPart(LogLevel::error, "identifier lookup failed for URL \"" +
                                                      url(".TemporaryLocalFolder/comm").description() + "\""));
}

}  // namespace
}  // namespace cindral::test
