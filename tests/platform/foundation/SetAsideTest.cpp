#include "platform/foundation/SetAside.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <fstream>

#include "support/TemporaryFolder.h"

namespace cindral::test {
namespace {

namespace fs = std::filesystem;

class SetAsideTest : public ::testing::Test {
protected:
    std::string path(const std::string& name) const { return folder_.path() + "/" + name; }
    void file(const std::string& name) const { std::ofstream(path(name)) << name; }
    bool isSetAside(const std::string& name, ExpectedKind kind) const {
        const auto aside = setAsideUnless(path(name), kind);
        EXPECT_TRUE(aside.ok());
        if (!aside.ok() || !*aside) return false;
        EXPECT_TRUE((*aside)->starts_with(path(name) + ".set-aside-")) << **aside;
        EXPECT_FALSE(fs::exists(fs::symlink_status(path(name))));
        EXPECT_TRUE(fs::exists(fs::symlink_status(**aside)));
        return true;
    }
    const TemporaryFolder folder_;
};

TEST_F(SetAsideTest, findsANameOfItsOwnEachTime) {
    file("a");
    const auto first = setAside(path("a"));
    file("a");
    const auto second = setAside(path("a"));
    ASSERT_TRUE(first.ok() && second.ok());
    EXPECT_NE(*first, *second);
    EXPECT_TRUE(fs::exists(*first) && fs::exists(*second));
    const auto none = setAside(path("a"));
    ASSERT_FALSE(none.ok());
    EXPECT_TRUE(none.error().isPosix(ENOENT));
}

TEST_F(SetAsideTest, leavesAloneWhatIsExpected) {
    file("file");
    fs::create_directory(path("folder"));
    fs::create_directory_symlink(path("folder"), path("link"));
    EXPECT_FALSE(isSetAside("file", ExpectedKind::file));
    EXPECT_FALSE(isSetAside("folder", ExpectedKind::folder));
    EXPECT_FALSE(isSetAside("link", ExpectedKind::folder));
    EXPECT_FALSE(isSetAside("missing", ExpectedKind::file));
    EXPECT_FALSE(isSetAside("file/below", ExpectedKind::folder));
}

TEST_F(SetAsideTest, takesWhatIsOfAnotherKindAway) {
    file("file");
    EXPECT_TRUE(isSetAside("file", ExpectedKind::folder));
    fs::create_directory(path("folder"));
    file("folder/inside");
    EXPECT_TRUE(isSetAside("folder", ExpectedKind::file));
    file("target");
    fs::create_symlink(path("target"), path("link"));
    EXPECT_TRUE(isSetAside("link", ExpectedKind::file));
    fs::create_symlink(path("nowhere"), path("dangling"));
    EXPECT_TRUE(isSetAside("dangling", ExpectedKind::folder));
    ASSERT_EQ(::mkfifo(path("fifo").c_str(), 0600), 0);
    EXPECT_TRUE(isSetAside("fifo", ExpectedKind::file));
    EXPECT_TRUE(fs::exists(path("target"))) << "a link's target stays where it is";
}

}  // namespace
}  // namespace cindral::test
