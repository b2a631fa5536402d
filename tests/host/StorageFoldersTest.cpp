#include "host/StorageFolders.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>

#include "host/HostError.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using ::testing::HasSubstr;
namespace fs = std::filesystem;

class StorageFoldersTest : public ::testing::Test {
protected:
    mode_t modeOf(const std::string& path) const {
        struct stat status {};
        EXPECT_EQ(::lstat(path.c_str(), &status), 0) << path;
        return status.st_mode & 07777;
    }
    PresentedPaths present(const std::string& real, const std::string& state) const {
        auto paths = storage_folders::present(real, real, state, environment_);
        if (!paths.ok()) {
            ADD_FAILURE() << paths.error().reason();
            return {"", "", ""};
        }
        return *std::move(paths);
    }
    std::string failure(const Result<PresentedPaths>& paths) const { return paths.ok() ? "" : paths.error().reason(); }

    const test::TemporaryFolder folder_;
    const std::string root_ = fs::canonical(folder_.path()).string();
    HostEnvironment environment_;
};

TEST_F(StorageFoldersTest, keepsStateAndStorageApart) {
    const auto status = [](const std::string& storage, const std::string& state) {
        const auto checked = storage_folders::checkApart(storage, state);
        return checked.ok() ? 0 : exitStatusOf(checked.error());
    };
    EXPECT_EQ(status(root_ + "/docs", root_ + "/state"), 0);
    EXPECT_EQ(status(root_ + "/docs", root_ + "/docs2"), 0);
    EXPECT_EQ(status(root_ + "/docs", root_), 0);
    EXPECT_EQ(status(root_ + "/docs", root_ + "/docs"), 2);
    EXPECT_EQ(status(root_ + "/docs", root_ + "/docs/.state"), 2);
    EXPECT_EQ(status(root_ + "/docs", root_ + "/other/../docs/.state"), 2);
    EXPECT_EQ(status("/", root_ + "/state"), 2);
    fs::create_directory(root_ + "/docs");
    fs::create_symlink("docs", root_ + "/link");
    EXPECT_EQ(status(root_ + "/docs", root_ + "/link/.state"), 2);
    EXPECT_EQ(status(root_ + "/link", root_ + "/docs/.state"), 2);
    EXPECT_FALSE(fs::exists(root_ + "/docs/.state"));
}

TEST_F(StorageFoldersTest, makesTheStorageAndWhatLeadsToIt) {
    const auto made = storage_folders::makeStorage(root_ + "/a/b/Documents");
    ASSERT_TRUE(made.ok());
    EXPECT_EQ(*made, root_ + "/a/b/Documents");
    EXPECT_TRUE(fs::is_directory(*made));
    EXPECT_TRUE(storage_folders::makeStorage(root_ + "/a/b/Documents").ok());
}

TEST_F(StorageFoldersTest, answersTheRealPathOfALinkedStorage) {
    fs::create_directory(root_ + "/data");
    fs::create_symlink("data", root_ + "/Documents");
    EXPECT_EQ(*storage_folders::makeStorage(root_ + "/Documents"), root_ + "/data");
}

TEST_F(StorageFoldersTest, refusesAStorageThatIsAFile) {
    folder_.file("file");
    EXPECT_THAT(storage_folders::makeStorage(root_ + "/file").error().reason(), HasSubstr("Not a directory"));
    EXPECT_THAT(storage_folders::makeStorage(root_ + "/file/below").error().reason(), HasSubstr("Not a directory"));
    fs::create_symlink("nowhere", root_ + "/dangling");
    EXPECT_THAT(storage_folders::makeStorage(root_ + "/dangling").error().reason(), HasSubstr("No such file"));
}

TEST_F(StorageFoldersTest, makesTheStateForItsOwnerAlone) {
    const mode_t old = ::umask(0);
    const auto made = storage_folders::makeState(root_ + "/x/state");
    ::umask(old);
    ASSERT_TRUE(made.ok());
    EXPECT_EQ(modeOf(root_ + "/x/state"), 0700U);
    EXPECT_EQ(modeOf(root_ + "/x"), 0700U);
}

