#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <filesystem>

#include "platform/foundation/KeyedArchive.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/SysFaults.h"
#include "platform/roster/Roster.h"
#include "platform/tessel/TesselManager.h"
#include "provider/EditsFixture.h"
#include "provider/Utilities.h"
#include "support/OrdinaryPerson.h"

namespace cindral::test {
namespace {

class LocalTesselKitTrash : public EditsTest {
protected:
    std::optional<KsDate> trashDate(std::string_view name) {
        const auto value = attribute(name, kXattrTrashDateName);
        return value ? keyed_archive::unarchiveDate(*value) : std::nullopt;
    }
    std::optional<std::string> putBack(std::string_view name) {
        const auto value = attribute(name, kXattrTrashPutBackName);
        return value ? keyed_archive::unarchiveString(*value) : std::nullopt;
    }
    void setTrashDate(std::string_view name, const KsDate& date) {
        setAttribute(name, kXattrTrashDateName, keyed_archive::archive(date));
    }
};

constexpr KsDate kThen{1'000'000'000, 0};
constexpr KsDate kLater{1'000'000'001, 0};

TEST_F(LocalTesselKitTrash, movesIntoTheTrashWithDateAndFormerPlace) {
    storage_.file("Letters/2026/ada.txt", "Dear Ada");
    const TesselItemIdentifier document = identifier("Letters/2026/ada.txt");
    const KsDate before = KsDate::now();
    const LogCapture log;
    const auto trashed = trash(document);
    ASSERT_EQ(errorOf(trashed), "");
    EXPECT_TRUE((*trashed)->isTrashed());
    EXPECT_EQ((*trashed)->itemIdentifier(), document);
    EXPECT_EQ((*trashed)->parentItemIdentifier(), identifier(".Trash"));
    EXPECT_EQ(contents(".Trash/ada.txt"), "Dear Ada");
    EXPECT_FALSE(exists("Letters/2026/ada.txt"));
    ASSERT_TRUE(trashDate(".Trash/ada.txt"));
    EXPECT_GE(trashDate(".Trash/ada.txt")->seconds, before.seconds);
    EXPECT_EQ(putBack(".Trash/ada.txt"), "Letters/2026/ada.txt");
    EXPECT_TRUE(log.contains(LogLevel::debug, "[DEBUG] trash is located at \"" + url(".Trash").description() + "\""));
    EXPECT_TRUE(log.containsPart(LogLevel::debug, "trash item \"" + document + "\""));
    EXPECT_TRUE(log.contains(LogLevel::debug, "[DEBUG] setting trash date on " + url(".Trash/ada.txt").description()));
    EXPECT_TRUE(
        log.contains(LogLevel::debug, "[DEBUG] setting putback string on " + url(".Trash/ada.txt").description()));
    EXPECT_TRUE(log.contains(
        LogLevel::debug, "[DEBUG] setting putback 'Letters/2026/ada.txt' on " + url(".Trash/ada.txt").description()));
}

TEST_F(LocalTesselKitTrash, takesFoldersPackagesAndNamesOfAnyBytes) {
    for (const std::string name : {"Letters", "Song.tonemill", "\xff\n"}) {
        storage_.file("in/" + name + "/a");
        ASSERT_EQ(errorOf(trash(identifier("in/" + name))), "");
        EXPECT_EQ(putBack(".Trash/" + name), "in/" + name);
        ASSERT_EQ(errorOf(untrash(identifier(".Trash/" + name))), "");
        EXPECT_TRUE(exists("in/" + name + "/a"));
    }
}

TEST_F(LocalTesselKitTrash, aNameTakenInTheTrashIsACollision) {
    storage_.file(".Trash/a", "old");
    storage_.file("a", "new");
    const auto trashed = trash(identifier("a"));
    EXPECT_EQ(errorOf(trashed), kCollision);
    EXPECT_EQ(collidingItem(trashed.error())->itemIdentifier(), identifier(".Trash/a"));
    EXPECT_EQ(contents("a"), "new");
    EXPECT_EQ(trashDate(".Trash/a"), std::nullopt);
    EXPECT_EQ(trashDate("a"), std::nullopt);
}

TEST_F(LocalTesselKitTrash, whatIsInTheTrashStaysAndIsNotForgottenWhereItCameFrom) {
    storage_.file("Letters/a");
    ASSERT_EQ(errorOf(trash(identifier("Letters/a"))), "");
    const auto date = trashDate(".Trash/a");
    const auto again = trash(identifier(".Trash/a"));
    ASSERT_EQ(errorOf(again), "");
    EXPECT_TRUE((*again)->isTrashed());
    EXPECT_EQ(putBack(".Trash/a"), "Letters/a");
    EXPECT_EQ(trashDate(".Trash/a"), date);
}

// The trash lies in the first folder of the name, whatever else is called so.
TEST_F(LocalTesselKitTrash, belongsToTheFirstDocumentsFolder) {
    storage_.file("more/Documents/a");
    ASSERT_EQ(errorOf(trash(identifier("more/Documents/a"))), "");
    EXPECT_TRUE(exists(".Trash/a"));
    EXPECT_FALSE(exists("more/Documents/.Trash"));
    EXPECT_EQ(putBack(".Trash/a"), "more/Documents/a");
}

// What vanishes between its identifier and its item has neither.
TEST_F(LocalTesselKitTrash, anItemThatCannotBeMadeIsAnInvalidIdentifier) {
    storage_.file(".Trash/a");
    const TesselItemIdentifier trashed = identifier(".Trash/a");
    const std::string line = "[ERROR] can't create item for URL \"" + url(".Trash/a").description() + "\"";
    bool isSeen = false;
    bool isReached = true;
    for (int n = 1; isReached; ++n) {
        isReached = false;
        const LogCapture log;
        const sys::FaultInjection faults([&, calls = 0](const char* /*call*/) mutable {
            isReached |= ++calls >= n;
            return calls >= n ? ENOENT : 0;
        });
        const auto answered = trash(trashed);
        if (!log.contains(LogLevel::error, line)) continue;
        isSeen = true;
        EXPECT_EQ(errorOf(answered), kInvalidItemIdentifier);
    }
    EXPECT_TRUE(isSeen);
}

// The record of a library whose container holds the item, but not in its Documents folder.
TEST_F(LocalTesselKitTrash, aPlaceOutsideOfTheLibrarysDocumentsIsNotRecorded) {
    storage_.file("a");
    const KsURL container = *KsURL::fileURL(storage_.outside().path()).deletingLastPathComponent();
    RoApplicationWorkspace::defaultWorkspace().setOwnRecord(
        std::make_shared<RoBundleProxy>(RoBundleProxy::Values{"com.example.Own", container, "Own"}));
    const LogCapture log;
    EXPECT_EQ(errorOf(trash(identifier("a"))), "");
    EXPECT_TRUE(log.contains(LogLevel::error, "[ERROR] could't compute putback string (path: " + (storage_ / "a") +
                                                  ", basePath: " + container.path() + "/Documents)"));
    EXPECT_TRUE(trashDate(".Trash/a"));
    EXPECT_EQ(putBack(".Trash/a"), std::nullopt);
}

class AnotherStorage : public EditsTest {
protected:
    /// Publishes another folder as the storage, under that name.
    std::string publish(const std::string& name) {
        RootDirectories::shared().remove(storage_.path());
        const std::string path = folder_.folder(name);
        if (!RootDirectories::shared().add(path, RootPolicy::storage).ok()) std::abort();
        TesselManager::defaultManager().setDocumentStorageURL(KsURL::fileURL(path));
        return path;
    }
    ~AnotherStorage() override {
        for (const auto& root : RootDirectories::shared().all()) RootDirectories::shared().remove(root->path);
    }

    TemporaryFolder folder_;
};

TEST_F(AnotherStorage, withoutADocumentsFolderThereIsNoTrash) {
    const std::string path = publish("Storage");
    folder_.file("Storage/a");
    const LogCapture log;
    const auto refused = trash(*provider_->persistentIdentifierForItemAtURL(KsURL::fileURL(path + "/a")));
    EXPECT_EQ(errorOf(refused), kInvalidParameter);
    EXPECT_EQ(refused.error().userInfo().at("parameter"), "sourceURL");
    EXPECT_EQ(refused.error().userInfo().at("value"), "file://" + path + "/a");
    EXPECT_TRUE(log.contains(LogLevel::error, "[ERROR] no Documents directory found in path \"" + path + "/a\""));
}

// Nothing is made outside of what is published.
TEST_F(AnotherStorage, aDocumentsFolderAboveTheRootHasNoTrash) {
    const std::string path = publish("Documents/inner/Documents");
    folder_.file("Documents/inner/Documents/a");
    const LogCapture log;
    const auto refused = trash(*provider_->persistentIdentifierForItemAtURL(KsURL::fileURL(path + "/a")));
    EXPECT_EQ(errorOf(refused), kInvalidParameter);
    EXPECT_EQ(refused.error().userInfo().at("parameter"), "trashComponents");
    EXPECT_TRUE(log.containsPart(LogLevel::error, "can't build trash URL from components \""));
    EXPECT_FALSE(std::filesystem::exists(folder_ / "Documents/.Trash"));
}

TEST_F(LocalTesselKitTrash, aTrashThatLeadsElsewhereIsRefused) {
    const TemporaryFolder outside;
    storage_.file("a");
    std::filesystem::create_directory_symlink(outside.path(), storage_ / ".Trash");
    EXPECT_NE(errorOf(trash(identifier("a"))), "");
    EXPECT_TRUE(exists("a"));
    EXPECT_EQ(sweep(KsDate::now())->code(), ENOTDIR);
    EXPECT_TRUE(std::filesystem::is_empty(outside.path()));
}

TEST_F(LocalTesselKitTrash, unknownAndFixedItemsAreRefused) {
    EXPECT_EQ(errorOf(trash(kUnknownIdentifier)), kItemNotFound);
    EXPECT_EQ(errorOf(untrash(kUnknownIdentifier)), kItemNotFound);
    EXPECT_EQ(errorOf(trash(kTesselRootContainerItemIdentifier)), kNoPermission);
    EXPECT_EQ(errorOf(trash(kTesselTemporaryLocalFolderItemIdentifier)), kNoPermission);
    EXPECT_EQ(errorOf(trash(identifier(".Trash"))), "KsPOSIXErrorDomain 22");
}

// --- Put-back ------------------------------------------------------------------------------------------------------------

TEST_F(LocalTesselKitTrash, goesBackToWhereItWas) {
    storage_.file("Letters/a", "A");
    const TesselItemIdentifier document = identifier("Letters/a");
    ASSERT_EQ(errorOf(trash(document)), "");
    const LogCapture log;
    const auto restored = untrash(document);
    ASSERT_EQ(errorOf(restored), "");
    EXPECT_FALSE((*restored)->isTrashed());
    EXPECT_EQ((*restored)->itemIdentifier(), document);
    EXPECT_EQ(contents("Letters/a"), "A");
    EXPECT_EQ(trashDate("Letters/a"), std::nullopt);
    EXPECT_EQ(putBack("Letters/a"), "Letters/a");
    EXPECT_TRUE(log.containsPart(LogLevel::debug, " untrash item \"" + document + "\""));
    EXPECT_TRUE(
        log.contains(LogLevel::debug, "[DEBUG] putback: 'Letters/a' library: '" + storageURL().description() + "'"));
    EXPECT_TRUE(log.contains(LogLevel::debug, "[DEBUG] removing trash date xattr"));
}

TEST_F(LocalTesselKitTrash, goesBackToTheRequestedParent) {
    storage_.file("Letters/a");
    storage_.folder("Other");
    ASSERT_EQ(errorOf(trash(identifier("Letters/a"))), "");
    ASSERT_EQ(errorOf(untrash(identifier(".Trash/a"), identifier("Other"))), "");
    EXPECT_TRUE(exists("Other/a"));
    ASSERT_EQ(errorOf(trash(identifier("Other/a"))), "");
    ASSERT_EQ(errorOf(untrash(identifier(".Trash/a"), kTesselRootContainerItemIdentifier)), "");
    EXPECT_TRUE(exists("a"));
}

TEST_F(LocalTesselKitTrash, aParentThatIsTrashedItselfIsNoPlaceToGoBackTo) {
    storage_.file("Letters/a");
    storage_.folder("Old");
    ASSERT_EQ(errorOf(trash(identifier("Letters/a"))), "");
    ASSERT_EQ(errorOf(trash(identifier("Old"))), "");
    const LogCapture log;
    // To the recorded place …
    const TesselItemIdentifier old = identifier(".Trash/Old");
    ASSERT_EQ(errorOf(untrash(identifier(".Trash/a"), old)), "");
    EXPECT_TRUE(exists("Letters/a"));
    EXPECT_TRUE(log.containsPart(LogLevel::debug, "can't use provided parent item " + old + " because it's trashed; "));
    // … and, where that is gone, to the library's root.
    ASSERT_EQ(errorOf(trash(identifier("Letters/a"))), "");
    std::filesystem::remove(storage_ / "Letters");
    ASSERT_EQ(errorOf(untrash(identifier(".Trash/a"), old)), "");
    EXPECT_TRUE(exists("a"));
    EXPECT_TRUE(
        log.contains(LogLevel::debug, "[DEBUG] putback url is not reachable; " + url("Letters/a").description()));
    EXPECT_TRUE(log.contains(LogLevel::debug, "[DEBUG] Documents's root as recover location"));
}

TEST_F(LocalTesselKitTrash, withoutARecordItGoesToTheLibrarysRoot) {
    storage_.file(".Trash/folder/a");
    for (const std::string record : {"", "/etc/passwd", "../outside", ".Trash/folder/b", "none/a"}) {
        storage_.file(".Trash/a");
        if (!record.empty()) setAttribute(".Trash/a", kXattrTrashPutBackName, keyed_archive::archive(record));
        ASSERT_EQ(errorOf(untrash(identifier(".Trash/a"))), "") << record;
        EXPECT_TRUE(exists("a")) << record;
        std::filesystem::remove(storage_ / "a");
    }
    // What lies in a folder that was trashed, likewise.
    ASSERT_EQ(errorOf(untrash(identifier(".Trash/folder/a"))), "");
    EXPECT_TRUE(exists("a"));
}

TEST_F(LocalTesselKitTrash, aTakenNameMakesRoomOnTheWayBack) {
    storage_.file("a.txt", "old");
    ASSERT_EQ(errorOf(trash(identifier("a.txt"))), "");
    storage_.file("a.txt", "new");
    const auto restored = untrash(identifier(".Trash/a.txt"));
    ASSERT_EQ(errorOf(restored), "");
    EXPECT_EQ((*restored)->filename(), "a 2.txt");
    EXPECT_EQ(contents("a.txt"), "new");
    EXPECT_EQ(contents("a 2.txt"), "old");
    EXPECT_EQ(trashDate("a 2.txt"), std::nullopt);
}

TEST_F(LocalTesselKitTrash, whatIsNotInTheTrashIsNotTakenOutOfIt) {
    storage_.file("a");
    const LogCapture log;
    EXPECT_EQ(errorOf(untrash(identifier("a"))), kInvalidParameter);
    EXPECT_TRUE(log.contains(LogLevel::debug, "[DEBUG] item is not in trash"));
}

TEST_F(LocalTesselKitTrash, withNowhereToGoItStays) {
    storage_.file(".Trash/a");
    RoApplicationWorkspace::defaultWorkspace().setOwnRecord(nullptr);
    const LogCapture log;
    EXPECT_EQ(errorOf(untrash(identifier(".Trash/a"))), kInvalidParameter);
    EXPECT_TRUE(exists(".Trash/a"));
    EXPECT_TRUE(
        log.contains(LogLevel::debug, "[DEBUG] can't compute valid parent URL for " + url(".Trash/a").description()));
    // Trashing still works; only the record is missing.
    storage_.file("b");
    EXPECT_EQ(errorOf(trash(identifier("b"))), "");
    EXPECT_TRUE(log.contains(LogLevel::error, "[ERROR] couldn't find app library for " + url("b").description()));
    EXPECT_TRUE(trashDate(".Trash/b"));
}

TEST_F(LocalTesselKitTrash, whatCannotBearAttributesIsTrashedAllTheSame) {
    std::filesystem::create_symlink("nowhere", storage_ / "link");
    const LogCapture log;
    const auto trashed = trash(identifier("link"));
    ASSERT_EQ(errorOf(trashed), "");
    EXPECT_TRUE((*trashed)->isTrashed());
    EXPECT_TRUE(log.containsPart(LogLevel::error, "com.vemra.trash.time#PS"));
    EXPECT_TRUE(log.contains(LogLevel::error,
                             "[ERROR] couldn't set putback xattr (" + KsError::posix(EPERM).description() + ")"));
    EXPECT_EQ(errorOf(untrash((*trashed)->itemIdentifier())), "");
    EXPECT_TRUE(exists("link"));
}

TEST_F(LocalTesselKitTrash, aPutBackCanBeFollowed) {
    storage_.file(".Trash/a");
    DispatchSemaphore answered(0);
    std::optional<KsError> error;
    const auto progress =
        provider_->untrashItemWithIdentifier(identifier(".Trash/a"), std::nullopt, [&](const ItemResult& item) {
            if (!item.ok()) error = item.error();
            answered.signal();
        });
    ASSERT_NE(progress, nullptr);
    answered.wait();
    EXPECT_EQ(error, std::nullopt);
    // What is one rename counts nothing.
    EXPECT_EQ(progress->counts().totalItems, 0U);
    EXPECT_TRUE(exists("a"));
}

// --- Sweep ---------------------------------------------------------------------------------------------------------------

TEST_F(LocalTesselKitTrash, theSweepTakesWhatIsOlderThanTheDate) {
    storage_.file(".Trash/old");
    storage_.file(".Trash/folder/a");
    storage_.file(".Trash/equal");
    storage_.file(".Trash/.hidden");
    setTrashDate(".Trash/old", kThen);
    setTrashDate(".Trash/folder", kThen);
    setTrashDate(".Trash/.hidden", kThen);
    setTrashDate(".Trash/equal", kLater);
    storage_.file("old");
    setTrashDate("old", kThen);
    const LogCapture log;
    EXPECT_EQ(sweep(kLater), std::nullopt);
    EXPECT_FALSE(exists(".Trash/old"));
    EXPECT_FALSE(exists(".Trash/folder"));
    EXPECT_FALSE(exists(".Trash/.hidden"));
    // Trashed at the very moment: kept.
    EXPECT_TRUE(exists(".Trash/equal"));
    // Not in the trash, whatever it bears.
    EXPECT_TRUE(exists("old"));
    EXPECT_TRUE(log.containsPart(LogLevel::debug, "remove trashed items older than 2001-09-09T01:46:41Z"));
    EXPECT_TRUE(log.contains(LogLevel::debug, "[DEBUG] wait until all deletions are complete"));
    EXPECT_TRUE(log.contains(LogLevel::debug, "[DEBUG] " + url(".Trash/old").description() +
                                                  " was trashed before reference date, let's remove it"));
}

// The section holds all that the sweep has to say, and is closed when it answers.
TEST_F(LocalTesselKitTrash, theSweepIsOneSectionOfTheLog) {
    storage_.file(".Trash/old");
    setTrashDate(".Trash/old", kThen);
    const LogCapture log;
    EXPECT_EQ(sweep(kLater), std::nullopt);
    std::vector<std::string> lines;
    for (auto& [level, line] : log.lines()) lines.push_back(std::move(line));
    const auto opening = std::ranges::find_if(lines, [](const auto& line) {
        return line.ends_with(" remove trashed items older than 2001-09-09T01:46:41Z");
    });
    ASSERT_NE(opening, lines.end());
    const std::string mark = "[DEBUG] ┏";
    ASSERT_TRUE(opening->starts_with(mark));
    const std::string number = opening->substr(mark.size(), opening->find(' ', mark.size()) - mark.size());
    const auto closing = std::ranges::find(lines, "[DEBUG] ┗" + number);
    ASSERT_NE(closing, lines.end());
    const auto deletion = std::ranges::find(
        lines, "[DEBUG] " + url(".Trash/old").description() + " was trashed before reference date, let's remove it");
    const auto wait = std::ranges::find(lines, "[DEBUG] wait until all deletions are complete");
    EXPECT_LT(opening, deletion);
    EXPECT_LT(deletion, wait);
    EXPECT_LT(wait, closing);
}

TEST_F(LocalTesselKitTrash, whatHasNoDateIsGivenOneAndSurvives) {
    storage_.file(".Trash/none");
    storage_.file(".Trash/bad");
    setAttribute(".Trash/bad", kXattrTrashDateName, bytesOf(std::string_view("no date")));
    const KsDate future{KsDate::now().seconds + 3600, 0};
    const LogCapture log;
    EXPECT_EQ(sweep(future), std::nullopt);
    EXPECT_TRUE(trashDate(".Trash/none"));
    EXPECT_TRUE(trashDate(".Trash/bad"));
    EXPECT_TRUE(log.contains(LogLevel::debug, "[DEBUG] can't find trash date for URL \"" +
                                                  url(".Trash/none").description() + "\"; set current date"));
    EXPECT_TRUE(log.contains(LogLevel::debug, "[DEBUG] can't unarchive xattr data for URL \"" +
                                                  url(".Trash/bad").description() + "\"; set current date"));
    EXPECT_EQ(sweep(future), std::nullopt);
    EXPECT_FALSE(exists(".Trash/none"));
    EXPECT_FALSE(exists(".Trash/bad"));
}

TEST_F(LocalTesselKitTrash, linksGoByWhenTheyLastChanged) {
    std::filesystem::create_symlink("nowhere", storage_ / "link");
    ASSERT_EQ(errorOf(trash(identifier("link"))), "");
    EXPECT_EQ(sweep(kLater), std::nullopt);
    EXPECT_TRUE(exists(".Trash/link"));
    EXPECT_EQ(sweep({KsDate::now().seconds + 3600, 0}), std::nullopt);
    EXPECT_FALSE(exists(".Trash/link"));
}

// The mode of a file that may not be written forbids attributes too.
TEST_F(LocalTesselKitTrash, whatCannotBeGivenADateGoesByWhenItLastChanged) {
    for (const char* name : {"a", ".Trash/dated"}) ::chmod(storage_.file(name).c_str(), 0444);
    setTrashDate(".Trash/dated", {KsDate::now().seconds + 7200, 0});
    OrdinaryPerson::giveTo(storage_.outside().path());
    const OrdinaryPerson person;
    ASSERT_EQ(errorOf(trash(identifier("a"))), "");
    EXPECT_EQ(sweep(kLater), std::nullopt);
    EXPECT_TRUE(exists(".Trash/a"));
    EXPECT_EQ(sweep({KsDate::now().seconds + 3600, 0}), std::nullopt);
    EXPECT_FALSE(exists(".Trash/a"));
    EXPECT_TRUE(exists(".Trash/dated"));
}

// The disk, or what a file may bear of attributes, is full: that says nothing of when it was trashed.
TEST_F(LocalTesselKitTrash, whatHasNoRoomForADateIsKept) {
    const std::string path = storage_.file(".Trash/full");
    // A file system that takes them all has room for the date, too, and the file is kept for having it.
    for (const std::size_t size : {2000U, 500U, 100U, 20U, 5U, 1U}) {
        for (int i = 0; i < 100; ++i) {
            const std::string name = "user.fill." + std::to_string(size) + "." + std::to_string(i);
            if (::setxattr(path.c_str(), name.c_str(), std::string(size, 'x').data(), size, 0) != 0) break;
        }
    }
    EXPECT_EQ(sweep({KsDate::now().seconds + 3600, 0}), std::nullopt);
    EXPECT_TRUE(exists(".Trash/full"));
}

TEST_F(LocalTesselKitTrash, whatHasNoIdentifierIsKept) {
    storage_.file(".Trash/old");
    setTrashDate(".Trash/old", kThen);
    // Without a store no document gets an identifier.
    RvStorageManager::defaultManager().setStore(nullptr);
    const LogCapture log;
    EXPECT_EQ(sweep(kLater), std::nullopt);
    EXPECT_TRUE(exists(".Trash/old"));
    EXPECT_TRUE(log.contains(LogLevel::error,
                             "[ERROR] identifier lookup failed for URL \"" + url(".Trash/old").description() + "\""));
}

TEST_F(LocalTesselKitTrash, aSweepOfNothingIsDone) {
    const LogCapture log;
    EXPECT_EQ(sweep(kLater), std::nullopt);
    EXPECT_FALSE(exists(".Trash"));
    EXPECT_EQ(log.count("[ERROR]"), 0U);
}

TEST_F(LocalTesselKitTrash, theSweepAnswersOnItsQueueWhenAllIsGone) {
    constexpr int kFiles = 200;
    for (int i = 0; i < kFiles; ++i) {
        const std::string name = ".Trash/" + std::to_string(i);
        storage_.file(name + "/a");
        setTrashDate(name, kThen);
    }
    DispatchSemaphore answered(0);
    std::string thread;
    std::size_t left = kFiles;
    provider_->removeTrashedItemsOlderThanDate(kLater, [&](const std::optional<KsError>& error) {
        EXPECT_EQ(error, std::nullopt);
        char name[16] = {};
        ::pthread_getname_np(::pthread_self(), name, sizeof name);
        thread = name;
        left = static_cast<std::size_t>(std::distance(std::filesystem::directory_iterator(storage_ / ".Trash"), {}));
        answered.signal();
    });
    answered.wait();
    EXPECT_EQ(left, 0U);
    EXPECT_EQ(thread, std::string("cindral.auto-delete.notifier").substr(0, 15));
}

// What one has deleted is gone when the other comes to it, and somebody takes things out of the trash meanwhile.
TEST_F(LocalTesselKitTrash, sweepsAtTheSameTimeAreAllDone) {
    constexpr int kFiles = 300;
    for (int i = 0; i < kFiles; ++i) {
        const std::string name = ".Trash/" + std::to_string(i);
        storage_.file(name);
        setTrashDate(name, kThen);
    }
    constexpr int kSweeps = 3;
    const LogCapture log;
    DispatchGroup sweeps;
    std::atomic<int> failed = 0;
    for (int i = 0; i < kSweeps; ++i) {
        sweeps.enter();
        provider_->removeTrashedItemsOlderThanDate(kLater, [&](const std::optional<KsError>& error) {
            failed += error ? 1 : 0;
            sweeps.leave();
        });
    }
    for (int i = 0; i < kFiles; i += 7) {
        const std::string name = std::to_string(i);
        (void)::rename((storage_ / (".Trash/" + name)).c_str(), (storage_ / name).c_str());
    }
    sweeps.wait();
    EXPECT_EQ(failed, 0);
    EXPECT_EQ(log.count("[ERROR] can't remove item"), 0U);
    EXPECT_TRUE(std::filesystem::is_empty(storage_ / ".Trash"));
}

TEST_F(LocalTesselKitTrash, whatCannotBeRemovedIsTold) {
    storage_.file(".Trash/stays/sub/a");
    storage_.file(".Trash/goes");
    for (const char* name : {".Trash/stays", ".Trash/goes"}) setTrashDate(name, kThen);
    const std::string locked = storage_ / ".Trash/stays/sub";
    ::chmod(locked.c_str(), 0555);
    OrdinaryPerson::giveTo(storage_.outside().path());
    const LogCapture log;
    std::optional<KsError> error;
    {
        const OrdinaryPerson person;
        error = sweep(kLater);
    }
    ::chmod(locked.c_str(), 0755);
    EXPECT_EQ(errorOf(error), "KsPOSIXErrorDomain 13");
    EXPECT_TRUE(log.containsPart(LogLevel::error, "can't remove item "));
    EXPECT_TRUE(exists(".Trash/stays/sub/a"));
    EXPECT_FALSE(exists(".Trash/goes"));
}

}  // namespace
}  // namespace cindral::test
