#include "provider/Utilities.h"

#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include "provider/ProviderFixture.h"

namespace cindral::test {
namespace {

class UtilitiesTest : public ProviderTest {
protected:
    static void set(const std::string& path, std::string_view name, std::string_view value) {
        ASSERT_EQ(::setxattr(path.c_str(), ("user." + std::string(name)).c_str(), value.data(), value.size(), 0), 0);
    }
    UniqueFd open(const std::string& path, int flags) { return UniqueFd(::open(path.c_str(), flags | O_CLOEXEC)); }
    LogCapture log_;
};

TEST_F(UtilitiesTest, absentAttributeIsNoneAndSilent) {
    storage_.file("a.txt");
    const std::size_t before = log_.lines().size();
    EXPECT_FALSE(initWithValueOfXattr(kXattrTagDataName, url("a.txt")));
    EXPECT_EQ(log_.lines().size(), before);
}

TEST_F(UtilitiesTest, attributeOfAMissingFileIsLoggedAtDebugLevelOnly) {
    EXPECT_FALSE(initWithValueOfXattr(kXattrTagDataName, url("missing")));
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, "[DEBUG] can't get xattr com.vemra.metadata:_kMDItemUserTags; "));
    EXPECT_EQ(log_.count("[ERROR]"), 0U);
}

TEST_F(UtilitiesTest, readsAnAttributeWhole) {
    const std::string value(3000, 'x');
    set(storage_.file("a.txt"), kXattrTagDataName, value);
    const auto read = initWithValueOfXattr(kXattrTagDataName, url("a.txt"));
    ASSERT_TRUE(read);
    EXPECT_EQ(textOf(*read), value);
}

TEST_F(UtilitiesTest, attributesOfALinkAreNotThoseOfItsTarget) {
    set(storage_.file("a.txt"), kXattrTagDataName, "value");
    ASSERT_EQ(::symlink("a.txt", (storage_ / "link").c_str()), 0);
    EXPECT_FALSE(initWithValueOfXattr(kXattrTagDataName, url("link")));
}

TEST_F(UtilitiesTest, setsAndRemovesOnADescriptor) {
    const UniqueFd fd = open(storage_.file("a.txt"), O_RDONLY);
    const auto bytes = bytesOf("value");
    EXPECT_FALSE(setXattr(fd.get(), Bytes(bytes.begin(), bytes.end()), kXattrTrashDateName));
    EXPECT_TRUE(initWithValueOfXattr(kXattrTrashDateName, url("a.txt")));
    EXPECT_FALSE(setXattr(fd.get(), std::nullopt, kXattrTrashDateName));
    EXPECT_FALSE(initWithValueOfXattr(kXattrTrashDateName, url("a.txt")));
}

TEST_F(UtilitiesTest, removingWhatIsNotThereSucceedsSilently) {
    const UniqueFd fd = open(storage_.file("a.txt"), O_RDONLY);
    const std::size_t before = log_.lines().size();
    EXPECT_FALSE(setXattr(fd.get(), std::nullopt, kXattrTrashDateName));
    EXPECT_EQ(log_.lines().size(), before);
}

TEST_F(UtilitiesTest, aFailedWriteIsAPosixErrorAndALine) {
    const UniqueFd fd = open(storage_.file("a.txt"), O_RDONLY);
    const auto error = setXattr(fd.get(), Bytes(100'000), kXattrTrashDateName);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), kKsPOSIXErrorDomain);
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "[ERROR] can't set xattr \"com.vemra.trash.time#PS\"; "));
}

// Permissions bind only whom they are about: as root, the write is made by a child that has dropped to an ordinary
// user.
TEST_F(UtilitiesTest, writingWithoutPermissionIsLoggedAtDebugLevel) {
    const std::string path = storage_.file("a.txt");
    ASSERT_EQ(::chmod(path.c_str(), 0444), 0);
    const UniqueFd fd = open(path, O_RDONLY);
    if (::geteuid() == 0) {
        ASSERT_EQ(::seteuid(65534), 0);
    }
    const auto error = setXattr(fd.get(), Bytes(1), kXattrTrashDateName);
    if (::getuid() == 0) {
        ASSERT_EQ(::seteuid(0), 0);
    }
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->isPosix(EACCES)) << error->description();
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, "[DEBUG] can't set xattr \"com.vemra.trash.time#PS\"; "));
    EXPECT_EQ(log_.count("[ERROR]"), 0U);
}

TEST(ProperURL, rewritesVar) {
    EXPECT_EQ(properURL(KsURL::fileURL("/var/mobile/x")).path(), "/private/var/mobile/x");
    EXPECT_EQ(properURL(KsURL::fileURL("/private/var/x")).path(), "/private/var/x");
    EXPECT_EQ(properURL(KsURL::fileURL("/variable/x")).path(), "/private/variable/x");
    EXPECT_EQ(properURL(KsURL::fileURL("/home/var")).path(), "/home/var");
}

TEST(ErrorFileWriteNoPermission, is513OfTheGeneralDomain) {
    const KsError error = KsError::errorFileWriteNoPermission();
    EXPECT_EQ(error.domain(), "KsGeneralErrorDomain");
    EXPECT_EQ(error.code(), 513);
    EXPECT_TRUE(error.userInfo().empty());
}

TEST_F(UtilitiesTest, resourceValueOfAMissingFileIsLogged) {
    EXPECT_FALSE(boolResourceValue(url("missing"), ResourceKey::isWritable));
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "[ERROR] can't get resource \"KsURLIsWritableKey\" for \"file://"));
}

TEST_F(UtilitiesTest, trashIsAComponentBelowTheRoot) {
    EXPECT_TRUE(isInTrash(url(".Trash/a.txt")));
    EXPECT_TRUE(isInTrash(url("b/.Trash/a.txt")));
    EXPECT_FALSE(isInTrash(url(".Trashed/a.txt")));
    EXPECT_FALSE(isInTrash(url("x.Trash/a.txt")));
    EXPECT_FALSE(isInTrash(url("a.txt")));
}

TEST(TrashTest, aRootBelowATrashFolderIsNoTrash) {
    const TemporaryFolder folder;
    const std::string root = folder.folder(".Trash/Documents");
    ASSERT_TRUE(RootDirectories::shared().add(root, RootPolicy::storage).ok());
    EXPECT_FALSE(isInTrash(KsURL::fileURL(root + "/a.txt")));
    EXPECT_TRUE(isInTrash(KsURL::fileURL(root + "/.Trash/a.txt")));
    RootDirectories::shared().remove(root);
}

TEST_F(UtilitiesTest, temporaryFolderIsMadeOnce) {
    const KsURL folder = temporaryLocalFolderURL();
    EXPECT_EQ(folder, url(".TemporaryLocalFolder"));
    EXPECT_TRUE(folder.ts_isFolder());
    EXPECT_EQ(temporaryLocalFolderURL(), folder);
    EXPECT_EQ(log_.count("can't create temporary directory"), 0U);
}

TEST_F(UtilitiesTest, aTemporaryFolderThatCannotBeMadeIsLogged) {
    ASSERT_EQ(::rmdir(storage_.path().c_str()), 0);
    const KsURL folder = temporaryLocalFolderURL();
    EXPECT_EQ(folder, url(".TemporaryLocalFolder"));
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "[ERROR] can't create temporary directory; "));
}

}  // namespace
}  // namespace cindral::test