TEST_F(StorageFoldersTest, refusesAStateThatAnybodyMayWriteTo) {
    fs::create_directory(root_ + "/open");
    ASSERT_EQ(::chmod((root_ + "/open").c_str(), 0777), 0);
    EXPECT_THAT(storage_folders::makeState(root_ + "/open").error().reason(), HasSubstr("by anybody"));
}

TEST_F(StorageFoldersTest, presentsAPresentableStorageAsItIs) {
    const std::string real = folder_.folder("Documents");
    const PresentedPaths paths = present(root_ + "/Documents", folder_.folder("state"));
    EXPECT_TRUE(paths.isSame());
    EXPECT_FALSE(fs::is_symlink(folder_ / "state/Documents"));
}

TEST_F(StorageFoldersTest, presentsAnyOtherThroughALinkInTheState) {
    folder_.folder("state");
    const std::string real = folder_.folder("Dokumente");
    const PresentedPaths paths = present(real, root_ + "/state");
    EXPECT_EQ(paths.presented(), root_ + "/state/Documents");
    EXPECT_EQ(fs::read_symlink(paths.presented()).string(), real);
}

TEST_F(StorageFoldersTest, pointsTheLinkToAnotherStorage) {
    folder_.folder("state");
    present(folder_.folder("one"), root_ + "/state");
    const PresentedPaths paths = present(folder_.folder("two"), root_ + "/state");
    EXPECT_EQ(fs::read_symlink(paths.presented()).string(), folder_ / "two");
    // Nothing is left over from the replacement.
    EXPECT_EQ(std::distance(fs::directory_iterator(root_ + "/state"), {}), 1);
}

TEST_F(StorageFoldersTest, survivesALinkThatWasLeftHalfMade) {
    folder_.folder("state");
    fs::create_symlink("gone", root_ + "/state/Documents.new");
    const PresentedPaths paths = present(folder_.folder("one"), root_ + "/state");
    EXPECT_EQ(fs::read_symlink(paths.presented()).string(), folder_ / "one");
}

TEST_F(StorageFoldersTest, neverReplacesWhatIsNoLink) {
    folder_.file("state/Documents/mine.txt");
    const auto paths = storage_folders::present("", folder_.folder("one"), root_ + "/state", environment_);
    EXPECT_THAT(failure(paths), HasSubstr("in the way"));
    EXPECT_TRUE(fs::exists(root_ + "/state/Documents/mine.txt"));
}

TEST_F(StorageFoldersTest, presentsInTheRuntimeFolderWhereTheStatesPathHasTheName) {
    const std::string state = folder_.folder("Documents/state");
    environment_.runtimeFolder = folder_.folder("run");
    const PresentedPaths paths = present(folder_.folder("one"), state);
    EXPECT_TRUE(paths.presented().starts_with(folder_ / "run/cindral-")) << paths.presented();
    EXPECT_TRUE(PresentedPaths::isPresentable(paths.presented()));
    EXPECT_EQ(modeOf(fs::path(paths.presented()).parent_path().string()), 0700U);
    // The same place the next time.
    EXPECT_EQ(present(folder_.folder("one"), state).presented(), paths.presented());
}

TEST_F(StorageFoldersTest, presentsInTheTemporaryFolderWhereThereIsNoRuntimeFolder) {
    const std::string state = folder_.folder("Documents/state");
    const PresentedPaths paths = present(folder_.folder("one"), state);
    EXPECT_TRUE(paths.presented().starts_with("/tmp/cindral-")) << paths.presented();
    const fs::path folder = fs::path(paths.presented()).parent_path();
    EXPECT_EQ(modeOf(folder.string()), 0700U);

    // Somebody else may have made a folder of the name first.
    ASSERT_EQ(::chmod(folder.c_str(), 0755), 0);
    EXPECT_THAT(failure(storage_folders::present("", folder_ / "one", state, environment_)),
                HasSubstr("not permitted"));
    fs::remove_all(folder);
    fs::create_directory_symlink(folder_.folder("elsewhere"), folder);
    EXPECT_THAT(failure(storage_folders::present("", folder_ / "one", state, environment_)),
                HasSubstr("not permitted"));
    fs::remove(folder);
}

}  // namespace
}  // namespace cindral
