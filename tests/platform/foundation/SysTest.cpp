#include "platform/foundation/Sys.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <filesystem>

#include "platform/foundation/Result.h"
#include "support/TemporaryFolder.h"

namespace cindral::test {
namespace {

class SysTest : public ::testing::Test {
protected:
    UniqueFd directory() const { return sys::openDirectoryForReading(AT_FDCWD, folder_.path().c_str()).value(); }
    TemporaryFolder folder_;
};

TEST_F(SysTest, attributesReadAlikeByNameAndByDescriptor) {
    const std::string path = folder_.file("a");
    ASSERT_EQ(::setxattr(path.c_str(), "user.one", "value", 5, 0), 0);
    const UniqueFd parent = directory();
    const UniqueFd own = sys::openat(parent.get(), "a", O_PATH | O_NOFOLLOW).value();
    for (const auto& [fd, name] : {std::pair(parent.get(), "a"), std::pair(own.get(), "")}) {
        EXPECT_NE(sys::listxattrat(fd, name).value().find(std::string("user.one\0", 9)), std::string::npos);
        std::byte buffer[16];
        EXPECT_EQ(sys::getxattrat(fd, name, "user.one", buffer).value(), 5U);
        EXPECT_TRUE(sys::getxattrat(fd, name, "user.two", buffer).error().isPosix(ENODATA));
    }
}

TEST_F(SysTest, longListsOfAttributesAreReadWhole) {
    const std::string path = folder_.file("a");
    for (int i = 0; i < 30; ++i) {
        ASSERT_EQ(::setxattr(path.c_str(), ("user." + std::string(40, 'n') + std::to_string(i)).c_str(), "", 0, 0), 0);
    }
    std::string names;
    EXPECT_TRUE(sys::hasXattrs(directory().get(), "a", names).value());
    EXPECT_EQ(names, sys::listxattrat(directory().get(), "a").value());
    EXPECT_GT(names.size(), 1000U);
}

TEST_F(SysTest, beginningsAreReadFromRegularFilesOnly) {
    folder_.file("a", "hello");
    ASSERT_EQ(::mkfifo((folder_ / "fifo").c_str(), 0600), 0);
    ASSERT_EQ(::symlink("a", (folder_ / "link").c_str()), 0);
    const UniqueFd parent = directory();
    EXPECT_EQ(textOf(sys::readBeginning(parent.get(), "a", 3).value()), "hel");
    EXPECT_EQ(textOf(sys::readBeginning(parent.get(), "a", 100).value()), "hello");
    for (const char* name : {"fifo", "link", "."})
        EXPECT_TRUE(sys::readBeginning(parent.get(), name, 3).error().isPosix(ENXIO)) << name;
}

TEST_F(SysTest, countsEntriesUpToTheMost) {
    for (int i = 0; i < 10; ++i) folder_.file("f/" + std::to_string(i));
    EXPECT_EQ(sys::countEntries(directory().get(), "f", 100).value(), 10U);
    EXPECT_EQ(sys::countEntries(directory().get(), "f", 4).value(), 4U);
    EXPECT_TRUE(sys::countEntries(directory().get(), "missing", 4).error().isPosix(ENOENT));
}

TEST_F(SysTest, aDescriptorTellsItsPath) {
    EXPECT_EQ(sys::pathOfDescriptor(directory().get()).value(), std::filesystem::canonical(folder_.path()).string());
    EXPECT_FALSE(sys::pathOfDescriptor(-1).ok());
}

Result<int> half(int number) {
    if (number % 2 != 0) return KsError::posix(EDOM);
    return number / 2;
}
Result<int> quarter(int number) {
    return TRY(half(TRY(half(number))));
}

TEST(Result, tryPassesTheFirstErrorOn) {
    EXPECT_EQ(quarter(12).value(), 3);
    EXPECT_TRUE(quarter(6).error().isPosix(EDOM));
    EXPECT_EQ(quarter(6).valueOr(7), 7);
}

TEST(KsError, comparesByDomainAndCode) {
    EXPECT_EQ(KsError::posix(ENOENT, "/a"), KsError::posix(ENOENT));
    EXPECT_FALSE(KsError::posix(513) == KsError::errorFileWriteNoPermission());
    EXPECT_EQ(KsError::posix(ENOENT).reason(), "No such file or directory");
    EXPECT_EQ(KsError::posix(ENOENT).with("path", "/a").with("path", "/b").userInfo().at("path"), "/b");
}

}  // namespace
}  // namespace cindral::test
