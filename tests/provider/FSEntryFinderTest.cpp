#include "provider/fs/FSEntryFinder.h"

#include <sys/stat.h>
#include <unistd.h>

#include "provider/ProviderFixture.h"

namespace cindral::test {
namespace {

using Standing = FSFoundEntry::Standing;

class FSEntryFinderTest : public ProviderTest {
protected:
    Standing standing(std::string_view name) {
        const auto found = finder_.find(storage_ / name);
        EXPECT_TRUE(found.ok());
        EXPECT_EQ(found->standing == Standing::reached, found->url.has_value());
        return found->standing;
    }
    FSEntryFinder finder_{{storageURL()}};
};

TEST_F(FSEntryFinderTest, reachesWhatADeepListingReaches) {
    storage_.file("a.txt");
    storage_.file("folder/inner/b.txt");
    storage_.file("report.folio/index");
    storage_.file(".Trash/old.txt");
    for (const char* name :
         {"a.txt", "folder", "folder/inner", "folder/inner/b.txt", "report.folio", ".Trash", ".Trash/old.txt"}) {
        EXPECT_EQ(standing(name), Standing::reached) << name;
    }
    EXPECT_EQ(standing("report.folio/index"), Standing::outside);
    EXPECT_EQ(standing("folder/none"), Standing::missing);
    EXPECT_EQ(standing("none/none"), Standing::missing);
    EXPECT_EQ(standing("a.txt/none"), Standing::missing);
}

TEST_F(FSEntryFinderTest, answersTheEntryOfItsOpenFolder) {
    storage_.file("folder/a.txt", "hello");
    const auto found = finder_.find(storage_ / "folder/a.txt");
    ASSERT_TRUE(found.ok() && found->url);
    EXPECT_EQ(*found->url, url("folder/a.txt"));
    ASSERT_TRUE(found->url->directory());
    EXPECT_EQ(found->url->directory()->path, storage_ / "folder");
    EXPECT_EQ(found->url->status()->size, 5U);
}

TEST_F(FSEntryFinderTest, knowsNothingAboveItsDirectories) {
    storage_.outside().file("beside.txt");
    EXPECT_EQ(finder_.find(storage_.outside() / "beside.txt")->standing, Standing::missing);
    EXPECT_EQ(finder_.find(storage_.path())->standing, Standing::missing);
    EXPECT_EQ(finder_.find(storage_.path() + "extra/a.txt")->standing, Standing::missing);
}

TEST_F(FSEntryFinderTest, neverGoesByALink) {
    storage_.file("folder/a.txt");
    ASSERT_EQ(::symlink("folder", (storage_ / "link").c_str()), 0);
    EXPECT_EQ(standing("link"), Standing::reached);
    EXPECT_EQ(standing("link/a.txt"), Standing::missing);
}

TEST_F(FSEntryFinderTest, comesNowhereBelowAFolderThatCannotBeRead) {
    storage_.file("secret/inner/a.txt");
    ASSERT_EQ(::chmod((storage_ / "secret").c_str(), 0311), 0);
    ASSERT_EQ(::chmod(storage_.outside().path().c_str(), 0755), 0);
    const bool isRoot = ::geteuid() == 0;
    if (isRoot) {
        ASSERT_EQ(::seteuid(65534), 0);
    }
    EXPECT_EQ(standing("secret"), Standing::reached);
    EXPECT_EQ(standing("secret/inner"), Standing::outside);
    EXPECT_EQ(standing("secret/inner/a.txt"), Standing::outside);
    if (isRoot) {
        ASSERT_EQ(::seteuid(0), 0);
    }
    ::chmod((storage_ / "secret").c_str(), 0700);
}

TEST_F(FSEntryFinderTest, looksAnewAfterForgetting) {
    storage_.file("folder/a.txt");
    EXPECT_EQ(standing("folder/a.txt"), Standing::reached);
    ASSERT_EQ(::rename((storage_ / "folder").c_str(), (storage_ / "moved").c_str()), 0);
    finder_.forget();
    EXPECT_EQ(standing("folder/a.txt"), Standing::missing);
    EXPECT_EQ(standing("moved/a.txt"), Standing::reached);
}

TEST_F(FSEntryFinderTest, findsEntriesOfDeepAndOfManyFolders) {
    std::string deep = "d";
    for (int i = 0; i < 200; ++i) deep += "/d";
    storage_.file(deep + "/a.txt");
    EXPECT_EQ(standing(deep + "/a.txt"), Standing::reached);
    EXPECT_EQ(standing(deep + "/b.txt"), Standing::missing);
    for (int i = 0; i < 300; ++i) storage_.file("f" + std::to_string(i) + "/a.txt");
    for (int i = 0; i < 300; ++i) EXPECT_EQ(standing("f" + std::to_string(i) + "/a.txt"), Standing::reached);
}

TEST_F(FSEntryFinderTest, takesTheInnermostOfItsDirectories) {
    storage_.file("report.folio/inner/a.txt");
    FSEntryFinder finder({storageURL(), url("report.folio")});
    EXPECT_EQ(finder.find(storage_ / "report.folio/inner/a.txt")->standing, Standing::reached);
}

TEST(PathsTest, areBelowByWholeComponents) {
    EXPECT_TRUE(isAtOrBelow("/a/b", "/a/b"));
    EXPECT_TRUE(isAtOrBelow("/a/b/c", "/a/b"));
    EXPECT_TRUE(isAtOrBelow("/a", "/"));
    EXPECT_FALSE(isAtOrBelow("/a/bc", "/a/b"));
    EXPECT_FALSE(isAtOrBelow("/a", "/a/b"));
    EXPECT_TRUE(isAtOrBelow("/var/a/b", "/private/var/a"));
    EXPECT_TRUE(isAtOrBelow("/private/var/a/b", "/var/a"));
}

}  // namespace
}  // namespace cindral::test
