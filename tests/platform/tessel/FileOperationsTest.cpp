#include "platform/tessel/FileOperations.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <optional>
#include <thread>
#include <utility>
#include <vector>

#include "platform/foundation/Dispatch.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/SysEdits.h"
#include "platform/foundation/SysFaults.h"
#include "platform/tessel/FileOperationsFixture.h"
#include "platform/tessel/StagingFolder.h"
#include "platform/tessel/TesselManager.h"
#include "support/LogCapture.h"
#include "support/OrdinaryPerson.h"

namespace cindral {
namespace {

namespace fs = std::filesystem;
using file_operations::createSubFolder;
using file_operations::importUnderFolder;
using file_operations::makeFolderUnlessThere;
using file_operations::remove;
using file_operations::rename;
using file_operations::reparent;
using file_operations::trash;
using test::FileOperationsTest;
using test::OrdinaryPerson;
using test::snapshotOf;
using test::TreeSnapshot;
using ::testing::IsEmpty;

constexpr const char* kNoSuchFile = "KsGeneralErrorDomain 260";
constexpr const char* kNoPermission = "KsGeneralErrorDomain 513";
constexpr const char* kFileExists = "KsGeneralErrorDomain 516";

std::string posix(int code) {
    return "KsPOSIXErrorDomain " + std::to_string(code);
}

/// Says of the first rename that it would go to another device.
sys::FaultSource onAnotherDevice() {
    return [renames = 0](const char* call) mutable {
        return std::string_view(call) == "renameat2" && ++renames == 1 ? EXDEV : 0;
    };
}

struct Scenario {
    const char* name;
    std::function<Result<void>()> run;
    bool isOnAnotherDevice = false;
    bool keeps = isOnAnotherDevice;  ///< a kill may leave what was taken away to where it is kept
};

class FaultTest : public FileOperationsTest {
protected:
    FaultTest() : FileOperationsTest(test::TemporaryFolder::inMemory()) {}

    void prepare() {
        for (const auto& entry : fs::directory_iterator(storage_)) fs::remove_all(entry.path());
        folder("target");
        folder("empty");
        makeTree(path("tree"));
        const timespec then[2] = {{1, 2}, {3, 4}};
        for (const auto& [name, contents] : {std::pair("a.txt", "A"), std::pair("target/taken", "T")})
            ::utimensat(AT_FDCWD, file(name, contents).c_str(), then, 0);
        if (!fs::exists(outside("source"))) makeTree(outside("source"));
    }

    std::vector<Scenario> scenarios() {
        const auto done = [](const auto& result) {
            return result.ok() ? Result<void>() : Result<void>(result.error());
        };
        const auto move = [this, done](const std::string& from, std::optional<std::string> name, Bouncing bouncing) {
            TesselProgress progress;
            return done(reparent(url(from), url("target"), name, bouncing, progress));
        };
        const auto import = [this, done](const std::string& from) {
            TesselProgress progress;
            return done(importUnderFolder(urlOf(outside(from)), url("target"), progress));
        };
        const auto deletion = [this](const std::string& name, Certainty certainty) {
            TesselProgress progress;
            return remove({url(name), identityOf(name)}, progress, certainty);
        };
        return {
            {"makeFolderUnlessThere", [=, this] { return makeFolderUnlessThere(url("target/.Trash")); }},
            {"leaveFolderThatIsThere", [=, this] { return makeFolderUnlessThere(url("target")); }},
            {"createSubFolder", [=, this] { return done(createSubFolder(url("target"), "new")); }},
            {"rename", [=, this] { return done(rename(url("a.txt"), "b.txt")); }},
            {"move", [=] { return move("tree", std::nullopt, Bouncing::isRefused); }},
            {"collide", [=] { return move("a.txt", "taken", Bouncing::isRefused); }},
            {"bounce", [=] { return move("a.txt", "taken", Bouncing::isAllowed); }},
            {"trash", [=, this] { return done(trash(url("a.txt"), url("target"))); }},
            {"deleteFile", [=] { return deletion("a.txt", Certainty::isNotWanted); }},
            {"deleteWithCertainty", [=] { return deletion("a.txt", Certainty::isWanted); }, false, true},
            {"deleteEmptyFolder", [=] { return deletion("empty", Certainty::isNotWanted); }},
            {"deleteFolder", [=] { return deletion("tree", Certainty::isNotWanted); }, false, true},
            {"importFile", [=] { return import("source/file"); }},
            {"importFolder", [=] { return import("source"); }},
            {"importLink", [=] { return import("source/link"); }},
            {"moveFileToOtherDevice", [=] { return move("a.txt", std::nullopt, Bouncing::isRefused); }, true},
            {"bounceOnOtherDevice", [=] { return move("a.txt", "taken", Bouncing::isAllowed); }, true},
            {"moveFolderToOtherDevice", [=] { return move("tree", std::nullopt, Bouncing::isRefused); }, true},
        };
    }

