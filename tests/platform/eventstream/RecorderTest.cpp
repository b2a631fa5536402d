#include "platform/eventstream/Recorder.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <gmock/gmock.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>

#include "RecorderFixture.h"

namespace cindral::test {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::UnorderedElementsAre;
using Changes = std::set<std::string>;
using std::chrono::milliseconds;
using std::chrono::seconds;

constexpr DocumentID kNoDocument{};
constexpr FileID kNothing{};

// MARK: Objects that come, change and go

TEST_P(RecorderTest, hasNoEventsOfWhatWasThereAtTheFirstReading) {
    write("a");
    makeFolder("f");
    write("f/b");
    start();
    EXPECT_THAT(changes(), IsEmpty());
    expectIndexIsTree();
}

TEST_P(RecorderTest, tellsOfANewFile) {
    start();
    write("a");
    EXPECT_EQ(changes(), (Changes{"a"}));
    expectIndexIsTree();
}

TEST_P(RecorderTest, tellsOfAWrite) {
    write("a");
    start();
    append("a", "more");
    EXPECT_EQ(changes(), (Changes{"a"}));
    EXPECT_THAT(changes(), IsEmpty());
}

TEST_P(RecorderTest, tellsOfAWriteOfTheSameSize) {
    write("a", "one");
    start();
    write("a", "two");
    EXPECT_EQ(changes(), (Changes{"a"}));
}

TEST_P(RecorderTest, tellsOfManyWritesOnce) {
    write("a");
    start();
    for (int i = 0; i < 100; ++i) {
        append("a", "more");
        if (i % 10 == 0) {
            ASSERT_TRUE(recorder().drain().ok());
        }
    }
    ASSERT_TRUE(recorder().drain().ok());
    const auto batch = recorder().pathEvents(seenEvents_, 1'000);
    ASSERT_TRUE(batch.ok());
    EXPECT_EQ(batch->events.size(), 1u);
}

TEST_P(RecorderTest, tellsOfNewModeAndAttributes) {
    write("a");
    write("b");
    start();
    ASSERT_EQ(::chmod(path("a").c_str(), 0600), 0);
    setTag("b", "red");
    EXPECT_EQ(changes(), (Changes{"a", "b"}));
}

TEST_P(RecorderTest, tellsThatAListedFileIsGone) {
    write("a");
    start();
    list("a");
    remove("a");
    EXPECT_EQ(changes(), (Changes{"- a"}));
    expectIndexIsTree();
}

TEST_P(RecorderTest, saysNothingOfAFileThatCameAndWent) {
    start();
    write("a");
    EXPECT_EQ(changes(), (Changes{"a"}));
    remove("a");
    EXPECT_THAT(changes(), IsEmpty());
    write("b");
    remove("b");
    EXPECT_THAT(changes(), IsEmpty());
    EXPECT_EQ(store().counts().events, 0u);
}

TEST_P(RecorderTest, tellsOfARename) {
    write("a");
    start();
    const DocumentID document = list("a");
    rename("a", "b");
    EXPECT_EQ(changes(), (Changes{"- a", "b"}));
    EXPECT_EQ(this->document("b"), document);
    EXPECT_THAT(documentChanges(), IsEmpty());
    expectIndexIsTree();
}

TEST_P(RecorderTest, tellsOfAMoveBetweenFolders) {
    makeFolder("f");
    makeFolder("g");
    write("f/a");
    start();
    const DocumentID document = list("f/a");
    rename("f/a", "g/b");
    EXPECT_EQ(changes(), (Changes{"- f/a", "g/b", "f", "g"}));
    EXPECT_EQ(this->document("g/b"), document);
    expectIndexIsTree();
}

TEST_P(RecorderTest, followsAFileThatMovesOnAndBack) {
    write("a");
    start();
    list("a");
    rename("a", "b");
    rename("b", "c");
    rename("c", "a");
    // A rename changes the file's own change time.
    const Changes told = changes();
    EXPECT_TRUE(told == (Changes{"a"}) || told.empty());
    expectIndexIsTree();
}

// As a file system does that gives out a number again at once: the index is made to be what it was before.
TEST_P(RecorderTest, keepsWhatLeftAFolderWhoseNumberIsANewOnesNow) {
    write("kept");
    makeFolder("moved");
    write("moved/deep");
    makeFolder("new");
    start();
    const DocumentID kept = list("kept");
    const DocumentID deep = list("moved/deep");
    const FileID reused = fileID("new");
    IndexChanges before(IndexChanges::Journal::no);
    before.put({.fileID = reused,
                .birthTime = 1,
                .parent = FileID{root_->status.fileID},
                .name = "old",
                .kind = ObjectKind::folder,
                .changeTime = 1});
    for (const std::string name : {"kept", "moved"}) {
        store().indexed(fileID(name), [&](IndexedObject object) {
            object.parent = reused;
            object.name = name;
            before.put(object);
        });
    }
    const FileID rootID{root_->status.fileID};
    ASSERT_TRUE(store().apply(before, {&rootID, 1}).ok());
    rename("new", "newer");
    rename("kept", "found");
    rename("moved", "found too");
    changes();
    EXPECT_EQ(document("found"), kept);
    EXPECT_EQ(document("found too/deep"), deep);
    expectIndexIsTree();
}

TEST_P(RecorderTest, keepsWhatLeftAFolderWhoseNumberIsAnothersWhetherItRecordsOrNot) {
    for (const bool records : {true, false}) {
        // Before and after the others in most orders, below one of them, and no folder at all.
        for (const std::string newcomer : {"0", "zz", "other/z", "file"}) {
            const std::string top = newcomer.substr(0, newcomer.find('/')) + (records ? " recorded/" : " compared/");
            for (const std::string name : {"", "old", "old/sub", "g"}) makeFolder(top + name);
            for (const std::string name : {"old/a", "old/b", "old/sub/deep", "old/gone", "g/inside"}) write(top + name);
            start();
            const DocumentID a = list(top + "old/a"), b = list(top + "old/b"), deep = list(top + "old/sub/deep");
            const DocumentID inside = list(top + "g/inside");
            list(top + "old/gone");
            if (!records) stop();
            makeFolder(top + "other");
            rename(top + "old/a", top + "other/a");
            rename(top + "old/b", top + "b");
            rename(top + "old/sub", top + "other/sub");
            removeTree(top + "old");
            const bool isFile = newcomer == "file";
            const std::string to = isFile ? top : top + newcomer + "/";
            isFile ? write(top + newcomer) : makeFolder(top + newcomer);
            rename(top + "g", to + "g2");
            if (!records) start();
            changes();
            EXPECT_EQ(document(top + "other/a"), a) << top;
            EXPECT_EQ(document(top + "b"), b) << top;
            EXPECT_EQ(document(top + "other/sub/deep"), deep) << top;
            EXPECT_EQ(document(to + "g2/inside"), inside) << top;
            expectIndexIsTree();
            stop();
        }
    }
}

// In the order of their numbers each folder may be looked at before those above it are found.
TEST_P(RecorderTest, keepsWhatMovedIntoFoldersThatMovedIntoEachOtherMeanwhile) {
    std::vector<std::string> folders{"a", "b", "c", "d"};
    int round = 0;
    do {
        const std::string top = "top" + std::to_string(round++);
        makeFolder(top);
        makeFolder(top + "/end");
        for (const std::string& folder : folders) makeFolder(top + "/" + folder);
        for (const std::string& folder : folders) write(top + "/" + folder + "/inside");
        write(top + "/moved");
        if (recorder_ == nullptr) start();
        changes();
        std::vector<DocumentID> inside;
        for (const std::string& folder : folders) inside.push_back(list(top + "/" + folder + "/inside"));
        const DocumentID moved = list(top + "/moved");
        rename(top + "/moved", top + "/a/moved");
        rename(top + "/a", top + "/b/a");
        rename(top + "/b", top + "/c/b");
        rename(top + "/c", top + "/d/c");
        rename(top + "/d", top + "/end/d");
        changes();
        for (std::size_t i = 0; i < folders.size(); ++i) {
            const std::string below = std::string("d/c/b/a").substr(0, 2 * (std::size_t{'d'} - folders[i][0]) + 1);
            EXPECT_EQ(document(top + "/end/" + below + "/inside"), inside[i]) << folders[i] << round;
        }
        EXPECT_EQ(document(top + "/end/d/c/b/a/moved"), moved) << round;
        expectIndexIsTree();
    } while (std::ranges::next_permutation(folders).found);
}

// A link sets the stamp first, then it counts the name: who looks in between sees one of after and the other of before.
TEST_P(RecorderTest, keepsAFileThatWasLookedAtWhileItGotItsOtherName) {
    write("a", "old");
    start();
    const DocumentID document = list("a");
    link("a", "a~");
    struct stat status {};
    ASSERT_EQ(::stat(path("a").c_str(), &status), 0);
    recordAsWithOneName("a", status.st_ctim.tv_sec * 1'000'000'000 + status.st_ctim.tv_nsec);
    changes();
    write("new", "new");
    rename("new", "a");
    EXPECT_TRUE(changes().contains("a~"));
    EXPECT_EQ(this->document("a"), document) << "it is a save";
    expectIndexIsTree();
}

TEST_P(RecorderTest, keepsAFileThatWasLookedAtWhileItLostOneOfItsNames) {
    write("a", "old");
    start();
    const DocumentID document = list("a");
    link("a", "a~");
    changes();
    // What is found at the name that a rename takes: the file, one name less.
    recordAsWithOneName("a");
    write("new", "new");
    rename("new", "a");
    EXPECT_TRUE(changes().contains("a~"));
    EXPECT_EQ(this->document("a"), document) << "it is a save";
    expectIndexIsTree();
}

TEST_P(RecorderTest, keepsAFileBelowAFolderThatWentWhereItWasLookedAtWhileItLostOneOfItsNames) {
    makeFolder("gone");
    write("gone/a", "old");
    start();
    link("gone/a", "b");
    changes();
    recordAsWithOneName("gone/a");
    renamePaths(path("gone"), outside("gone"));
    EXPECT_TRUE(changes().contains("b"));
    expectIndexIsTree();
}

TEST_P(RecorderTest, followsTwoFilesThatSwapNames) {
    write("a", "one");
    write("b", "two");
    start();
    const DocumentID a = list("a"), b = list("b");
    exchange("a", "b");
    EXPECT_EQ(changes(), (Changes{"a", "b", "- a", "- b"}));
    EXPECT_EQ(document("a"), b);
    EXPECT_EQ(document("b"), a);
    expectIndexIsTree();
}

// MARK: Folders

TEST_P(RecorderTest, tellsOfTheFolderWhoseEntriesChanged) {
    makeFolder("f");
    start();
    write("f/a");
    EXPECT_EQ(changes(), (Changes{"f", "f/a"}));
}

TEST_P(RecorderTest, tellsOfATreeThatIsMadeAtOnce) {
    start();
    std::string folder = "t";
    Changes expected;
    for (int i = 0; i < 30; ++i) {
        makeFolder(folder);
        expected.insert(folder);
        for (int j = 0; j < 5; ++j) {
            write(folder + "/" + std::to_string(j));
            expected.insert(folder + "/" + std::to_string(j));
        }
        folder += "/n";
    }
    EXPECT_EQ(changes(), expected);
    write("t/n/n/late");
    EXPECT_EQ(changes(), (Changes{"t/n/n", "t/n/n/late"}));
    expectIndexIsTree();
}

TEST_P(RecorderTest, repathsWhatIsBelowARenamedFolderWithoutEvents) {
    makeFolder("f");
    makeFolder("f/g");
    write("f/g/a");
    start();
    list("f");
    rename("f", "h");
    EXPECT_EQ(changes(), (Changes{"- f", "h"}));
    append("h/g/a", "more");
    EXPECT_EQ(changes(), (Changes{"h/g/a"}));
    expectIndexIsTree();
}

TEST_P(RecorderTest, tellsOfEverythingInAFolderThatIsMovedIn) {
    ASSERT_EQ(::mkdir(outside("f").c_str(), 0755), 0);
    ASSERT_EQ(::mkdir(outside("f/g").c_str(), 0755), 0);
    start();
    renamePaths(outside("f"), path("f"));
    EXPECT_EQ(changes(), (Changes{"f", "f/g"}));
    write("f/g/a");
    EXPECT_EQ(changes(), (Changes{"f/g", "f/g/a"}));
    expectIndexIsTree();
}

TEST_P(RecorderTest, tellsOfEverythingInAFolderThatIsMovedOut) {
    makeFolder("f");
    makeFolder("f/g");
    write("f/g/a");
    write("f/g/unlisted");
    start();
    const DocumentID document = list("f/g/a");
    list("f/g");
    list("f");
    const FileID file = fileID("f/g/a");
    renamePaths(path("f"), outside("f"));
    EXPECT_EQ(changes(), (Changes{"- f", "- f/g", "- f/g/a"}));
    EXPECT_THAT(documentChanges(), ElementsAre(DocumentChange{document, file, kNothing}));
    expectIndexIsTree();
}

TEST_P(RecorderTest, tellsOfEverythingInATreeThatIsRemoved) {
    makeFolder("f");
    makeFolder("f/g");
    write("f/g/a");
    start();
    list("f");
    list("f/g");
    list("f/g/a");
    removeTree("f");
    EXPECT_EQ(changes(), (Changes{"- f", "- f/g", "- f/g/a"}));
    expectIndexIsTree();
}

TEST_P(RecorderTest, keepsWhatWasMovedOutOfATreeBeforeThatWasRemoved) {
    makeFolder("f");
    write("f/a");
    start();
    const DocumentID document = list("f/a");
    rename("f/a", "a");
    removeTree("f");
    const Changes told = changes();
    EXPECT_TRUE(told.contains("a"));
    EXPECT_EQ(this->document("a"), document);
    EXPECT_THAT(documentChanges(), IsEmpty());
    expectIndexIsTree();
}

TEST_P(RecorderTest, takesAFolderUnderARecycledNumberForANewOne) {
    start();
    for (int i = 0; i < 20; ++i) {
        makeFolder("f");
        write("f/" + std::to_string(i));
        ASSERT_TRUE(recorder().drain().ok());
        removeTree("f");
    }
    makeFolder("f");
    write("f/last");
    EXPECT_EQ(changes(), (Changes{"f", "f/last"}));
    expectIndexIsTree();
}

// MARK: Names

TEST_P(RecorderTest, tellsOfNamesThatAreNotText) {
    start();
    write("new\nline");
    write("\xff\xfe");
    write("#12345");
    EXPECT_EQ(changes(), (Changes{"new\nline", "\xff\xfe", "#12345"}));
    expectIndexIsTree();
}

TEST_P(RecorderTest, tellsOfLinksAndPipes) {
    start();
    ASSERT_EQ(::symlink("nowhere", path("dangling").c_str()), 0);
    ASSERT_EQ(::symlink("loop", path("loop").c_str()), 0);
    ASSERT_EQ(::mkfifo(path("pipe").c_str(), 0600), 0);
    EXPECT_EQ(changes(), (Changes{"dangling", "loop", "pipe"}));
    expectIndexIsTree();
}

TEST_P(RecorderTest, keepsAFileWithTwoNamesUnderTheFirst) {
    write("a");
    start();
    const DocumentID document = list("a");
    link("a", "b");
    EXPECT_EQ(changes(), (Changes{"a"}));
    append("b", "more");
    EXPECT_EQ(changes(), (Changes{"a"}));
    EXPECT_EQ(this->document("b"), document);
    remove("b");
    EXPECT_EQ(changes(), (Changes{"a"}));
}

TEST_P(RecorderTest, keepsAFileThatLosesItsFirstNameUnderTheOther) {
    makeFolder("f");
    write("a");
    start();
    const DocumentID document = list("a");
    link("a", "f/b");
    changes();
    remove("a");
    EXPECT_EQ(changes(), (Changes{"- a", "f/b"}));
    EXPECT_EQ(this->document("f/b"), document);
    EXPECT_THAT(documentChanges(), IsEmpty());
}

TEST_P(RecorderTest, keepsAFileWhoseFirstNameGoesWithItsFolder) {
    makeFolder("f");
    write("f/a");
    start();
    const DocumentID document = list("f/a");
    link("f/a", "b");
    changes();
    removeTree("f");
    EXPECT_TRUE(changes().contains("b"));
    EXPECT_EQ(this->document("b"), document);
    EXPECT_THAT(documentChanges(), IsEmpty());
}

TEST_P(RecorderTest, followsWhatHappensInAFolderThatIsMovedMeanwhile) {
    makeFolder("f");
    makeFolder("g");
    write("f/a");
    start();
    list("f/a");
    rename("f/a", "f/b");
    exchange("f", "g");
    rename("g", "h");
    write("h/c");
    const Changes told = changes();
    EXPECT_TRUE(told.contains("h/b"));
    EXPECT_TRUE(told.contains("h/c"));
    expectIndexIsTree();
}

TEST_P(RecorderTest, tellsOfChangesThroughANameOutside) {
    write("a");
    ASSERT_EQ(::link(path("a").c_str(), outside("a").c_str()), 0);
    start();
    {
        const int fd = ::open(outside("a").c_str(), O_WRONLY | O_APPEND);
        ASSERT_EQ(::write(fd, "more", 4), 4);
        ::close(fd);
    }
    EXPECT_EQ(changes(), (Changes{"a"}));
    ASSERT_EQ(::unlink(outside("a").c_str()), 0);
    EXPECT_EQ(changes(), (Changes{"a"}));
}

TEST_P(RecorderTest, tellsOfAFileThatWasMadeWithoutAName) {
    start();
    const int fd = ::open(storage_.c_str(), O_TMPFILE | O_WRONLY, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(::write(fd, "x", 1), 1);
    const std::string own = "/proc/self/fd/" + std::to_string(fd);
    ASSERT_EQ(::linkat(AT_FDCWD, own.c_str(), AT_FDCWD, path("a").c_str(), AT_SYMLINK_FOLLOW), 0);
    EXPECT_EQ(changes(), (Changes{"a"}));
    // The kernel still calls it by its number here.
    ASSERT_EQ(::write(fd, "more", 4), 4);
    ::close(fd);
    EXPECT_EQ(changes(), (Changes{"a"}));
}

// MARK: Saves

TEST_P(RecorderTest, handsADocumentToTheFileThatIsRenamedOverIt) {
    write("doc", "old");
    start();
    const DocumentID document = list("doc");
    const FileID old = fileID("doc");
    write("tmp", "new");
    rename("tmp", "doc");
    EXPECT_TRUE(changes().contains("doc"));
    EXPECT_EQ(this->document("doc"), document);
    EXPECT_THAT(documentChanges(), ::testing::Contains(DocumentChange{document, old, fileID("doc")}));
    expectIndexIsTree();
}

TEST_P(RecorderTest, handsADocumentToAFileThatWasListedWhileItWasBeingSaved) {
    write("doc", "old");
    start();
    const DocumentID document = list("doc");
    write("tmp", "new");
    ASSERT_TRUE(recorder().drain().ok());
    const DocumentID young = list("tmp");
    const FileID newcomer = fileID("tmp");
    rename("tmp", "doc");
    changes();
    EXPECT_EQ(this->document("doc"), document);
    EXPECT_THAT(documentChanges(), ::testing::Contains(DocumentChange{young, newcomer, kNothing}));
}

TEST_P(RecorderTest, handsADocumentOnWhenTheOldFileBecomesABackup) {
    write("doc", "old");
    start();
    const DocumentID document = list("doc");
    rename("doc", "doc~");
    write("doc", "new");
    changes();
    EXPECT_EQ(this->document("doc"), document);
    EXPECT_NE(this->document("doc~"), document);
    remove("doc~");
    changes();
    EXPECT_EQ(this->document("doc"), document);
    expectIndexIsTree();
}

TEST_P(RecorderTest, handsADocumentOnWhenTheBackupIsSeenBeforeTheNewFile) {
    write("doc", "old");
    start();
    const DocumentID document = list("doc");
    rename("doc", "doc.bak");
    changes();
    letTimePass(milliseconds(1'900));
    write("doc", "new");
    changes();
    EXPECT_EQ(this->document("doc"), document);
    EXPECT_EQ(this->document("doc.bak"), kNoDocument);
}

TEST_P(RecorderTest, takesABackupThatStaysAloneForAMove) {
    write("doc", "old");
    start();
    const DocumentID document = list("doc");
    rename("doc", "doc.bak");
    changes();
    letTimePass(milliseconds(2'100));
    write("doc", "new");
    changes();
    EXPECT_EQ(this->document("doc"), kNoDocument);
    EXPECT_EQ(this->document("doc.bak"), document);
}

TEST_P(RecorderTest, takesAMoveToAnotherNameForAMove) {
    write("doc", "old");
    start();
    const DocumentID document = list("doc");
    rename("doc", "archive");
    write("doc", "new");
    changes();
    EXPECT_EQ(this->document("doc"), kNoDocument);
    EXPECT_EQ(this->document("archive"), document);
}

TEST_P(RecorderTest, handsADocumentToTheFileThatIsCreatedAgain) {
    write("doc", "old");
    start();
    const DocumentID document = list("doc");
    remove("doc");
    EXPECT_EQ(changes(), (Changes{"- doc"}));
    letTimePass(milliseconds(1'900));
    write("doc", "new");
    EXPECT_EQ(changes(), (Changes{"doc"}));
    EXPECT_EQ(this->document("doc"), document);
}

TEST_P(RecorderTest, handsADocumentToTheFileThatIsCreatedAgainAtOnce) {
    write("doc", "old");
    start();
    const DocumentID document = list("doc");
    remove("doc");
    write("doc", "new");
    changes();
    EXPECT_EQ(this->document("doc"), document);
    expectIndexIsTree();
}

TEST_P(RecorderTest, givesAFileThatIsCreatedLaterANumberOfItsOwn) {
    write("doc", "old");
    start();
    const DocumentID document = list("doc");
    remove("doc");
    changes();
    letTimePass(milliseconds(2'100));
    write("doc", "new");
    changes();
    EXPECT_EQ(this->document("doc"), kNoDocument);
    EXPECT_NE(list("doc"), document);
}

TEST_P(RecorderTest, leavesAnOlderDocumentThatIsMovedOverAnotherItsNumber) {
    write("doc", "one");
    write("other", "two");
    Recorder::Options options;
    start();
    const DocumentID document = list("doc"), other = list("other");
    const FileID old = fileID("doc");
    stop();
    options.choice = GetParam();
    options.recordsByItself = false;
    options.wallClock = [] {
        KsDate now = KsDate::now();
        now.seconds += 61;
        return now;
    };
    recorder_ = Recorder::start(store_, {root_}, options);
    ASSERT_TRUE(recorder_->drain().ok());
    rename("other", "doc");
    changes();
    EXPECT_EQ(this->document("doc"), other);
    EXPECT_THAT(documentChanges(), ElementsAre(DocumentChange{document, old, kNothing}));
}

TEST_P(RecorderTest, handsADocumentOnThroughASaveWhileNobodyRecorded) {
    write("doc", "old");
    start();
    const DocumentID document = list("doc");
    stop();
    write("tmp", "new");
    rename("tmp", "doc");
    start();
    EXPECT_TRUE(changes().contains("doc"));
    EXPECT_EQ(this->document("doc"), document);
}

// Where numbers are given again at once, each file that is saved has the former number of the one before.
TEST_P(RecorderTest, handsDocumentsOnThroughSavesOneAfterTheOtherWhetherItRecordsOrNot) {
    constexpr int kCount = 20;
    makeFolder("f");
    const auto name = [](int i) { return (i % 2 == 0 ? "doc" : "f/doc") + std::to_string(i); };
    for (int i = 0; i < kCount; ++i) write(name(i), "old");
    start();
    std::vector<DocumentID> documents;
    for (int i = 0; i < kCount; ++i) documents.push_back(list(name(i)));
    for (const bool records : {false, true}) {
        if (!records) stop();
        for (int i = 0; i < kCount; ++i) {
            write("f/tmp", "new");
            rename("f/tmp", name(i));
        }
        const std::string another = records ? "another" : "one";
        write(another, "new");
        if (!records) start();
        const Changes all = changes();
        for (int i = 0; i < kCount; ++i) {
            EXPECT_TRUE(all.contains(name(i))) << name(i);
            EXPECT_EQ(document(name(i)), documents[i]) << name(i);
        }
        EXPECT_EQ(document(another), kNoDocument);
        expectIndexIsTree();
    }
}

// The folder's number is another folder's then, where numbers are given again, and the file's own another file's.
TEST_P(RecorderTest, givesAFileInAnotherFolderANumberOfItsOwnWhetherItRecordsOrNot) {
    for (const bool records : {true, false}) {
        for (const std::string other : {"0", "zz"}) {
            for (const std::string folder : {"00", "z", "zzz"}) {
                const std::string top = folder + other + (records ? " recorded/" : " compared/");
                makeFolder(top);
                makeFolder(top + "f");
                write(top + "f/a");
                start();
                list(top + "f/a");
                if (!records) stop();
                removeTree(top + "f");
                makeFolder(top + folder);
                write(top + other);
                write(top + folder + "/a");
                if (!records) start();
                changes();
                EXPECT_EQ(document(top + folder + "/a"), kNoDocument) << top;
                EXPECT_EQ(document(top + other), kNoDocument) << top;
                expectIndexIsTree();
                stop();
            }
        }
    }
}

TEST_P(RecorderTest, handsDocumentsOnThatWereRemovedAndCreatedAgainWhileNobodyRecorded) {
    constexpr int kCount = 20;
    const std::vector<DocumentID> documents = startWithDocuments(kCount);
    stop();
    for (int i = 0; i < kCount; ++i) remove("doc" + std::to_string(i));
    for (int i = kCount - 1; i >= 0; --i) write("doc" + std::to_string(i), "new");
    start();
    for (int i = 0; i < kCount; ++i) EXPECT_EQ(document("doc" + std::to_string(i)), documents[i]) << i;
    expectIndexIsTree();
}

TEST_P(RecorderTest, handsPackagesOnThroughSavesOneAfterTheOtherWhileNobodyRecorded) {
    constexpr int kCount = 10;
    const auto name = [](int i) { return "p" + std::to_string(i) + ".folio"; };
    const auto make = [&](const std::string& folder, std::string_view text) {
        makeFolder(folder);
        write(folder + "/inside", text);
    };
    for (int i = 0; i < kCount; ++i) make(name(i), "old");
    start();
    std::vector<DocumentID> documents;
    for (int i = 0; i < kCount; ++i) documents.push_back(list(name(i)));
    stop();
    for (int i = 0; i < kCount; ++i) {
        make("saved.folio", "new");
        rename(name(i), "former.folio");
        rename("saved.folio", name(i));
        removeTree("former.folio");
    }
    make("another.folio", "new");
    start();
    for (int i = 0; i < kCount; ++i) EXPECT_EQ(document(name(i)), documents[i]) << name(i);
    EXPECT_EQ(document("another.folio"), kNoDocument);
    expectIndexIsTree();
}

TEST_P(RecorderTest, handsDocumentsOnWhoseOldFilesBecameBackupsWhileNobodyRecorded) {
    constexpr int kCount = 20;
    const std::vector<DocumentID> documents = startWithDocuments(kCount);
    stop();
    for (int i = 0; i < kCount; ++i) {
        const std::string name = "doc" + std::to_string(i);
        rename(name, name + "~");
        if (i % 5 != 0) write(name, "new");
    }
    start();
    for (int i = 0; i < kCount; ++i) {
        const std::string name = "doc" + std::to_string(i);
        EXPECT_EQ(document(i % 5 != 0 ? name : name + "~"), documents[i]) << i;
    }
    expectIndexIsTree();
}

TEST_P(RecorderTest, carriesTheAttributesThroughASave) {
    write("doc", "old");
    start();
    list("doc");
    setTag("doc", "red");
    changes();
    write("tmp", "new");
    rename("tmp", "doc");
    changes();
    EXPECT_EQ(tag("doc"), "red");
}

TEST_P(RecorderTest, leavesAttributesThatTheSavedFileBrings) {
    write("doc", "old");
    start();
    list("doc");
    setTag("doc", "red");
    changes();
    write("tmp", "new");
    setTag("tmp", "blue");
    rename("tmp", "doc");
    changes();
    EXPECT_EQ(tag("doc"), "blue");
}

// MARK: Packages and trash

TEST_P(RecorderTest, tellsOfAPackageWhenSomethingInItChanges) {
    makeFolder("p.folio");
    makeFolder("p.folio/d");
    write("p.folio/d/a");
    start();
    append("p.folio/d/a", "more");
    EXPECT_EQ(changes(), (Changes{"p.folio", "p.folio/d/a"}));
}

TEST_P(RecorderTest, tellsOfAPackageWhenAFileOfWhichItHasANameChanges) {
    makeFolder("p.folio");
    write("a");
    start();
    link("a", "p.folio/b");
    EXPECT_TRUE(changes().contains("p.folio"));
    append("a", "more");
    EXPECT_TRUE(changes().contains("p.folio"));
    remove("p.folio/b");
    EXPECT_TRUE(changes().contains("p.folio"));
}

TEST_P(RecorderTest, tellsOfEverythingInAFolderThatBecomesAPackage) {
    makeFolder("p");
    write("p/a");
    start();
    list("p");
    list("p/a");
    rename("p", "p.folio");
    const Changes told = changes();
    EXPECT_TRUE(told.contains("p.folio"));
    EXPECT_TRUE(told.contains("p.folio/a"));
    EXPECT_TRUE(told.contains("- p"));
    rename("p.folio", "p");
    EXPECT_TRUE(changes().contains("p/a"));
}

TEST_P(RecorderTest, tellsOfEverythingInAFolderThatIsTrashed) {
    makeFolder(".Trash");
    makeFolder("f");
    write("f/a");
    start();
    list("f");
    list("f/a");
    rename("f", ".Trash/f");
    const Changes told = changes();
    EXPECT_TRUE(told.contains(".Trash/f/a"));
    EXPECT_TRUE(told.contains("- f"));
}

TEST_P(RecorderTest, tellsOfEverythingInAFolderThatIsExchangedOutOfAPackage) {
    makeFolder("p.folio");
    makeFolder("p.folio/h");
    write("p.folio/h/a");
    makeFolder("g");
    makeFolder("g/.Trash");
    write("g/.Trash/b");
    start();
    exchange("p.folio/h", "g/.Trash");
    Changes told = changes();
    EXPECT_TRUE(told.contains("g/.Trash/a"));
    EXPECT_TRUE(told.contains("p.folio/h/b"));
    exchange("p.folio/h", "g/.Trash");
    rename("g", "h");
    told = changes();
    EXPECT_TRUE(told.contains("h/.Trash/b"));
    EXPECT_TRUE(told.contains("p.folio/h/a"));
    expectIndexIsTree();
}

// MARK: What happens while nobody records

TEST_P(RecorderTest, findsWhatHappenedWhileNobodyRecorded) {
    makeFolder("f");
    write("f/same");
    write("changed");
    write("gone");
    write("moved");
    start();
    list("gone");
    list("changed");
    const DocumentID moved = list("moved");
    restartAll();
    EXPECT_THAT(changes(), IsEmpty());
    stop();
    append("changed", "more");
    remove("gone");
    rename("moved", "f/moved");
    write("new");
    restartAll();
    EXPECT_EQ(changes(), (Changes{"changed", "- gone", "- moved", "f", "f/moved", "new"}));
    EXPECT_EQ(document("f/moved"), moved);
    expectIndexIsTree();
}

TEST_P(RecorderTest, followsAFolderThatWasMovedWhileNobodyRecorded) {
    makeFolder("a");
    makeFolder("b");
    makeFolder("a/f");
    write("a/f/x");
    start();
    list("a/f");
    const DocumentID document = list("a/f/x");
    stop();
    rename("a/f", "b/g");
    start();
    EXPECT_EQ(changes(), (Changes{"a", "b", "- a/f", "b/g"}));
    EXPECT_EQ(this->document("b/g/x"), document);
    expectIndexIsTree();
}

TEST_P(RecorderTest, givesFewEventsForFewEditsInALargeTree) {
    for (int i = 0; i < 20; ++i) {
        makeFolder("f" + std::to_string(i));
        for (int j = 0; j < 50; ++j) write("f" + std::to_string(i) + "/" + std::to_string(j));
    }
    start();
    stop();
    for (int i = 0; i < 7; ++i) append("f" + std::to_string(i) + "/" + std::to_string(i), "more");
    restartAll();
    EXPECT_EQ(changes().size(), 7u);
}

TEST_P(RecorderTest, cantReplayWhatWasBeforeItsHistory) {
    write("a");
    const std::uint64_t before = store().currentEventID();
    start();
    EXPECT_FALSE(recorder().canReplayAfter(before));
    EXPECT_TRUE(recorder().canReplayAfter(recorder().currentEventID()));
    EXPECT_FALSE(recorder().canReplayAfter(recorder().currentEventID() + 1));
}

TEST_P(RecorderTest, keepsItsHistoryOverARestart) {
    start();
    const std::uint64_t before = recorder().currentEventID();
    write("a");
    ASSERT_TRUE(recorder().drain().ok());
    restartAll();
    EXPECT_TRUE(recorder().canReplayAfter(before));
    EXPECT_EQ(changes(), (Changes{"a"}));
}

TEST_P(RecorderTest, beginsAnewForAnotherStorage) {
    write("a");
    start();
    list("a");
    const KsUUID uuid = recorder().volumeUUID();
    stop();
    renamePaths(storage_, outside("former"));
    ASSERT_EQ(::mkdir(storage_.c_str(), 0755), 0);
    root_ = *RootDirectories::shared().add(storage_, RootPolicy::storage);
    start();
    EXPECT_NE(recorder().volumeUUID(), uuid);
    expectIndexIsTree();
}

TEST_P(RecorderTest, findsWhatAMemoryMapWroteWhenItAudits) {
    write("a", std::string(4'096, 'x'));
    start();
    const int fd = ::open(path("a").c_str(), O_RDWR);
    ASSERT_GE(fd, 0);
    auto* map = static_cast<char*>(::mmap(nullptr, 4'096, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0));
    ASSERT_NE(map, MAP_FAILED);
    map[0] = 'y';
    ASSERT_EQ(::msync(map, 4'096, MS_SYNC), 0);
    const auto differences = recorder().audit();
    ASSERT_TRUE(differences.ok());
    EXPECT_EQ(*differences, 1u);
    EXPECT_EQ(recorder().status().auditedDifferences, 1u);
    EXPECT_EQ(changes(), (Changes{"a"}));
    ::munmap(map, 4'096);
    ::close(fd);
}

TEST_P(RecorderTest, comparesEverythingWhenEventsWereLost) {
    makeFolder("f");
    start();
    // More than the kernel keeps for a reader that doesn't read.
    std::size_t made = 0;
    for (int i = 0; i < 9'000; ++i, ++made) write("f/" + std::to_string(i));
    const Changes told = changes();
    EXPECT_EQ(told.size(), made + 1);
    expectIndexIsTree();
}

// MARK: What is refused

TEST_P(RecorderTest, tellsWhoWaitsThatItHasStopped) {
    start();
    recorder().stop();
    const Result<void> drained = recorder().drain();
    ASSERT_FALSE(drained.ok());
    EXPECT_TRUE(drained.error().isPosix(ECANCELED));
}

TEST_P(RecorderTest, callsItsObserversWhenThereIsNews) {
    start();
    int calls = 0;
    const std::uint64_t observer = recorder().addObserver([&] { ++calls; });
    write("a");
    ASSERT_TRUE(recorder().drain().ok());
    EXPECT_EQ(calls, 1);
    ASSERT_TRUE(recorder().drain().ok());
    EXPECT_EQ(calls, 1);
    recorder().removeObserver(observer);
    write("b");
    ASSERT_TRUE(recorder().drain().ok());
    EXPECT_EQ(calls, 1);
}

// With a document in it that has two names there.
TEST_P(RecorderTest, aFolderMayLeaveAtAnyMomentOfALookAndComeBack) {
    makeFolder("here");
    start();
    for (int moment = 1;; ++moment) {
        makeFolder("here/f");
        write("here/f/one");
        link("here/f/one", "here/f/two");
        changes();
        list("here/f/one");
        write("here/f/new");
        write("here/other");
        const bool hasLeft = drainAndAct(moment, [&] { renamePaths(path("here/f"), outside("f")); });
        if (!hasLeft) break;
        changes();
        expectIndexIsTree();
        renamePaths(outside("f"), path("here/f"));
        EXPECT_THAT(changes(), ::testing::AnyOf(::testing::Contains("here/f/one"), ::testing::Contains("here/f/two")))
            << moment;
        expectIndexIsTree();
        removeTree("here/f");
        remove("here/other");
        changes();
    }
}

// While the folder of its first name leaves.
TEST_P(RecorderTest, aFoldersMoveAtAnyMomentTakesAFileWithItThatLosesItsOtherName) {
    start();
    for (int moment = 1;; ++moment) {
        makeFolder("leaving");
        makeFolder("moving");
        write("leaving/one");
        link("leaving/one", "moving/two");
        changes();
        list("leaving/one");
        renamePaths(path("leaving"), outside("leaving"));
        const bool hasMoved = drainAndAct(moment, [&] { rename("moving", "moved"); });
        if (!hasMoved) break;
        EXPECT_THAT(changes(), ::testing::Contains("moved/two")) << moment;
        EXPECT_TRUE(store().indexed(fileID("moved/two"), [](const IndexedObject&) {})) << moment;
        expectIndexIsTree();
        removeTree("moved");
        changes();
        expectIndexIsTree();
        std::filesystem::remove_all(outside("leaving"));
    }
}

// And where the name has gone from the folder meanwhile, or the folder with it.
TEST_P(RecorderTest, aFolderMayGoAtAnyMomentWithTheOtherNameOfAFileThatLeaves) {
    start();
    for (const bool goesAlone : {true, false}) {
        for (int moment = 1;; ++moment) {
            makeFolder("leaving");
            makeFolder("going");
            write("leaving/one");
            link("leaving/one", "going/two");
            changes();
            list("leaving/one");
            renamePaths(path("leaving"), outside("leaving"));
            const bool hasGone = drainAndAct(moment, [&] {
                if (goesAlone) remove("going/two");
                goesAlone ? rename("going", "gone") : renamePaths(path("going"), outside("gone"));
            });
            changes();
            expectIndexIsTree();
            for (const auto& left : {path("gone"), path("going"), outside("gone"), outside("leaving")})
                std::filesystem::remove_all(left);
            changes();
            expectIndexIsTree();
            if (!hasGone) break;
        }
    }
}

// Until the old file is given up, the index has two under the name.
TEST_P(RecorderTest, aFileMayLeaveAtAnyMomentAfterItTookAnothersPlace) {
    start();
    for (const bool isNew : {true, false}) {
        for (int moment = 1;; ++moment) {
            write("a", "old");
            if (!isNew) write("b", "new");
            changes();
            list("a");
            if (isNew) write("b", "new");
            rename("b", "a");
            const bool hasGone = drainAndAct(moment, [&] { renamePaths(path("a"), outside("a")); });
            changes();
            expectIndexIsTree();
            for (const auto& left : {path("a"), outside("a")}) std::filesystem::remove_all(left);
            changes();
            expectIndexIsTree();
            if (!hasGone) break;
        }
    }
}

// The file by itself, and its other names with their folders.
TEST_P(RecorderTest, aFolderMayGoAtAnyMomentWithAnotherNameOfAFileThatGoes) {
    start();
    for (int moment = 1;; ++moment) {
        makeFolder("first");
        makeFolder("first/inner");
        makeFolder("second");
        makeFolder("second/inner");
        write("one");
        link("one", "first/inner/two");
        link("one", "second/inner/three");
        changes();
        list("one");
        renamePaths(path("first"), outside("first"));
        const bool hasGone = drainAndAct(moment, [&] {
            remove("one");
            renamePaths(path("second"), outside("second"));
        });
        changes();
        expectIndexIsTree();
        for (const auto& left : {path("one"), path("second"), outside("first"), outside("second")})
            std::filesystem::remove_all(left);
        changes();
        expectIndexIsTree();
        if (!hasGone) break;
    }
}

TEST_P(RecorderTest, filesWhoseNamesAllWentWhileNobodyLookedAreGone) {
    constexpr int kFiles = 20;
    const auto name = [](int i) { return fmt::format("file {}", i); };
    for (int i = 0; i < kFiles; ++i) {
        makeFolder(fmt::format("folder {}", i));
        write(name(i));
        link(name(i), fmt::format("folder {}/other", i));
    }
    start();
    for (int i = 0; i < kFiles; ++i) list(name(i));
    stop();
    for (int i = 0; i < kFiles; ++i) {
        remove(name(i));
        removeTree(fmt::format("folder {}", i));
    }
    start();
    expectIndexIsTree();
    EXPECT_EQ(documentChanges().size(), static_cast<std::size_t>(kFiles)) << "each document has ended";
}

TEST_P(RecorderTest, aSaveKeepsTheDocumentOfAFileWhoseOtherNameWentWithItsFolder) {
    constexpr int kFiles = 20;
    const auto name = [](int i) { return fmt::format("file {}", i); };
    for (const bool isDown : {true, false}) {
        for (int i = 0; i < kFiles; ++i) {
            makeFolder(fmt::format("folder {}", i));
            write(name(i));
            link(name(i), fmt::format("folder {}/other", i));
        }
        if (isDown) start();
        changes();
        std::vector<DocumentID> documents;
        for (int i = 0; i < kFiles; ++i) documents.push_back(list(name(i)));
        if (isDown) stop();
        for (int i = 0; i < kFiles; ++i) {
            // With a number that nothing had.
            write(fmt::format("new {}", i), "new");
        }
        for (int i = 0; i < kFiles; ++i) {
            removeTree(fmt::format("folder {}", i));
            rename(fmt::format("new {}", i), name(i));
        }
        if (isDown) start();
        changes();
        for (int i = 0; i < kFiles; ++i) EXPECT_EQ(document(name(i)), documents[static_cast<std::size_t>(i)]) << i;
        expectIndexIsTree();
        for (int i = 0; i < kFiles; ++i) remove(name(i));
        changes();
    }
}

/// In memory, where a folder is given the stamp of what comes to it or goes from it, which may be one that it bears.
class RecorderInMemoryTest : public RecorderTest {
protected:
    RecorderInMemoryTest() : RecorderTest(TemporaryFolder::inMemory()) {}
};

TEST_P(RecorderInMemoryTest, tellsOfAFolderAsOftenAsItsEntriesChange) {
    constexpr int kTimes = 200;
    makeFolder("f");
    makeFolder("files");
    for (int i = 0; i < kTimes; ++i) write(fmt::format("files/{}", i));
    start();
    // Most of the time within a tick of the clock.
    for (int i = 0; i < kTimes; ++i) {
        write("f/" + std::to_string(i));
        EXPECT_THAT(changes(), ::testing::Contains("f"));
        link(fmt::format("files/{}", i), fmt::format("f/link {}", i));
        EXPECT_THAT(changes(), ::testing::Contains("f")) << i;
        remove(fmt::format("files/{}", i));
        EXPECT_THAT(changes(), ::testing::Contains("files")) << i;
    }
}

std::string nameOf(const ::testing::TestParamInfo<Recorder::Choice>& info) {
    return info.param == Recorder::Choice::inotify ? "inotify" : "automatic";
}

// Automatic is fanotify where the process may.
INSTANTIATE_TEST_SUITE_P(Sources, RecorderInMemoryTest,
                         ::testing::Values(Recorder::Choice::inotify, Recorder::Choice::automatic), nameOf);
INSTANTIATE_TEST_SUITE_P(Sources, RecorderTest,
                         ::testing::Values(Recorder::Choice::inotify, Recorder::Choice::automatic), nameOf);

}  // namespace
}  // namespace cindral::test
