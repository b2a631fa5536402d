#include "host/PresentedPaths.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

/// A storage "data/My Files" that was named through a link "short", and is presented as "state/Documents".
class PresentedPathsTest : public ::testing::Test {
protected:
    PresentedPathsTest() {
        folder_.file("data/My Files/a/report.txt");
        folder_.file("data/other.txt");
        folder_.folder("state");
        std::filesystem::create_symlink("data", folder_ / "way");
        std::filesystem::create_symlink("data/My Files", folder_ / "short");
        std::filesystem::create_symlink(real_, presented_);
        std::filesystem::create_symlink("report.txt", real_ + "/a/link");
        std::filesystem::create_symlink("a", real_ + "/b");
    }

    std::string presented(const std::string& path) const { return paths_.presentedPath(path); }

    const test::TemporaryFolder folder_;
    const std::string root_ = std::filesystem::canonical(folder_.path()).string();
    const std::string real_ = root_ + "/data/My Files";
    const std::string presented_ = root_ + "/state/Documents";
    const PresentedPaths paths_{folder_ / "short", real_, presented_};
};

TEST_F(PresentedPathsTest, presentsWhatIsBelowTheRealPath) {
    EXPECT_EQ(presented(real_ + "/a/report.txt"), presented_ + "/a/report.txt");
    EXPECT_EQ(presented(real_), presented_);
    EXPECT_EQ(presented(real_ + "/"), presented_);
}

TEST_F(PresentedPathsTest, presentsWhatIsBelowThePathAsGiven) {
    EXPECT_EQ(presented(folder_ / "short/a/report.txt"), presented_ + "/a/report.txt");
    EXPECT_EQ(presented(folder_ / "short"), presented_);
}

TEST_F(PresentedPathsTest, presentsWhatIsBelowThePresentedPath) {
    EXPECT_EQ(presented(presented_ + "/a/report.txt"), presented_ + "/a/report.txt");
    EXPECT_EQ(presented(presented_), presented_);
}

TEST_F(PresentedPathsTest, presentsWhatIsReachedThroughAnyLinkedFolder) {
    EXPECT_EQ(presented(folder_ / "way/My Files/a/report.txt"), presented_ + "/a/report.txt");
    EXPECT_EQ(presented(real_ + "/b/report.txt"), presented_ + "/a/report.txt");
    EXPECT_EQ(presented(folder_ / "way/My Files/b/../a/report.txt"), presented_ + "/a/report.txt");
}

TEST_F(PresentedPathsTest, doesNotFollowTheLastComponent) {
    EXPECT_EQ(presented(real_ + "/a/link"), presented_ + "/a/link");
    EXPECT_EQ(presented(real_ + "/b"), presented_ + "/b");
}

TEST_F(PresentedPathsTest, presentsWhatDoesNotExist) {
    EXPECT_EQ(presented(real_ + "/a/new.txt"), presented_ + "/a/new.txt");
    EXPECT_EQ(presented(real_ + "/no/such/folder"), presented_ + "/no/such/folder");
    EXPECT_EQ(presented(folder_ / "short/no/such/folder"), presented_ + "/no/such/folder");
}

TEST_F(PresentedPathsTest, tidiesPaths) {
    EXPECT_EQ(presented(real_ + "//a/./report.txt/"), presented_ + "/a/report.txt");
    EXPECT_EQ(presented(real_ + "/a/.."), presented_);
    EXPECT_EQ(presented(real_ + "/a/../a/report.txt"), presented_ + "/a/report.txt");
}

TEST_F(PresentedPathsTest, leavesWhatIsElsewhereElsewhere) {
    EXPECT_EQ(presented(root_ + "/data/other.txt"), root_ + "/data/other.txt");
    EXPECT_EQ(presented(real_ + "2/x"), real_ + "2/x");
    EXPECT_EQ(presented(real_ + "/../other.txt"), root_ + "/data/other.txt");
    EXPECT_EQ(presented("/"), "/");
}

TEST_F(PresentedPathsTest, handsOutRealPaths) {
    EXPECT_EQ(paths_.realPath(presented_ + "/a/report.txt"), real_ + "/a/report.txt");
    EXPECT_EQ(paths_.realPath(presented_), real_);
    EXPECT_EQ(paths_.realPath(presented_ + "2"), presented_ + "2");
    EXPECT_EQ(paths_.realURL(KsURL::fileURL("/state/x y")), "file:///state/x%20y");
}

TEST_F(PresentedPathsTest, leavesURLsOfOtherKindsAlone) {
    const auto url = KsURL::parse("https://example.com/a b");
    ASSERT_TRUE(url.has_value());
    EXPECT_EQ(paths_.presentedURL(*url), *url);
    EXPECT_EQ(paths_.realURL(*url), "https://example.com/a b");
}

TEST_F(PresentedPathsTest, presentsAURLAsItsPath) {
    EXPECT_EQ(paths_.presentedURL(KsURL::fileURL(real_ + "/a")), KsURL::fileURL(presented_ + "/a"));
}

TEST(PresentedPaths, changeNothingWhereTheStorageIsPresentable) {
    const PresentedPaths same("/nowhere/Documents", "/nowhere/Documents", "/nowhere/Documents");
    EXPECT_TRUE(same.isSame());
    EXPECT_EQ(same.presentedPath("/nowhere/Documents/a"), "/nowhere/Documents/a");
    EXPECT_EQ(same.realPath("/nowhere/Documents/a"), "/nowhere/Documents/a");
}

TEST(PresentedPaths, knowWhatIsPresentable) {
    EXPECT_TRUE(PresentedPaths::isPresentable("/home/u/Documents"));
    EXPECT_TRUE(PresentedPaths::isPresentable("/Documents"));
    EXPECT_FALSE(PresentedPaths::isPresentable("/home/u/Dokumente"));
    EXPECT_FALSE(PresentedPaths::isPresentable("/home/u/documents"));
    EXPECT_FALSE(PresentedPaths::isPresentable("/home/u/Documents/Work"));
    EXPECT_FALSE(PresentedPaths::isPresentable("/home/Documents/x/Documents"));
    EXPECT_FALSE(PresentedPaths::isPresentable("/home/u/My Documents"));
    EXPECT_FALSE(PresentedPaths::isPresentable("/"));
}

TEST(PresentedPaths, tellWhatFollowsAFolder) {
    EXPECT_EQ(PresentedPaths::remainder("/a/b/c", "/a/b"), "/c");
    EXPECT_EQ(PresentedPaths::remainder("/a/b", "/a/b"), "");
    EXPECT_EQ(PresentedPaths::remainder("/a/bc", "/a/b"), std::nullopt);
    EXPECT_EQ(PresentedPaths::remainder("/a", "/a/b"), std::nullopt);
    EXPECT_EQ(PresentedPaths::remainder("/a", "/"), "/a");
}

TEST(TidyPath, takesOutWhatNamesNothing) {
    EXPECT_EQ(tidyPath("/a//b/./c/"), "/a/b/c");
    EXPECT_EQ(tidyPath("/"), "/");
    EXPECT_EQ(tidyPath("//."), "/");
    EXPECT_EQ(tidyPath("/a/../b"), "/a/../b");
}

}  // namespace
}  // namespace cindral