    void removeAbandoned() const { StagingFolder::removeAbandoned(*RootDirectories::shared().rootHolding(storage_)); }
};

// --- Names -----------------------------------------------------------------------------------------------------------

TEST_F(FileOperationsTest, aNameIsChecked) {
    file("a");
    for (const std::string& name : {std::string(), std::string("."), std::string(".."), std::string("a/b"),
                                    std::string("/"), std::string("a\0b", 3)}) {
        EXPECT_EQ(errorOf(createSubFolder(url("target"), name)), posix(EINVAL)) << name;
        EXPECT_EQ(errorOf(rename(url("a"), name)), posix(EINVAL)) << name;
        EXPECT_EQ(errorOf(reparent(url("a"), url("target"), name, Bouncing::isRefused, progress_)), posix(EINVAL));
    }
    EXPECT_EQ(errorOf(createSubFolder(url("target"), std::string(256, 'x'))), posix(ENAMETOOLONG));
    EXPECT_EQ(errorOf(rename(url("a"), std::string(256, 'x'))), posix(ENAMETOOLONG));
    EXPECT_EQ(errorOf(rename(url("a"), std::string(255, 'x'))), "");
}

TEST_F(FileOperationsTest, aNameMayBeAnyBytes) {
    const std::string name = "\xff\n\x1b[2J\\ \xe2\x80\xae";
    EXPECT_EQ(errorOf(createSubFolder(url("target"), name)), "");
    EXPECT_TRUE(fs::is_directory(path("target/" + name)));
    const Result<KsURL> renamed = rename(url("target/" + name), "\x01\x7f");
    ASSERT_TRUE(renamed.ok());
    EXPECT_EQ(renamed->path(), path("target/\x01\x7f"));
}

// --- Creating, renaming, moving ----------------------------------------------------------------------------------------

TEST_F(FileOperationsTest, createsASubFolder) {
    const Result<KsURL> made = createSubFolder(url("target"), "new");
    ASSERT_TRUE(made.ok());
    EXPECT_EQ(*made, url("target/new"));
    EXPECT_TRUE(fs::is_directory(path("target/new")));
}

TEST_F(FileOperationsTest, aTakenNameIsAnErrorThatNamesWhatIsInTheWay) {
    file("a", "A");
    file("target/a", "B");
    folder("target/new");
    const TreeSnapshot before = snapshot();
    const auto expectCollision = [&](const Result<KsURL>& result, std::string_view inTheWay) {
        EXPECT_EQ(errorOf(result), kFileExists);
        ASSERT_FALSE(result.ok());
        EXPECT_EQ(ts_collidingURL(result.error()), url(inTheWay));
    };
    expectCollision(createSubFolder(url("target"), "new"), "target/new");
    expectCollision(createSubFolder(url("target"), "a"), "target/a");
    expectCollision(rename(url("a"), "target"), "target");
    expectCollision(reparent(url("a"), url("target"), std::nullopt, Bouncing::isRefused, progress_), "target/a");
    expectCollision(reparent(url("a"), url("target"), "new", Bouncing::isRefused, progress_), "target/new");
    expectCollision(importUnderFolder(url("a"), url("target"), progress_), "target/a");
    expectCollision(importUnderFolder(url("target/new"), url("target"), progress_), "target/new");
    expectCollision(trash(url("a"), url("target")), "target/a");
    EXPECT_EQ(snapshot(), before);
    EXPECT_EQ(ts_collidingURL(KsError::posix(EEXIST)), std::nullopt);
}

TEST_F(FileOperationsTest, aCollidingNameOfAnyBytesIsNamedExactly) {
    const std::string name = "a b%20\xff\n";
    folder("target/" + name);
    const Result<KsURL> made = createSubFolder(url("target"), name);
    ASSERT_FALSE(made.ok());
    EXPECT_EQ(ts_collidingURL(made.error()), url("target/" + name));
}

TEST_F(FileOperationsTest, aDanglingLinkIsInTheWayToo) {
    file("a");
    fs::create_symlink("nowhere", path("target/a"));
    EXPECT_EQ(errorOf(reparent(url("a"), url("target"), std::nullopt, Bouncing::isRefused, progress_)), kFileExists);
    EXPECT_EQ(errorOf(importUnderFolder(url("a"), url("target"), progress_)), kFileExists);
    EXPECT_TRUE(fs::is_symlink(path("target/a")));
}

TEST_F(FileOperationsTest, movesWithAndWithoutANewName) {
    file("a", "A");
    EXPECT_EQ(*reparent(url("a"), url("target"), std::nullopt, Bouncing::isRefused, progress_), url("target/a"));
    EXPECT_EQ(contentsOf(path("target/a")), "A");
    EXPECT_EQ(*reparent(url("target/a"), urlOf(storage_), "b", Bouncing::isRefused, progress_), url("b"));
    EXPECT_EQ(contentsOf(path("b")), "A");
    EXPECT_EQ(*rename(url("b"), "c"), url("c"));
    EXPECT_EQ(contentsOf(path("c")), "A");
}

TEST_F(FileOperationsTest, movingToWhereItIsIsDone) {
    file("a");
    const TreeSnapshot before = snapshot();
    EXPECT_EQ(*rename(url("a"), "a"), url("a"));
    EXPECT_EQ(*reparent(url("a"), urlOf(storage_), std::nullopt, Bouncing::isRefused, progress_), url("a"));
    EXPECT_EQ(*reparent(url("a"), urlOf(storage_), std::nullopt, Bouncing::isAllowed, progress_), url("a"));
    EXPECT_EQ(snapshot(), before);
}

TEST_F(FileOperationsTest, aFolderCannotGoIntoItself) {
    makeTree(path("tree"));
    const TreeSnapshot before = snapshot();
    for (const std::string_view target : {"tree", "tree/sub"}) {
        EXPECT_EQ(errorOf(reparent(url("tree"), url(target), std::nullopt, Bouncing::isRefused, progress_)),
                  posix(EINVAL));
        EXPECT_EQ(errorOf(reparent(url("tree"), url(target), std::nullopt, Bouncing::isAllowed, progress_)),
                  posix(EINVAL));
        EXPECT_EQ(errorOf(importUnderFolder(url("tree"), url(target), progress_)), posix(EINVAL));
    }
    // Nor can the folder that holds the storage.
    EXPECT_EQ(errorOf(importUnderFolder(urlOf(folder_.path()), url("target"), progress_)), posix(EINVAL));
    EXPECT_EQ(snapshot(), before);
}

TEST_F(FileOperationsTest, bouncesToAFreeName) {
    const auto bounce = [&](std::string_view name) {
        return reparent(url(name), url("target"), std::nullopt, Bouncing::isAllowed, progress_)->path();
    };
    for (int i = 0; i < 3; ++i) {
        file("Report.txt", std::to_string(i));
        folder("Plain.folder");
        bounce("Report.txt");
        bounce("Plain.folder");
    }
    EXPECT_EQ(contentsOf(path("target/Report.txt")), "0");
    EXPECT_EQ(contentsOf(path("target/Report 2.txt")), "1");
    EXPECT_EQ(contentsOf(path("target/Report 3.txt")), "2");
    EXPECT_TRUE(fs::is_directory(path("target/Plain.folder 3")));
    // A package's name has an extension, for all that it is a directory.
    for (int i = 0; i < 2; ++i) {
        folder("Song.tonemill");
        bounce("Song.tonemill");
    }
    EXPECT_TRUE(fs::is_directory(path("target/Song 2.tonemill")));
}

TEST_F(FileOperationsTest, whatIsNotThereIsSaidToBeSo) {
    EXPECT_EQ(errorOf(rename(url("none"), "b")), kNoSuchFile);
    EXPECT_EQ(errorOf(remove(url("none"), progress_)), kNoSuchFile);
    EXPECT_EQ(errorOf(trash(url("none"), url("target"))), kNoSuchFile);
    EXPECT_EQ(errorOf(createSubFolder(url("none"), "a")), kNoSuchFile);
    EXPECT_EQ(errorOf(importUnderFolder(urlOf(outside("none")), url("target"), progress_)), kNoSuchFile);
    file("a");
    EXPECT_EQ(errorOf(createSubFolder(url("a"), "b")), posix(ENOTDIR));
    EXPECT_EQ(errorOf(reparent(url("a"), url("none"), std::nullopt, Bouncing::isRefused, progress_)), kNoSuchFile);
    const Result<KsURL> failed = rename(url("none"), "b");
    EXPECT_EQ(failed.error().userInfo().at("path"), path("none"));
}

TEST_F(FileOperationsTest, aRootStaysWhereItIs) {
    const std::string inner = folder("apps/mail/Documents");
    ASSERT_TRUE(RootDirectories::shared().add(inner, RootPolicy::applicationContainer).ok());
    folder(".TemporaryLocalFolder");
    const TreeSnapshot before = snapshot();
    for (const KsURL& fixed : {urlOf(storage_), urlOf(inner), url("apps"), url(".TemporaryLocalFolder"),
                               urlOf(folder_.path()), urlOf("/")}) {
        EXPECT_EQ(errorOf(rename(fixed, "other")), kNoPermission) << fixed.path();
        EXPECT_EQ(errorOf(reparent(fixed, url("target"), "other", Bouncing::isRefused, progress_)), kNoPermission);
        EXPECT_EQ(errorOf(trash(fixed, url("target"))), kNoPermission);
        EXPECT_EQ(errorOf(remove(fixed, progress_)), kNoPermission);
    }
    EXPECT_EQ(snapshot(), before);
    RootDirectories::shared().remove(inner);
}

TEST_F(FileOperationsTest, nothingIsMadeOrChangedOutsideOfTheRoots) {
    folder_.folder("elsewhere");
    folder_.file("elsewhere/a");
    file("a");
    const KsURL elsewhere = urlOf(outside("elsewhere"));
    const TreeSnapshot before = snapshot();
    EXPECT_EQ(errorOf(createSubFolder(elsewhere, "b")), kNoPermission);
    EXPECT_EQ(errorOf(importUnderFolder(url("a"), elsewhere, progress_)), kNoPermission);
    EXPECT_EQ(errorOf(reparent(url("a"), elsewhere, std::nullopt, Bouncing::isRefused, progress_)), kNoPermission);
    EXPECT_EQ(errorOf(rename(urlOf(outside("elsewhere/a")), "b")), kNoPermission);
    EXPECT_EQ(errorOf(remove(urlOf(outside("elsewhere/a")), progress_)), kNoPermission);
    EXPECT_EQ(snapshot(), before);
}

TEST_F(FileOperationsTest, noLinkLeadsOutside) {
    folder_.folder("elsewhere/sub");
    folder_.file("elsewhere/a");
    file("a");
    fs::create_symlink(outside("elsewhere"), path("way"));
    fs::create_symlink("../elsewhere", path("other"));
    const TreeSnapshot before = snapshot();
    for (const std::string way : {"way", "other"}) {
        EXPECT_NE(errorOf(createSubFolder(url(way), "b")), "");
        EXPECT_NE(errorOf(createSubFolder(url(way + "/sub"), "b")), "");
        EXPECT_NE(errorOf(reparent(url("a"), url(way), std::nullopt, Bouncing::isRefused, progress_)), "");
        EXPECT_NE(errorOf(importUnderFolder(url("a"), url(way), progress_)), "");
        EXPECT_NE(errorOf(rename(url(way + "/a"), "b")), "");
        EXPECT_NE(errorOf(remove(url(way + "/a"), progress_)), "");
        EXPECT_NE(errorOf(trash(url(way + "/a"), url("target"))), "");
        EXPECT_NE(errorOf(makeFolderUnlessThere(url(way))), "");
        EXPECT_NE(errorOf(makeFolderUnlessThere(url(way + "/.Trash"))), "");
    }
    EXPECT_EQ(snapshot(), before);
    // The link itself can be renamed and deleted: it is an item.
    EXPECT_EQ(errorOf(rename(url("way"), "path")), "");
    EXPECT_EQ(errorOf(remove(url("path"), progress_)), "");
    EXPECT_TRUE(fs::exists(outside("elsewhere/a")));
}

// --- Import ------------------------------------------------------------------------------------------------------------

TEST_F(FileOperationsTest, importsAFileWithAllThatItHas) {
    makeTree(outside("source"));
    ASSERT_EQ(*importUnderFolder(urlOf(outside("source/file")), url("target"), progress_), url("target/file"));
    EXPECT_EQ(snapshotOf(path("target")).at("file"), snapshotOf(outside("source")).at("file"));
    EXPECT_EQ(progress_.counts().completedBytes, progress_.counts().totalBytes);
    EXPECT_EQ(progress_.counts().completedItems, 1U);
    EXPECT_THAT(leftovers(), IsEmpty());
}

TEST_F(FileOperationsTest, importsAFolderWithAllThatItHolds) {
    makeTree(outside("source"));
    const timespec then[2] = {{5, 6}, {7, 8}};
    ::utimensat(AT_FDCWD, outside("source/sub").c_str(), then, 0);
    ASSERT_EQ(*importUnderFolder(urlOf(outside("source")), url("target"), progress_), url("target/source"));
    EXPECT_EQ(snapshotOf(path("target/source")), snapshotOf(outside("source")));
    struct stat status {};
    ASSERT_EQ(::stat(path("target/source/sub").c_str(), &status), 0);
    EXPECT_EQ(status.st_mtim.tv_sec, 7);
    EXPECT_EQ(status.st_mtim.tv_nsec, 8);
    // Two names of one file are two names of one file, but not of the source's.
    EXPECT_EQ(fs::hard_link_count(path("target/source/sub/one")), 2U);
    EXPECT_TRUE(fs::equivalent(path("target/source/sub/one"), path("target/source/sub/other")));
    const auto counts = progress_.counts();
    EXPECT_EQ(counts.totalItems, 8U);
    EXPECT_EQ(counts.completedItems, counts.totalItems);
    EXPECT_EQ(counts.completedBytes, counts.totalBytes);
    EXPECT_THAT(leftovers(), IsEmpty());
}

TEST_F(FileOperationsTest, importsLinksAndFIFOsAsTheyAre) {
    makeTree(outside("source"));
    EXPECT_EQ(errorOf(importUnderFolder(urlOf(outside("source/link")), url("target"), progress_)), "");
    EXPECT_EQ(fs::read_symlink(path("target/link")), "../nowhere");
    // With a FIFO that was opened, this would wait for ever.
    EXPECT_EQ(errorOf(importUnderFolder(urlOf(outside("source/sub/fifo")), url("target"), progress_)), "");
    EXPECT_TRUE(fs::is_fifo(path("target/fifo")));
}

TEST_F(FileOperationsTest, aDeviceInATreeIsAnErrorUnlessItCanBeMade) {
    if (::geteuid() != 0) {
        // A folder with devices that anybody may look at.
        EXPECT_EQ(errorOf(importUnderFolder(urlOf("/dev/null"), url("target"), progress_)), posix(EPERM));
        return;
    }
    folder_.folder("source");
    ASSERT_EQ(::mknod(outside("source/null").c_str(), S_IFCHR | 0600, makedev(1, 3)), 0);
    EXPECT_EQ(errorOf(importUnderFolder(urlOf(outside("source")), url("target"), progress_)), "");
    EXPECT_TRUE(fs::is_character_file(path("target/source/null")));
    OrdinaryPerson::giveTo(folder_.path());
    const OrdinaryPerson person;
    fs::remove_all(path("target/source"));
    const TreeSnapshot before = snapshot();
    EXPECT_EQ(errorOf(importUnderFolder(urlOf(outside("source")), url("target"), progress_)), posix(EPERM));
    EXPECT_EQ(snapshot(), before);
    EXPECT_THAT(leftovers(), IsEmpty());
}

TEST_F(FileOperationsTest, holesStayHoles) {
    const std::string source = outside("sparse");
    {
        const int fd = ::open(source.c_str(), O_WRONLY | O_CREAT, 0600);
        ASSERT_EQ(::pwrite(fd, "begin", 5, 0), 5);
        ASSERT_EQ(::pwrite(fd, "middle", 6, 8 << 20), 6);
        ASSERT_EQ(::ftruncate(fd, 16 << 20), 0);
        ::close(fd);
    }
    struct stat status {};
    for (const bool canCopyInKernel : {true, false}) {
        const sys::FaultInjection faults([&](const char* call) {
            return !canCopyInKernel && std::string_view(call) == "copy_file_range" ? EXDEV : 0;
        });
        ASSERT_EQ(errorOf(importUnderFolder(urlOf(source), url("target"), progress_)), "");
        ASSERT_EQ(::stat(path("target/sparse").c_str(), &status), 0);
        EXPECT_EQ(status.st_size, 16 << 20);
        EXPECT_LT(status.st_blocks * 512, 1 << 20);
        EXPECT_EQ(contentsOf(path("target/sparse")), contentsOf(source));
        fs::remove(path("target/sparse"));
    }
}

// Every way of copying data gives the same file.
TEST_F(FileOperationsTest, copiesByWhateverTheFileSystemOffers) {
    std::string contents;
    for (std::uint64_t i = 0; contents.size() < 3'000'000; ++i) contents += std::to_string(i * i);
    const std::string source = folder_.file("big", contents);
    for (const std::string_view missing : {"", "ficlone", "copy_file_range", "lseek"}) {
        for (const int reason : {EOPNOTSUPP, EINVAL, EXDEV, ENOSYS}) {
            const sys::FaultInjection faults(
                [&](const char* call) { return missing == std::string_view(call) ? reason : 0; });
            ASSERT_EQ(errorOf(importUnderFolder(urlOf(source), url("target"), progress_)), "") << missing;
            EXPECT_EQ(contentsOf(path("target/big")), contents) << missing;
            fs::remove(path("target/big"));
        }
    }
}

// What the kernel makes up has no size, and contents all the same.
TEST_F(FileOperationsTest, importsFilesThatSayTheyHaveNoSize) {
    ASSERT_EQ(errorOf(importUnderFolder(urlOf("/proc/sys/kernel/ostype"), url("target"), progress_)), "");
    EXPECT_EQ(contentsOf(path("target/ostype")), "Linux\n");
}

TEST_F(FileOperationsTest, importsWithoutUnnamedFiles) {
    makeTree(outside("source"));
    for (const int reason : {EOPNOTSUPP, EISDIR, EINVAL}) {
        int opened = 0;
        // The fourth: the folder, the source's folder, the file itself, its contents, the file without a name.
        const sys::FaultInjection faults(
            [&](const char* call) { return std::string_view(call) == "openat" && ++opened == 4 ? reason : 0; });
        ASSERT_EQ(errorOf(importUnderFolder(urlOf(outside("source/file")), url("target"), progress_)), "");
        EXPECT_EQ(snapshotOf(path("target")).at("file"), snapshotOf(outside("source")).at("file"));
        fs::remove(path("target/file"));
    }
    EXPECT_THAT(leftovers(), IsEmpty());
}

TEST_F(FileOperationsTest, aFolderThatMayNotBeWrittenIsImportedAsSuch) {
    makeTree(outside("source"));
    ::chmod(outside("source").c_str(), 0555);
    OrdinaryPerson::giveTo(folder_.path());
    const OrdinaryPerson person;
    EXPECT_EQ(errorOf(importUnderFolder(urlOf(outside("source")), url("target"), progress_)), "");
    struct stat status {};
    ASSERT_EQ(::stat(path("target/source").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0555U);
    EXPECT_EQ(snapshotOf(path("target/source")), snapshotOf(outside("source")));
    ::chmod(outside("source").c_str(), 0755);
    ::chmod(path("target/source").c_str(), 0755);
}

TEST_F(FileOperationsTest, whatCannotBeReadIsNotSkipped) {
    makeTree(outside("source"));
    ::chmod(outside("source/sub/one").c_str(), 0);
    OrdinaryPerson::giveTo(folder_.path());
    const OrdinaryPerson person;
    const Result<KsURL> imported = importUnderFolder(urlOf(outside("source")), url("target"), progress_);
    EXPECT_EQ(errorOf(imported), posix(EACCES));
    EXPECT_TRUE(imported.error().userInfo().at("path").starts_with(outside("source/sub/o")));
    EXPECT_FALSE(fs::exists(path("target/source")));
    EXPECT_THAT(leftovers(), IsEmpty());
}

TEST_F(FileOperationsTest, bitsThatRunAProgramAsItsOwnerGoWithTheOwner) {
    if (::geteuid() != 0) {
        EXPECT_EQ(errorOf(importUnderFolder(urlOf("/bin/su"), url("target"), progress_)), "");
        struct stat status {};
        ASSERT_EQ(::stat(path("target/su").c_str(), &status), 0);
        EXPECT_EQ(status.st_mode & S_ISUID, 0U);
        return;
    }
    folder_.file("program");
    ASSERT_EQ(::chown(outside("program").c_str(), 65'533, 65'533), 0);
    ASSERT_EQ(::chmod(outside("program").c_str(), 06755), 0);
    EXPECT_EQ(errorOf(importUnderFolder(urlOf(outside("program")), url("target"), progress_)), "");
    struct stat status {};
    ASSERT_EQ(::stat(path("target/program").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0755U);
}

TEST_F(FaultTest, treesOfAnyDepthAreCopiedAndRemoved) {
    // Deeper than a path can be written, and than there are descriptors.
    constexpr int kDepth = 1100;
    {
        fs::create_directory(outside("deep"));
        int at = ::open(outside("deep").c_str(), O_PATH | O_DIRECTORY);
        for (int i = 0; i < kDepth; ++i) {
            ASSERT_EQ(::mkdirat(at, "deeper", 0700), 0);
            const int next = ::openat(at, "deeper", O_PATH | O_DIRECTORY);
            ::close(at);
            at = next;
        }
        ::close(::openat(at, "bottom", O_WRONLY | O_CREAT, 0600));
        ::close(at);
    }
    ASSERT_EQ(errorOf(importUnderFolder(urlOf(outside("deep")), url("target"), progress_)), "");
    EXPECT_EQ(progress_.counts().completedItems, kDepth + 2U);
    ASSERT_EQ(errorOf(remove(url("target/deep"), progress_)), "");
    EXPECT_FALSE(fs::exists(path("target/deep")));
    EXPECT_THAT(leftovers(), IsEmpty());
}

TEST_F(FileOperationsTest, theStorageItselfCanBeImportedElsewhere) {
    const test::TemporaryFolder container;
    const std::string documents = container.folder("Documents");
    ASSERT_TRUE(RootDirectories::shared().add(documents, RootPolicy::applicationContainer).ok());
    file("a", "A");
    // The copy is built inside of what is copied, and is no part of it.
    EXPECT_EQ(errorOf(importUnderFolder(urlOf(storage_), urlOf(documents), progress_)), "");
    EXPECT_EQ(contentsOf(documents + "/Documents/a"), "A");
    EXPECT_TRUE(fs::is_empty(documents + "/Documents/.TemporaryLocalFolder"));
    RootDirectories::shared().remove(documents);
}

TEST_F(FileOperationsTest, anImportThatIsCancelledLeavesNothing) {
    makeTree(outside("source"));
    const TreeSnapshot before = snapshot();
    for (const std::string source : {"source", "source/file"}) {
        for (int calls = 1;; ++calls) {
            TesselProgress progress;
            int made = 0;
            const sys::FaultInjection faults([&](const char* /*call*/) {
                if (++made == calls) progress.cancel();
                return 0;
            });
            const Result<KsURL> imported = importUnderFolder(urlOf(outside(source)), url("target"), progress);
            if (imported.ok()) {
                fs::remove_all(imported->path());
                break;
            }
            ASSERT_EQ(errorOf(imported), posix(ECANCELED));
            ASSERT_EQ(snapshot(), before) << calls;
        }
    }
    EXPECT_THAT(leftovers(), IsEmpty());
}

// --- Delete ------------------------------------------------------------------------------------------------------------

TEST_F(FileOperationsTest, deletesFilesFoldersAndLinks) {
    makeTree(path("tree"));
    file("a");
    folder_.folder("elsewhere");
    fs::create_directory_symlink(outside("elsewhere"), path("tree/out"));
    EXPECT_EQ(errorOf(remove(url("a"), progress_)), "");
    EXPECT_EQ(errorOf(remove(url("tree/empty"), progress_)), "");
    TesselProgress progress;
    EXPECT_EQ(errorOf(remove(url("tree"), progress)), "");
    EXPECT_EQ(progress.counts().totalItems, 8U);
    EXPECT_EQ(progress.counts().completedItems, 8U);
    EXPECT_THAT(snapshotOf(storage_), ::testing::SizeIs(1));  // The target folder.
    EXPECT_TRUE(fs::exists(outside("elsewhere")));
    EXPECT_THAT(leftovers(), IsEmpty());
}

TEST_F(FileOperationsTest, aFolderThatCannotBeDeletedWhollyIsNotDeletedAtAll) {
    makeTree(path("tree"));
    ::chmod(path("tree/sub").c_str(), 0555);
    OrdinaryPerson::giveTo(folder_.path());
    const TreeSnapshot before = snapshot();
    {
        const OrdinaryPerson person;
        const Result<void> removed = remove(url("tree"), progress_);
        EXPECT_EQ(errorOf(removed), posix(EACCES));
        EXPECT_TRUE(removed.error().userInfo().at("path").starts_with(path("tree/sub/")));
    }
    EXPECT_EQ(snapshot(), before);
    ::chmod(path("tree/sub").c_str(), 0755);
}

TEST_F(FileOperationsTest, whatTheFileSystemRefusesIsToldAsItIs) {
    file("target/full/a");
    folder("target/empty");
    for (const char* name : {"target/full", "target/empty"}) {
        // As on a file system that is read-only: it says so whatever is asked, also whether something may be written.
        const sys::FaultInjection faults([](const char* call) {
            const std::string_view made(call);
            return made == "unlinkat" || made == "faccessat" || made == "mkdirat" ? EROFS : 0;
        });
        EXPECT_EQ(errorOf(remove(url(name), progress_)), posix(EROFS)) << name;
    }
}

TEST_F(FileOperationsTest, aFolderOfSomebodyElseIsNotDeleted) {
    makeTree(path("tree"));
    OrdinaryPerson::giveTo(folder_.path());
    // Without the privilege there is nobody else to give it to: a folder that may not be written is all there is.
    ::chmod(path("tree/sub").c_str(), 0555);
    if (::geteuid() == 0) {
        ::chmod(path("tree/sub").c_str(), 0755);
        ASSERT_EQ(::chown(path("tree/sub").c_str(), 0, 0), 0);
    }
    const TreeSnapshot before = snapshot();
    {
        const OrdinaryPerson person;
        EXPECT_EQ(errorOf(remove(url("tree"), progress_)), posix(EACCES));
    }
    EXPECT_EQ(snapshot(), before);
    ::chmod(path("tree/sub").c_str(), 0755);
}

TEST_F(FileOperationsTest, aDeletionIsCancelledWhollyOrNotAtAll) {
    for (int calls = 1;; ++calls) {
        makeTree(path("tree"));
        const TreeSnapshot before = snapshot();
        TesselProgress progress;
        int made = 0;
        const sys::FaultInjection faults([&](const char* /*call*/) {
            if (++made == calls) progress.cancel();
            return 0;
        });
        const Result<void> removed = remove(url("tree"), progress);
        if (removed.ok()) {
            EXPECT_FALSE(fs::exists(path("tree")));
            if (!progress.isCancelled()) break;
            continue;
        }
        ASSERT_EQ(errorOf(removed), posix(ECANCELED));
        ASSERT_EQ(snapshot(), before) << calls;
        fs::remove_all(path("tree"));
    }
    EXPECT_THAT(leftovers(), IsEmpty());
}

TEST_F(FileOperationsTest, onlyTheObjectThatIsMeantIsDeleted) {
    file("a", "old");
    const ObjectIdentity old = identityOf("a");
    file("b", "new");
    fs::rename(path("b"), path("a"));
    EXPECT_EQ(errorOf(remove({url("a"), old}, progress_)), posix(ESTALE));
    // Swapped between the look and the deed.
    const ObjectIdentity meant = identityOf("a");
    const sys::FaultInjection faults([&](const char* call) {
        if (std::string_view(call) != "renameat2" || contentsOf(path("a")) != "new") return 0;
        file("c", "newer");
        fs::rename(path("c"), path("a"));
        return 0;
    });
    EXPECT_EQ(errorOf(remove({url("a"), meant}, progress_, Certainty::isWanted)), posix(ESTALE));
    EXPECT_EQ(contentsOf(path("a")), "newer");
    EXPECT_THAT(leftovers(), IsEmpty());
}

// The place was looked up, and whoever was there has left it to another since.
TEST_F(FileOperationsTest, whoHasTakenThePlaceOfWhatIsMeantIsLeftAlone) {
    file("a", "new");
    folder("Letters");
    file("b", "B");
    // Another number, or the same one, given again to an object that was born later.
    ObjectIdentity gone = identityOf("b");
    for (int born = 0; born < 2; ++born) {
        const MeantFile file(url("a"), gone);
        const MeantFile parent(url("Letters"), gone);
        const TreeSnapshot before = snapshot();
        EXPECT_EQ(errorOf(rename(file, "c")), posix(ESTALE));
        EXPECT_EQ(errorOf(reparent(file, url("target"), std::nullopt, Bouncing::isAllowed, progress_)), posix(ESTALE));
        EXPECT_EQ(errorOf(reparent(url("a"), parent, std::nullopt, Bouncing::isRefused, progress_)), posix(ESTALE));
        EXPECT_EQ(errorOf(trash(file, url("target"))), posix(ESTALE));
        EXPECT_EQ(errorOf(remove(file, progress_)), posix(ESTALE));
        EXPECT_EQ(errorOf(remove(parent, progress_)), posix(ESTALE));
        EXPECT_EQ(errorOf(importUnderFolder(url("b"), parent, progress_)), posix(ESTALE));
        EXPECT_EQ(errorOf(createSubFolder(parent, "new")), posix(ESTALE));
        EXPECT_EQ(errorOf(ts_withReadWriteAccess(file, [](int /*fd*/) { return Result<void>(); })), posix(ESTALE));
        EXPECT_EQ(snapshot(), before);
        gone = identityOf("a");
        gone.birthStamp -= 1;
        if (born == 0) continue;
        EXPECT_EQ(rename(file, "c").error().userInfo().at("path"), path("a"));
    }
}

TEST_F(FileOperationsTest, whatIsMeantIsFoundByItsIdentity) {
    file("a", "A");
    folder("Letters");
    const ObjectIdentity meant = identityOf("a");
    const MeantFile letters(url("Letters"), identityOf("Letters"));
    EXPECT_EQ(errorOf(reparent({url("a"), meant}, letters, std::nullopt, Bouncing::isRefused, progress_)), "");
    EXPECT_EQ(errorOf(rename({url("Letters/a"), meant}, "b")), "");
    EXPECT_EQ(errorOf(trash({url("Letters/b"), meant}, url("target"))), "");
    EXPECT_EQ(errorOf(remove({url("target/b"), meant}, progress_)), "");
    EXPECT_EQ(errorOf(createSubFolder(letters, "new")), "");
    EXPECT_EQ(errorOf(remove(letters, progress_)), "");
    EXPECT_THAT(leftovers(), IsEmpty());
}

// Another program puts its file in the place of what is deleted, before any of the system calls that takes.
TEST_F(FileOperationsTest, whatIsSwappedInIsNeverDeleted) {
    bool isReached = true;
    for (int n = 1; isReached; ++n) {
        for (const auto& entry : fs::directory_iterator(storage_)) fs::remove_all(entry.path());
        file("a", "meant");
        file("b", "not meant");
        const ObjectIdentity meant = identityOf("a");
        int calls = 0;
        Result<void> removed;
        {
            const sys::FaultInjection faults([&](const char* /*call*/) {
                if (++calls == n) fs::rename(path("b"), path("a"));
                return 0;
            });
            removed = remove({url("a"), meant}, progress_, Certainty::isWanted);
        }
        isReached = calls >= n;
        ASSERT_TRUE(fs::exists(path(isReached ? "a" : "b"))) << n;
        ASSERT_EQ(contentsOf(path(isReached ? "a" : "b")), "not meant") << n;
        ASSERT_THAT(leftovers(), IsEmpty()) << n;
    }
}

TEST_F(FileOperationsTest, aFileIsDeletedAlsoWhereNothingCanBeTakenOutOfSight) {
    for (const int reason : {ENOSPC, EDQUOT, EROFS, EACCES, EXDEV}) {
        file("a");
        const MeantFile meant(url("a"), identityOf("a"));
        const sys::FaultInjection faults([&](const char* call) {
            const std::string_view made(call);
            return made == "mkdirat" || made == "renameat2" ? reason : 0;
        });
        EXPECT_EQ(errorOf(remove(meant, progress_, Certainty::isWanted)), "") << reason;
        EXPECT_FALSE(fs::exists(path("a"))) << reason;
    }
}

// Somebody takes the name while another's file is on its way back to it.
TEST_F(FileOperationsTest, whatCannotGoBackToItsNameGoesBesideIt) {
    file("a.txt", "meant");
    const ObjectIdentity meant = identityOf("a.txt");
    int renames = 0;
    const sys::FaultInjection faults([&](const char* call) {
        if (std::string_view(call) != "renameat2") return 0;
        if (++renames == 1) {
            file("other", "not meant");
            fs::rename(path("other"), path("a.txt"));
        } else if (renames == 2) {
            file("a.txt", "newest");
        }
        return 0;
    });
    EXPECT_EQ(errorOf(remove({url("a.txt"), meant}, progress_, Certainty::isWanted)), posix(ESTALE));
    EXPECT_EQ(contentsOf(path("a.txt")), "newest");
    EXPECT_EQ(contentsOf(path("a 2.txt")), "not meant");
}

// --- Moves to another device -------------------------------------------------------------------------------------------

TEST_F(FileOperationsTest, movesToAnotherDeviceByCopying) {
    for (const bool isFolder : {true, false}) {
        makeTree(path("tree"));
        const std::string subject = isFolder ? "tree" : "tree/file";
        const TreeSnapshot source = snapshotOf(path("tree"));
        TesselProgress progress;
        {
            const sys::FaultInjection faults(onAnotherDevice());
            ASSERT_EQ(*reparent(url(subject), url("target"), "moved", Bouncing::isRefused, progress),
                      url("target/moved"));
        }
        EXPECT_FALSE(fs::exists(path(subject)));
        if (isFolder) {
            EXPECT_EQ(snapshotOf(path("target/moved")), source);
        } else {
            EXPECT_EQ(snapshotOf(path("target")).at("moved"), source.at("file"));
        }
        EXPECT_EQ(progress.counts().completedBytes, progress.counts().totalBytes);
        EXPECT_THAT(leftovers(), IsEmpty());
        fs::remove_all(path("target/moved"));
        fs::remove_all(path("tree"));
    }
}

TEST_F(FileOperationsTest, movesBetweenRealDevices) {
    // Memory, which is another device than what the tests lie on; where it is the same, the move is an ordinary one.
    std::string pattern = "/dev/shm/cindral-XXXXXX";
    ASSERT_NE(::mkdtemp(pattern.data()), nullptr);
    const std::string other = pattern + "/Documents";
    fs::create_directory(other);
    ASSERT_TRUE(RootDirectories::shared().add(other, RootPolicy::applicationContainer).ok());
    makeTree(path("tree"));
    // Attributes of one's own are kept in memory since Linux 6.6.
    ::removexattr(path("tree/file").c_str(), "user.tag");
    ::removexattr(path("tree/sub").c_str(), "user.tag");
    const TreeSnapshot source = snapshotOf(path("tree"));
    ASSERT_EQ(errorOf(reparent(url("tree"), urlOf(other), std::nullopt, Bouncing::isRefused, progress_)), "");
    EXPECT_EQ(snapshotOf(other + "/tree"), source);
    EXPECT_FALSE(fs::exists(path("tree")));
    ASSERT_EQ(errorOf(reparent(urlOf(other + "/tree"), url("target"), std::nullopt, Bouncing::isRefused, progress_)),
              "");
    EXPECT_EQ(snapshotOf(path("target/tree")), source);
    EXPECT_THAT(snapshotOf(other), IsEmpty());
    EXPECT_THAT(leftovers(), IsEmpty());
    RootDirectories::shared().remove(other);
    fs::remove_all(pattern);
}

TEST_F(FaultTest, aMoveToAnotherDeviceThatIsCancelledLeavesTheSource) {
    for (int calls = 1;; ++calls) {
        makeTree(path("tree"));
        const TreeSnapshot before = snapshot();
        TesselProgress progress;
        int made = 0;
        auto other = onAnotherDevice();
        const sys::FaultInjection faults([&](const char* call) {
            if (++made == calls) progress.cancel();
            return other(call);
        });
        const auto moved = reparent(url("tree"), url("target"), std::nullopt, Bouncing::isRefused, progress);
        if (moved.ok()) {
            fs::remove_all(path("target/tree"));
            if (!progress.isCancelled()) break;
            continue;
        }
        ASSERT_EQ(errorOf(moved), posix(ECANCELED));
        ASSERT_EQ(snapshot(), before) << calls;
        fs::remove_all(path("tree"));
    }
    EXPECT_THAT(leftovers(), IsEmpty());
}

TEST_F(FileOperationsTest, aMoveToAnotherDeviceThatClashesLeavesTheSource) {
    makeTree(path("tree"));
    folder("target/tree");
    const TreeSnapshot before = snapshot();
    const sys::FaultInjection faults(onAnotherDevice());
    EXPECT_EQ(errorOf(reparent(url("tree"), url("target"), std::nullopt, Bouncing::isRefused, progress_)), kFileExists);
    EXPECT_EQ(snapshot(), before);
    EXPECT_THAT(leftovers(), IsEmpty());
}

// However many names are taken, it is copied once.
TEST_F(FileOperationsTest, bouncesOnAnotherDeviceWithoutCopyingAnew) {
    for (const bool isFolder : {true, false}) {
        makeTree(path("tree"));
        const std::string subject = isFolder ? "tree" : "tree/file";
        const std::string name = isFolder ? "tree" : "file";
        const TreeSnapshot source = snapshotOf(path("tree"));
        for (const char* number : {"", " 2", " 3"}) folder("target/" + name + number);
        TesselProgress progress;
        {
            const sys::FaultInjection faults(onAnotherDevice());
            ASSERT_EQ(*reparent(url(subject), url("target"), std::nullopt, Bouncing::isAllowed, progress),
                      url("target/" + name + " 4"));
        }
        const auto counts = progress.counts();
        EXPECT_EQ(counts.completedBytes, counts.totalBytes);
        EXPECT_EQ(counts.completedItems, counts.totalItems);
        if (isFolder) {
            EXPECT_EQ(snapshotOf(path("target/tree 4")), source);
        }
        EXPECT_FALSE(fs::exists(path(subject)));
        EXPECT_THAT(leftovers(), IsEmpty());
        fs::remove_all(path("tree"));
    }
}

// When the power fails, the copy is where it belongs before the source is gone.
TEST_F(FileOperationsTest, aMoveToAnotherDeviceLastsBeforeTheSourceGoes) {
    makeTree(path("tree"));
    const TreeSnapshot before = snapshot();
    auto other = onAnotherDevice();
    std::vector<std::string> calls;
    {
        const sys::FaultInjection faults([&](const char* call) {
            const std::string_view made(call);
            if (made == "renameat2" || made == "syncfs") calls.emplace_back(made);
            return other(call);
        });
        ASSERT_EQ(errorOf(reparent(url("tree"), url("target"), std::nullopt, Bouncing::isRefused, progress_)), "");
    }
    // The attempt; the copy's data, its place, its name; the source, and what is no longer kept.
    EXPECT_THAT(calls, ::testing::ElementsAre("renameat2", "syncfs", "renameat2", "syncfs", "renameat2", "renameat2"));
    ASSERT_EQ(errorOf(reparent(url("target/tree"), url(""), std::nullopt, Bouncing::isRefused, progress_)), "");
    ASSERT_EQ(snapshot(), before);
    // A disk that can't promise it keeps the source.
    other = onAnotherDevice();
    const sys::FaultInjection faults([&, syncs = 0](const char* call) mutable {
        return std::string_view(call) == "syncfs" && ++syncs == 2 ? EIO : other(call);
    });
    EXPECT_EQ(errorOf(reparent(url("tree"), url("target"), std::nullopt, Bouncing::isRefused, progress_)), posix(EIO));
    EXPECT_EQ(snapshot(), before);
    EXPECT_THAT(leftovers(), IsEmpty());
}

// Who saves a file while it is moved loses nothing.
TEST_F(FileOperationsTest, aSourceThatChangesWhileItIsMovedStays) {
    file("a", "before");
    int renames = 0;
    const sys::FaultInjection faults([&](const char* call) {
        if (std::string_view(call) != "renameat2") return 0;
        ++renames;
        if (renames == 1) return EXDEV;
        // After the copy was compared, before the source is taken away.
        if (renames == 3) file("a", "after");
        return 0;
    });
    EXPECT_EQ(errorOf(reparent(url("a"), url("target"), std::nullopt, Bouncing::isRefused, progress_)), posix(EIO));
    EXPECT_EQ(contentsOf(path("a")), "after");
    EXPECT_FALSE(fs::exists(path("target/a")));
    EXPECT_THAT(leftovers(), IsEmpty());
}

TEST_F(FileOperationsTest, trashNeverCopies) {
    file("a");
    const sys::FaultInjection faults(onAnotherDevice());
    EXPECT_EQ(errorOf(trash(url("a"), url("target"))), posix(EXDEV));
    EXPECT_TRUE(fs::exists(path("a")));
}

// --- File systems that lack something ------------------------------------------------------------------------------------

TEST_F(FileOperationsTest, renamesWithoutReplacingEverywhere) {
    // A file system that knows no flags of a rename.
    const auto plain = [asked = 0](const char* call) mutable {
        return std::string_view(call) == "renameat2" && ++asked == 1 ? EINVAL : 0;
    };
    file("a", "A");
    file("taken", "B");
    makeTree(path("tree"));
    const TreeSnapshot tree = snapshotOf(path("tree"));
    const auto renamed = [&](std::string_view from, const std::string& to) {
        const sys::FaultInjection faults(plain);
        return errorOf(rename(url(from), to));
    };
    EXPECT_EQ(renamed("a", "taken"), kFileExists);
    EXPECT_EQ(renamed("a", "b"), "");
    EXPECT_EQ(contentsOf(path("b")), "A");
    EXPECT_EQ(contentsOf(path("taken")), "B");
    EXPECT_FALSE(fs::exists(path("a")));
    EXPECT_EQ(renamed("tree", "taken"), kFileExists);
    EXPECT_EQ(renamed("tree", "target"), kFileExists);
    EXPECT_EQ(renamed("tree", "other"), "");
    EXPECT_EQ(snapshotOf(path("other")), tree);
    EXPECT_FALSE(fs::exists(path("tree")));
}

// The file gets its new name, and before the old one is taken away, another program saves a new file under that.
TEST_F(FileOperationsTest, whatIsSavedDuringARenameWithoutFlagsStays) {
    for (const int when : {1, 2}) {
        for (const auto& entry : fs::directory_iterator(storage_)) fs::remove_all(entry.path());
        file("a", "old");
        file("saved", "new");
        const sys::FaultInjection faults([&, renames = 0, looks = 0, isLinked = false](const char* call) mutable {
            const std::string_view made(call);
            if (made == "renameat2" && ++renames == 1) return EINVAL;
            isLinked = isLinked || made == "linkat";
            if (isLinked && made == "statx" && ++looks == when) fs::rename(path("saved"), path("a"));
            return 0;
        });
        EXPECT_EQ(errorOf(rename(url("a"), "b")), "") << when;
        EXPECT_EQ(contentsOf(path("a")), "new") << when;
        EXPECT_EQ(contentsOf(path("b")), "old") << when;
    }
}

// --- Faults --------------------------------------------------------------------------------------------------------------

// The n-th system call fails, for every n: an error leaves everything as it was, success leaves it as it should be.
TEST_F(FaultTest, everyFailingCallLeavesAllOrNothing) {
    for (const Scenario& scenario : scenarios()) {
        prepare();
        const TreeSnapshot before = snapshot();
        const auto nothing = [](const char* /*call*/) { return 0; };
        const auto device = [&] { return scenario.isOnAnotherDevice ? onAnotherDevice() : sys::FaultSource(nothing); };
        {
            const sys::FaultInjection faults(device());
            (void)scenario.run();
        }
        const TreeSnapshot after = snapshot();
        for (const int reason : {ENOSPC, EIO, EACCES, EINTR, ENOENT}) {
            bool isReached = true;
            for (int n = 1; isReached; ++n) {
                prepare();
                int calls = 0;
                std::string failed;
                Result<void> result;
                {
                    auto underlying = device();
                    const sys::FaultInjection faults([&](const char* call) {
                        if (++calls != n) return underlying(call);
                        failed = call;
                        return reason;
                    });
                    result = scenario.run();
                }
                isReached = calls >= n;
                const std::string what = std::string(scenario.name) + ": " + failed + " (" + std::to_string(n) +
                                         ") fails with " + std::to_string(reason);
                ASSERT_EQ(snapshot(), result.ok() ? after : before) << what;
                if (reason == EINTR && after != before) {
                    ASSERT_TRUE(result.ok()) << what << errorOf(result);
                }
                removeAbandoned();
                ASSERT_THAT(leftovers(), IsEmpty()) << what;
            }
        }
    }
}

// The process is killed before the n-th system call, for every n.
TEST_F(FaultTest, everyKillLeavesAllOrNothing) {
    for (const Scenario& scenario : scenarios()) {
        prepare();
        const TreeSnapshot before = snapshot();
        const auto device = [&] {
            return scenario.isOnAnotherDevice ? onAnotherDevice() : sys::FaultSource([](const char*) { return 0; });
        };
        {
            const sys::FaultInjection faults(device());
            (void)scenario.run();
        }
        const TreeSnapshot after = snapshot();
        TreeSnapshot both = before;
        both.insert(after.begin(), after.end());
        bool isReached = true;
        for (int n = 1; isReached; ++n) {
            prepare();
            const pid_t child = ::fork();
            if (child == 0) {
                int calls = 0;
                auto underlying = device();
                const sys::FaultInjection faults([&](const char* call) {
                    if (++calls == n) ::kill(::getpid(), SIGKILL);
                    return underlying(call);
                });
                (void)scenario.run();
                ::_exit(0);
            }
            int status = 0;
            ASSERT_EQ(::waitpid(child, &status, 0), child);
            isReached = WIFSIGNALED(status);
            removeAbandoned();
            const TreeSnapshot found = snapshot();
            const bool isAllowed = found == before || found == after || (scenario.isOnAnotherDevice && found == both);
            ASSERT_TRUE(isAllowed) << scenario.name << " killed at " << n << ": " << ::testing::PrintToString(found);
            std::vector<std::string> left = leftovers();
            // What was taken away to be looked at once more is kept for people.
            std::erase_if(left, [&](auto& name) { return scenario.keeps && name.starts_with("kept-"); });
            ASSERT_THAT(left, IsEmpty()) << scenario.name << " killed at " << n;
        }
    }
}

// Another program puts its file in the place of what is deleted, and then the process is killed.
TEST_F(FaultTest, aKillNeverLosesWhatWasSwappedIn) {
    bool isReached = true;
    for (int n = 1; isReached; ++n) {
        prepare();
        file("swapped", "not meant");
        const MeantFile meant(url("a.txt"), identityOf("a.txt"));
        const pid_t child = ::fork();
        if (child == 0) {
            const sys::FaultInjection faults([&, calls = 0, isSwapped = false](const char* call) mutable {
                // At the last moment: after the last look, before the rename that takes it out of sight.
                if (std::string_view(call) == "renameat2" && !std::exchange(isSwapped, true))
                    fs::rename(path("swapped"), path("a.txt"));
                if (++calls == n) ::kill(::getpid(), SIGKILL);
                return 0;
            });
            TesselProgress progress;
            (void)remove(meant, progress, Certainty::isWanted);
            ::_exit(0);
        }
        int status = 0;
        ASSERT_EQ(::waitpid(child, &status, 0), child);
        isReached = WIFSIGNALED(status);
        removeAbandoned();
        int found = 0;
        for (const auto& entry : fs::recursive_directory_iterator(storage_))
            found += entry.is_regular_file() && contentsOf(entry.path()) == "not meant" ? 1 : 0;
        ASSERT_EQ(found, 1) << n;
    }
}

// A person's own folders that may not be written, or not even be read by their owner, are no reason to leave them there.
TEST_F(FileOperationsTest, whatIsLeftBehindGoesWhateverItsModes) {
    const std::string left = ".TemporaryLocalFolder/.staging-1-1/item";
    file(left + "/written/a");
    file(left + "/locked/deeper/b");
    file(left + "/hidden/c");
    for (const std::string name : {"/locked/deeper", "/locked"}) ::chmod(path(left + name).c_str(), 0555);
    ::chmod(path(left + "/hidden").c_str(), 0);
    ::chmod(path(left).c_str(), 0500);
    OrdinaryPerson::giveTo(folder_.path());
    const test::LogCapture log;
    {
        const OrdinaryPerson person;
        StagingFolder::removeAbandoned(*RootDirectories::shared().rootHolding(storage_));
    }
    EXPECT_THAT(leftovers(), IsEmpty());
    EXPECT_EQ(log.count("[ERROR]"), 0U);
}

TEST_F(FileOperationsTest, anImportOfLockedFoldersThatFailsLeavesNothing) {
    makeTree(outside("source"));
    ::chmod(outside("source/sub").c_str(), 0555);
    ::chmod(outside("source").c_str(), 0555);
    folder("target/source");
    OrdinaryPerson::giveTo(folder_.path());
    {
        const OrdinaryPerson person;
        EXPECT_EQ(errorOf(importUnderFolder(urlOf(outside("source")), url("target"), progress_)), kFileExists);
        EXPECT_THAT(leftovers(), IsEmpty());
    }
    ::chmod(outside("source").c_str(), 0755);
    ::chmod(outside("source/sub").c_str(), 0755);
}

// What was built in the temporary folder is to get its place, and its mode is nobody's wish to keep it there.
TEST_F(FileOperationsTest, aFolderThatMayNotBeWrittenLeavesTheTemporaryFolder) {
    file(".TemporaryLocalFolder/mine/locked/a");
    file("target/locked/a");
    for (const char* name : {".TemporaryLocalFolder/mine/locked", "target/locked"}) ::chmod(path(name).c_str(), 0555);
    OrdinaryPerson::giveTo(folder_.path());
    const auto move = [&](const char* name) {
        const OrdinaryPerson person;
        return errorOf(reparent(url(name), url(""), "moved", Bouncing::isRefused, progress_));
    };
    const auto modeOf = [&](const char* name) {
        struct stat status {};
        return ::stat(path(name).c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
    };
    EXPECT_EQ(move("target/locked"), posix(EACCES));
    EXPECT_EQ(modeOf("target/locked"), 0555U);
    folder("moved");
    EXPECT_EQ(move(".TemporaryLocalFolder/mine/locked"), kFileExists);
    EXPECT_EQ(modeOf(".TemporaryLocalFolder/mine/locked"), 0555U);
    fs::remove(path("moved"));
    EXPECT_EQ(move(".TemporaryLocalFolder/mine/locked"), "");
    EXPECT_EQ(modeOf("moved"), 0555U);
}

TEST_F(FileOperationsTest, aMissingTemporaryFolderIsNamed) {
    makeTree(outside("source"));
    file("target/full/a");
    OrdinaryPerson::giveTo(folder_.path());
    ::chmod(storage_.c_str(), 0555);
    const OrdinaryPerson person;
    const auto imported = importUnderFolder(urlOf(outside("source")), url("target"), progress_);
    EXPECT_EQ(errorOf(imported), posix(EACCES));
    EXPECT_EQ(imported.error().userInfo().at("path"), path(".TemporaryLocalFolder"));
    const auto removed = remove(url("target/full"), progress_);
    EXPECT_EQ(errorOf(removed), posix(EACCES));
    EXPECT_EQ(removed.error().userInfo().at("path"), path(".TemporaryLocalFolder"));
    // A file needs none.
    EXPECT_EQ(errorOf(importUnderFolder(urlOf(outside("source/file")), url("target"), progress_)), "");
    EXPECT_EQ(errorOf(remove(url("target/full/a"), progress_)), "");
    ::chmod(storage_.c_str(), 0755);
}

TEST_F(FileOperationsTest, whatIsLeftByAProcessThatLivesIsNotCleared) {
    const auto root = RootDirectories::shared().rootHolding(storage_);
    auto staging = StagingFolder::make(root);
    ASSERT_TRUE(staging.ok());
    StagingFolder::removeAbandoned(*root);
    EXPECT_THAT(leftovers(), ::testing::SizeIs(1));
    staging->reset();
    EXPECT_THAT(leftovers(), IsEmpty());
    folder(".TemporaryLocalFolder/.staging-1-1/item/deep");
    file(".TemporaryLocalFolder/mine");
    StagingFolder::removeAbandoned(*root);
    EXPECT_THAT(leftovers(), ::testing::ElementsAre("mine"));
}

// --- Races ---------------------------------------------------------------------------------------------------------------

// Two that create, rename and move onto the same names: nothing is overwritten, every file is somewhere.
TEST_F(FileOperationsTest, twoThatWantTheSameNamesOverwriteNothing) {
    constexpr int kRounds = 25'000;
    constexpr int kNames = 4;
    folder("here");
    std::array<std::atomic<int>, 2> made{};
    const auto work = [&](int who) {
        unsigned random = 12345U + static_cast<unsigned>(who);
        const auto next = [&](unsigned below) {
            return (random = random * 1'103'515'245U + 12'345U) / 65'536U % below;
        };
        const auto name = [&] { return "n" + std::to_string(next(kNames)); };
        for (int i = 0; i < kRounds; ++i) {
            TesselProgress progress;
            const KsURL from = next(2) == 0 ? url("here") : url("target");
            switch (next(4)) {
                case 0: {
                    // An empty one, which a rename that replaces takes over without a word: it would be missed.
                    const auto folder = createSubFolder(from, name());
                    made[who] += folder.ok() ? 1 : 0;
                    break;
                }
                case 1: (void)rename(from.appendingPathComponent(name()), name()); break;
                case 2:
                    (void)reparent(from.appendingPathComponent(name()), url(next(2) == 0 ? "here" : "target"), name(),
                                   Bouncing::isRefused, progress);
                    break;
                default:
                    (void)reparent(from.appendingPathComponent(name()), url(next(2) == 0 ? "here" : "target"),
                                   std::nullopt, Bouncing::isRefused, progress);
                    break;
            }
        }
    };
    std::thread other(work, 1);
    work(0);
    other.join();
    // Nothing was ever deleted: as many are there as were made.
    int found = 0;
    for (auto walk = fs::recursive_directory_iterator(storage_); walk != fs::recursive_directory_iterator(); ++walk) {
        const std::string name = walk->path().filename();
        found += name.starts_with('n') ? 1 : 0;
    }
    EXPECT_EQ(found, made[0] + made[1]);
    EXPECT_GT(found, 0);
}

// At the very call that deletes a file, another edit is asked to move it away and to put something else in its place.
TEST_F(FaultTest, editsOfOneProcessKeepOutOfEachOthersWay) {
    for (int round = 0; round < 20; ++round) {
        for (const auto& entry : fs::directory_iterator(storage_)) fs::remove_all(entry.path());
        file("a", "meant");
        file("x", "not meant");
        const MeantFile meant(url("a"), identityOf("a"));
        std::optional<std::thread> other;
        std::atomic<bool> isOver = false;
        const sys::FaultInjection faults([&](const char* call) {
            if (std::string_view(call) != "unlinkat" || other) return 0;
            other.emplace([&] {
                (void)rename(url("a"), "b");
                (void)rename(url("x"), "a");
                isOver = true;
            });
            // As long as the other would need, had it not to wait.
            for (int i = 0; i < 20'000 && !isOver; ++i) std::this_thread::yield();
            return 0;
        });
        TesselProgress progress;
        EXPECT_EQ(errorOf(remove(meant, progress)), "");
        ASSERT_TRUE(other.has_value());
        other->join();
        ASSERT_EQ(contentsOf(path("a")), "not meant");
        ASSERT_FALSE(fs::exists(path("b")));
    }
}

// Somebody swaps a folder for a link to elsewhere, and back, all the time.
TEST_F(FileOperationsTest, noSwappedFolderLeadsOutside) {
    const test::TemporaryFolder elsewhere;
    elsewhere.file("victim/a", "untouched");
    elsewhere.folder("victim/sub");
    const TreeSnapshot before = snapshotOf(elsewhere.path());
    folder("door");
    file("door/a", "bait");
    fs::create_directory_symlink(elsewhere / "victim", path("link"));
    std::atomic<bool> isOver = false;
    std::thread swapper([&] {
        while (!isOver) {
            ::renameat2(AT_FDCWD, path("door").c_str(), AT_FDCWD, path("link").c_str(), RENAME_EXCHANGE);
        }
    });
    for (int i = 0; i < 3000; ++i) {
        TesselProgress progress;
        (void)createSubFolder(url("door"), "new" + std::to_string(i));
        (void)rename(url("door/a"), "b");
        (void)rename(url("door/b"), "a");
        (void)reparent(url("door/a"), url("target"), std::nullopt, Bouncing::isRefused, progress);
        (void)reparent(url("target/a"), url("door"), std::nullopt, Bouncing::isRefused, progress);
        (void)remove(url("door/sub"), progress);
        (void)remove(url("door/new" + std::to_string(i)), progress);
        (void)importUnderFolder(url("target/taken"), url("door"), progress);
        (void)makeFolderUnlessThere(url("door/.Trash"));
        (void)trash(url("door/a"), url("door/.Trash"));
        (void)reparent(url("door/.Trash/a"), url("door"), std::nullopt, Bouncing::isRefused, progress);
    }
    isOver = true;
    swapper.join();
    EXPECT_EQ(snapshotOf(elsewhere.path()), before);
}

// A folder of the tree that is deleted is swapped for a link meanwhile.
TEST_F(FileOperationsTest, aDeletionFollowsNothingThatIsSwapped) {
    const test::TemporaryFolder elsewhere;
    elsewhere.file("victim/a", "untouched");
    const TreeSnapshot before = snapshotOf(elsewhere.path());
    for (int at = 1; at < 60; ++at) {
        makeTree(path("tree"));
        fs::create_directory_symlink(elsewhere / "victim", path("tree/sub/out"));
        const int folder = ::open(path("tree").c_str(), O_PATH | O_DIRECTORY);
        int calls = 0;
        {
            // By descriptor, as somebody who had the folder open can go on wherever it is moved to.
            const sys::FaultInjection faults([&](const char* /*call*/) {
                if (++calls == at) {
                    ::renameat2(folder, "sub", folder, "was", 0);
                    ::symlinkat((elsewhere / "victim").c_str(), folder, "sub");
                }
                return 0;
            });
            (void)remove(url("tree"), progress_);
        }
        ::close(folder);
        ASSERT_EQ(snapshotOf(elsewhere.path()), before) << at;
        fs::remove_all(path("tree"));
        StagingFolder::removeAbandoned(*RootDirectories::shared().rootHolding(storage_));
        ASSERT_THAT(leftovers(), IsEmpty());
    }
}

// --- Completions -----------------------------------------------------------------------------------------------------------

TEST_F(FileOperationsTest, eachAnswersOnce) {
    file("a");
    file("b");
    folder("c");
    DispatchSemaphore answered(0);
    std::atomic<int> answers = 0;
    std::atomic<int> errors = 0;
    const FileOperationCompletion completion = [&](const Result<KsURL>& result) {
        ++answers;
        errors += result.ok() ? 0 : 1;
        answered.signal();
    };
    ts_createSubFolder(url("target"), "new", completion);
    ts_renameWithNewName(url("a"), "z", completion);
    ts_reparentUnderFolder(url("b"), url("target"), std::nullopt, completion);
    ts_reparentUnderFolder(url("c"), url("target"), Bouncing::isAllowed, completion);
    ts_importUnderFolder(urlOf(outside("none")), url("target"), completion);
    ts_trashUnderFolder(url("none"), url("target"), completion);
    for (int i = 0; i < 6; ++i) answered.wait();
    EXPECT_EQ(answers, 6);
    EXPECT_EQ(errors, 2);
    std::optional<KsError> failed;
    ts_deleteWithCompletionHandler(url("target"), [&](const std::optional<KsError>& error) {
        failed = error;
        answered.signal();
    });
    answered.wait();
    EXPECT_EQ(failed, std::nullopt);
    EXPECT_FALSE(fs::exists(path("target")));
}

TEST_F(FileOperationsTest, attributesCanBeSetOfWhatCannotBeOpened) {
    file("a");
    ::chmod(path("a").c_str(), 0200);
    OrdinaryPerson::giveTo(folder_.path());
    const OrdinaryPerson person;
    const auto set = [&](const KsURL& at) {
        return ts_withReadWriteAccess(
            at, [](int fd) { return sys::fsetxattr(fd, "user.x", bytesOf(std::string_view("value"))); });
    };
    EXPECT_EQ(errorOf(set(url("a"))), "");
    ::chmod(path("a").c_str(), 0600);
    EXPECT_EQ(attribute(path("a"), "user.x"), "value");
    ::chmod(path("a").c_str(), 0400);
    EXPECT_EQ(errorOf(set(url("a"))), posix(EACCES));
    EXPECT_EQ(errorOf(set(url("none"))), kNoSuchFile);
    ASSERT_EQ(::mkfifo(path("fifo").c_str(), 0600), 0);
    EXPECT_EQ(errorOf(set(url("fifo"))), posix(EPERM));
}

}  // namespace
}  // namespace cindral
