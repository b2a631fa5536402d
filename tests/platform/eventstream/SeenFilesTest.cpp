#include "platform/eventstream/SeenFiles.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <stdexcept>

#include "RecorderFixture.h"
#include "platform/eventstream/IndexKeeperTypes.h"
#include "support/OrdinaryPerson.h"

namespace cindral::test {
namespace {

// What is kept

FileStatus statusOf(std::uint64_t fileID, std::uint64_t size = 1) {
    FileStatus status;
    status.fileID = fileID;
    status.size = size;
    status.mode = S_IFREG | 0644;
    status.birthTime = KsDate{100, 1};
    status.changeTime = KsDate{200, 2};
    return status;
}

std::shared_ptr<const FileStatus> find(const SeenFiles& files, const FileStatus& status) {
    return files.find(FileID{status.fileID}, status.birthStamp(), index_keeper::stampOf(status.changeTime),
                      status.size);
}

TEST(SeenFiles, areFoundByWhatTheyWere) {
    SeenFiles files;
    const FileStatus seen = statusOf(7);
    files.put(seen);
    ASSERT_TRUE(find(files, seen));
    EXPECT_EQ(find(files, seen)->mode, seen.mode);
    FileStatus other = seen;
    other.fileID = 8;
    EXPECT_FALSE(find(files, other));
    other = seen;
    other.birthTime = KsDate{100, 2};
    EXPECT_FALSE(find(files, other));
    other = seen;
    other.changeTime = KsDate{200, 3};
    EXPECT_FALSE(find(files, other));
    other = seen;
    other.size = 2;
    EXPECT_FALSE(find(files, other));
}

TEST(SeenFiles, areWhatTheyWereLast) {
    SeenFiles files;
    files.put(statusOf(7, 1));
    files.put(statusOf(7, 2));
    EXPECT_FALSE(find(files, statusOf(7, 1)));
    EXPECT_TRUE(find(files, statusOf(7, 2)));
    files.forget(FileID{7});
    EXPECT_FALSE(find(files, statusOf(7, 2)));
}

TEST(SeenFiles, areForgottenInEitherHalf) {
    SeenFiles files;
    for (std::uint64_t id = 1; id <= SeenFiles::kFilesMax + 1; ++id) files.put(statusOf(id));
    files.forget(FileID{1});
    EXPECT_FALSE(find(files, statusOf(1)));
    EXPECT_TRUE(find(files, statusOf(2)));
    // One of the older half is seen again.
    files.put(statusOf(2, 5));
    EXPECT_FALSE(find(files, statusOf(2)));
    EXPECT_TRUE(find(files, statusOf(2, 5)));
    files.clear();
    EXPECT_FALSE(find(files, statusOf(2, 5)));
    EXPECT_FALSE(find(files, statusOf(3)));
}

TEST(SeenFiles, areTheNewest) {
    SeenFiles files;
    constexpr std::uint64_t kMany = 5 * SeenFiles::kFilesMax;
    for (std::uint64_t id = 1; id <= kMany; ++id) files.put(statusOf(id));
    std::size_t kept = 0;
    for (std::uint64_t id = 1; id <= kMany; ++id) kept += find(files, statusOf(id)) ? 1 : 0;
    EXPECT_LE(kept, 2 * SeenFiles::kFilesMax);
    for (std::uint64_t id = kMany - SeenFiles::kFilesMax + 1; id <= kMany; ++id) {
        EXPECT_TRUE(find(files, statusOf(id))) << id;
    }
}

TEST(SeenFiles, areNoneTooManyWhileNobodyAsks) {
    SeenFiles files;
    for (std::uint64_t id = 1; id <= 2 * SeenFiles::kFilesMax; ++id) {
        EXPECT_TRUE(files.takesMore());
        files.put(statusOf(id));
    }
    EXPECT_FALSE(files.takesMore());
    // Those that came first are asked for first.
    EXPECT_TRUE(find(files, statusOf(1)));
    EXPECT_TRUE(files.takesMore());
}

// What the recorder tells

class RecorderSeenFilesTest : public RecorderTest {
protected:
    /// What the newest event of the object says that was seen.
    std::shared_ptr<const FileStatus> seen(std::string_view name) {
        EXPECT_TRUE(recorder().drain().ok());
        const auto batch = recorder().pathEvents(0, 10'000);
        if (!batch.ok()) throw std::runtime_error(batch.error().description());
        std::shared_ptr<const FileStatus> found;
        bool hasEvent = false;
        for (const Event& event : batch->events) {
            if (event.path != path(name)) continue;
            hasEvent = true;
            found = event.seen;
            if (found) {
                EXPECT_EQ(event.folder, fileID(name.substr(0, name.rfind('/') + 1)));
            }
        }
        EXPECT_TRUE(hasEvent) << name;
        return found;
    }
    const FileID rootID_{root_->status.fileID};
    void expectSeen(std::string_view name) {
        const auto found = seen(name);
        ASSERT_TRUE(found) << name;
        const FileStatus now = *sys::statx(AT_FDCWD, path(name).c_str());
        EXPECT_EQ(found->identity(), now.identity());
        EXPECT_EQ(found->size, now.size);
        EXPECT_EQ(found->mode, now.mode);
        EXPECT_EQ(found->changeTime, now.changeTime);
        EXPECT_EQ(found->modificationTime, now.modificationTime);
    }
};

TEST_P(RecorderSeenFilesTest, isTheFileAsItIs) {
    makeFolder("folder");
    write("folder/old", "one");
    start();
    write("folder/new", "one");
    append("folder/old", "two");
    expectSeen("folder/new");
    expectSeen("folder/old");
    append("folder/new", "three");
    expectSeen("folder/new");
    ASSERT_EQ(::chmod(path("folder/new").c_str(), 0600), 0);
    expectSeen("folder/new");
    rename("folder/new", "folder/renamed");
    expectSeen("folder/renamed");
    write("folder/saved", "four");
    rename("folder/saved", "folder/renamed");
    expectSeen("folder/renamed");
}

TEST_P(RecorderSeenFilesTest, isNoOtherThanAPlainFile) {
    makeFolder("folder");
    start();
    makeFolder("made");
    write("tagged");
    write("first");
    write("plain");
    expectSeen("tagged");
    expectSeen("first");
    setTag("tagged", "red");
    link("first", "second");
    ASSERT_EQ(::symlink("plain", path("link").c_str()), 0);
    ASSERT_EQ(::mkfifo(path("pipe").c_str(), 0600), 0);
    for (const char* name : {"made", "tagged", "first", "link", "pipe"}) EXPECT_FALSE(seen(name)) << name;
    expectSeen("plain");
    remove("second");
    EXPECT_TRUE(recorder().drain().ok());
    append("first", "more");
    expectSeen("first");
}

TEST_P(RecorderSeenFilesTest, isWhereListingsGet) {
    makeFolder("report.folio");
    makeFolder("report.folio/inner");
    makeFolder("folder");
    makeFolder("folder/inner");
    start();
    write("report.folio/a");
    write("report.folio/inner/b");
    write("folder/inner/c");
    EXPECT_FALSE(seen("report.folio/a"));
    EXPECT_FALSE(seen("report.folio/inner/b"));
    expectSeen("folder/inner/c");
    // What the folder has become counts, not what it was when the file was seen.
    rename("folder", "now.folio");
    EXPECT_FALSE(seen("now.folio/inner/c"));
}

TEST_P(RecorderSeenFilesTest, isNotInAFolderThatIsClosed) {
    constexpr int kFolders = 8;
    const auto folder = [](int i) { return fmt::format("folder{}", i); };
    for (int i = 0; i < kFolders; ++i) makeFolder(folder(i));
    OrdinaryPerson::giveTo(folder_.path());
    const OrdinaryPerson person;
    start();
    const auto isOpen = [&](int i) { return store().recordedPath(fileID(folder(i)), {&rootID_, 1})->isOpen; };
    for (int i = 0; i < kFolders; ++i) {
        write(folder(i) + "/a");
        expectSeen(folder(i) + "/a");
        // An entry's change and the folder's own are looked at in either order.
        write("beside");
        write(folder(i) + "/b");
        ASSERT_EQ(::chmod(path(folder(i)).c_str(), 0444), 0);
        EXPECT_FALSE(seen(folder(i) + "/a"));
        EXPECT_FALSE(isOpen(i));
    }
    for (int i = 0; i < kFolders; ++i) {
        ASSERT_EQ(::chmod(path(folder(i)).c_str(), 0700), 0);
        append(folder(i) + "/a", "more");
        expectSeen(folder(i) + "/a");
        EXPECT_TRUE(isOpen(i));
    }
}

TEST_P(RecorderSeenFilesTest, isForgottenWhenEverythingIsCompared) {
    start();
    write("a");
    expectSeen("a");
    ASSERT_TRUE(recorder().audit().ok());
    EXPECT_FALSE(seen("a"));
    append("a", "more");
    expectSeen("a");
    restart();
    EXPECT_FALSE(seen("a"));
}

INSTANTIATE_TEST_SUITE_P(Sources, RecorderSeenFilesTest,
                         ::testing::Values(Recorder::Choice::inotify, Recorder::Choice::automatic),
                         [](const auto& source) {
                             return source.param == Recorder::Choice::inotify ? "inotify" : "automatic";
                         });

}  // namespace
}  // namespace cindral::test
