#include "platform/foundation/KsURL.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>

#include "platform/foundation/RootDirectories.h"
#include "support/TemporaryFolder.h"

namespace cindral::test {
namespace {

TEST(KsURL, holdsAPathWithoutTrailingSlashes) {
    EXPECT_EQ(KsURL::fileURL("/a/b//").path(), "/a/b");
    EXPECT_EQ(KsURL::fileURL("/").path(), "/");
    EXPECT_EQ(KsURL::fileURL("/a/b"), KsURL::fileURL("/a/b/"));
}

TEST(KsURL, takesPathsApart) {
    const KsURL url = KsURL::fileURL("/a/b");
    EXPECT_EQ(url.lastPathComponent(), "b");
    EXPECT_EQ(url.appendingPathComponent("c/d").path(), "/a/b/c/d");
    EXPECT_EQ(url.deletingLastPathComponent()->path(), "/a");
    EXPECT_EQ(KsURL::fileURL("/a").deletingLastPathComponent()->path(), "/");
    EXPECT_EQ(KsURL::fileURL("/").deletingLastPathComponent(), std::nullopt);
    EXPECT_EQ(KsURL::fileURL("/").appendingPathComponent("a").path(), "/a");
}

TEST(KsURL, writesEveryByteOfAName) {
    EXPECT_EQ(KsURL::fileURL("/a b/\xc3\xa4%\n\xff?#").absoluteString(), "file:///a%20b/%C3%A4%25%0A%FF%3F%23");
    EXPECT_EQ(KsURL::fileURL("/A-z_0.9~").absoluteString(), "file:///A-z_0.9~");
}

TEST(KsURL, readsWhatItWrote) {
    std::string name = "/";
    for (int byte = 1; byte < 256; ++byte) {
        if (byte != '/') name += static_cast<char>(byte);
    }
    EXPECT_EQ(KsURL::parse(KsURL::fileURL(name).absoluteString())->path(), name);
    EXPECT_EQ(KsURL::parse("file://localhost/a%20b")->path(), "/a b");
    EXPECT_EQ(KsURL::parse("file:/a")->path(), "/a");
}

TEST(KsURL, refusesFileURLsThatNameNoLocalPath) {
    for (const char* text : {"file://host/a", "file:a", "file://", "file:///a%", "file:///a%2", "file:///a%zz",
                             "file:///a%00b", "file:///a?b", "file:///a#b"}) {
        EXPECT_FALSE(KsURL::parse(text)) << text;
    }
}

TEST(KsURL, keepsOtherSchemesAsText) {
    const auto url = KsURL::parse("https://example.org/a%20b");
    ASSERT_TRUE(url);
    EXPECT_FALSE(url->isFileURL());
    EXPECT_EQ(url->absoluteString(), "https://example.org/a%20b");
    EXPECT_FALSE(url->status().ok());
}

class KsURLValuesTest : public ::testing::Test {
protected:
    KsURL url(std::string_view name) const { return KsURL::fileURL(folder_ / name); }
    template <typename T>
    static std::optional<T> value(const KsURL& url, ResourceKey key) {
        const auto read = url.resourceValue(key);
        if (!read.ok() || !*read || !std::holds_alternative<T>(**read)) return std::nullopt;
        return std::get<T>(**read);
    }
    TemporaryFolder folder_;
};

TEST_F(KsURLValuesTest, readsTheValuesOfAFile) {
    struct stat status;
    ASSERT_EQ(::stat(folder_.file("a.txt", "hello").c_str(), &status), 0);
    const KsURL file = url("a.txt");
    EXPECT_EQ(value<std::uint64_t>(file, ResourceKey::fileID), status.st_ino);
    EXPECT_EQ(value<std::uint64_t>(file, ResourceKey::fileSize), 5U);
    EXPECT_EQ(value<KsDate>(file, ResourceKey::contentModificationDate), KsDate::from(status.st_mtim));
    EXPECT_TRUE(value<KsDate>(file, ResourceKey::creationDate));
    EXPECT_EQ(value<bool>(file, ResourceKey::isWritable), true);
    EXPECT_EQ(value<bool>(file, ResourceKey::isPackage), false);
    EXPECT_EQ(value<std::string>(file, ResourceKey::name), "a.txt");
    EXPECT_EQ(value<std::string>(file, ResourceKey::typeIdentifier), "text/plain");
}

TEST_F(KsURLValuesTest, aMissingFileIs260) {
    const auto read = url("missing").resourceValue(ResourceKey::fileID);
    ASSERT_FALSE(read.ok());
    EXPECT_TRUE(read.error().is(kKsGeneralErrorDomain, 260));
    EXPECT_EQ(read.error().userInfo().at("path"), folder_ / "missing");
    folder_.file("file");
    EXPECT_TRUE(url("file/below").resourceValue(ResourceKey::fileID).error().is(kKsGeneralErrorDomain, 260));
}

TEST_F(KsURLValuesTest, valuesAreKeptUntilTheyAreRemoved) {
    folder_.file("a.txt", "hello");
    KsURL file = url("a.txt");
    EXPECT_EQ(value<std::uint64_t>(file, ResourceKey::fileSize), 5U);
    folder_.file("a.txt", "hello again");
    EXPECT_EQ(value<std::uint64_t>(file, ResourceKey::fileSize), 5U);
    const KsURL copy = file;
    EXPECT_EQ(value<std::uint64_t>(copy, ResourceKey::fileSize), 5U);
    file.removeCachedResourceValues();
    EXPECT_EQ(value<std::uint64_t>(file, ResourceKey::fileSize), 11U);
}

TEST_F(KsURLValuesTest, aValuePutThereOutranksTheFile) {
    folder_.file("a.txt", "hello");
    KsURL file = url("a.txt");
    file.setCachedResourceValue(ResourceKey::fileSize, std::uint64_t{99});
    EXPECT_EQ(value<std::uint64_t>(file, ResourceKey::fileSize), 99U);
    file.setCachedResourceValue(ResourceKey::fileSize, std::nullopt);
    ASSERT_TRUE(file.resourceValue(ResourceKey::fileSize).ok());
    EXPECT_FALSE(*file.resourceValue(ResourceKey::fileSize));
    file.setCachedResourceValue(ResourceKey::documentIdentifier, std::uint64_t{7});
    EXPECT_EQ(value<std::uint64_t>(file, ResourceKey::documentIdentifier), 7U);
}

TEST_F(KsURLValuesTest, linkCountsAreEntriesPlusTwo) {
    folder_.file("f/a");
    folder_.file("f/.b");
    folder_.folder("f/c");
    EXPECT_EQ(url("f").linkCount().value(), 5);
    EXPECT_EQ(url("f/c").linkCount().value(), 2);
    EXPECT_EQ(url("f/a").linkCount().value(), 1);
}

TEST_F(KsURLValuesTest, onlyPlainDirectoriesAreFolders) {
    folder_.folder("f");
    folder_.folder("x.folio");
    folder_.file("y.folio");
    folder_.file("a");
    ASSERT_EQ(::symlink("f", (folder_ / "link").c_str()), 0);
    EXPECT_TRUE(url("f").ts_isFolder());
    for (const char* name : {"x.folio", "y.folio", "a", "link", "missing"})
        EXPECT_FALSE(url(name).ts_isFolder()) << name;
}

TEST_F(KsURLValuesTest, attributeNamesAreLookedAtOnce) {
    const std::string path = folder_.file("a.txt");
    ASSERT_EQ(::setxattr(path.c_str(), "user.one", "1", 1, 0), 0);
    const KsURL file = url("a.txt");
    EXPECT_TRUE(file.mayHaveAttribute("user.anything")) << "nobody looked yet";
    file.loadAttributeNames();
    EXPECT_TRUE(file.mayHaveAttribute("user.one"));
    EXPECT_FALSE(file.mayHaveAttribute("user.on"));
    EXPECT_FALSE(file.mayHaveAttribute("user.one2"));
    EXPECT_EQ(file.attribute("user.one", {}).value(), 1U);
    EXPECT_TRUE(file.attribute("user.two", {}).error().isPosix(ENODATA));
}

TEST_F(KsURLValuesTest, aChildThatWasSeenIsNotLookedAt) {
    folder_.file("dir/a.txt", "hello");
    const FileStatus status = *KsURL::fileURL(folder_ / "dir/a.txt").status();
    auto directory = std::make_shared<DirectoryReference>();
    directory->path = folder_ / "dir";
    directory->traits.ownerWhoseModeDecides = status.owner;
    const auto seen = KsURL::seenChild(directory, "a.txt", status);
    ASSERT_TRUE(seen);
    const KsURL& url = *seen;
    EXPECT_TRUE(url.wasSeenBefore());
    ASSERT_EQ(::setxattr(url.path().c_str(), "user.color", "red", 3, 0), 0);
    ASSERT_EQ(::truncate(url.path().c_str(), 1), 0);
    EXPECT_EQ(url.status()->size, 5U);
    EXPECT_FALSE(url.mayHaveAttribute("user.color"));
    ASSERT_EQ(::unlink(url.path().c_str()), 0);
    EXPECT_TRUE(*url.isWritable());
    EXPECT_EQ(url.typeIdentifier()->string(), "text/plain");
}

TEST_F(KsURLValuesTest, aChildThatWasSeenHasNothingLeftToRead) {
    const FileStatus status = *KsURL::fileURL(folder_.file("dir/a", "hello")).status();
    auto directory = std::make_shared<DirectoryReference>();
    directory->path = folder_ / "dir";
    EXPECT_FALSE(KsURL::seenChild(directory, "a.txt", status)) << "who may write it is not told by its mode alone";
    directory->traits.ownerWhoseModeDecides = status.owner;
    EXPECT_TRUE(KsURL::seenChild(directory, "a.txt", status));
    EXPECT_FALSE(KsURL::seenChild(directory, "a", status)) << "its type is in its contents";
    FileStatus other = status;
    other.mode = S_IFREG | 0444;
    EXPECT_FALSE(KsURL::seenChild(directory, "a.txt", other)) << "privilege may let it be written";
    other = status;
    other.owner += 1;
    EXPECT_FALSE(KsURL::seenChild(directory, "a.txt", other));
}

TEST_F(KsURLValuesTest, aChildReadsThroughItsDirectory) {
    const std::string path = folder_.file("f/a.txt", "hello");
    ASSERT_EQ(::setxattr(path.c_str(), "user.one", "1", 1, 0), 0);
    auto directory = std::make_shared<DirectoryReference>();
    directory->path = folder_ / "f";
    directory->fd = sys::openDirectoryForReading(AT_FDCWD, directory->path.c_str()).value();
    KsURL child = KsURL::child(directory, "a.txt");
    // The directory goes elsewhere; the descriptor goes along.
    ASSERT_EQ(::rename((folder_ / "f").c_str(), (folder_ / "g").c_str()), 0);
    EXPECT_EQ(child.status().value().size, 5U);
    EXPECT_TRUE(child.isWritable().value());
    EXPECT_EQ(child.attribute("user.one", {}).value(), 1U);
    EXPECT_EQ(child.path(), folder_ / "f/a.txt");
    child.detach();
    EXPECT_EQ(child.status().value().size, 5U) << "what was read stays";
    child.removeCachedResourceValues();
    EXPECT_FALSE(child.status().ok());
}

class RootDirectoriesTest : public KsURLValuesTest {
protected:
    ~RootDirectoriesTest() override { RootDirectories::shared().remove(root()); }
    std::string root() const { return folder_ / "root"; }
    void publish(RootPolicy policy) {
        folder_.folder("root");
        ASSERT_TRUE(RootDirectories::shared().add(root(), policy).ok());
    }
};

TEST_F(RootDirectoriesTest, holdsPathsByWholeComponents) {
    publish(RootPolicy::storage);
    RootDirectories& roots = RootDirectories::shared();
    EXPECT_TRUE(roots.rootHolding(root()));
    EXPECT_TRUE(roots.rootHolding(root() + "/a"));
    EXPECT_FALSE(roots.rootHolding(root() + "2/a"));
    EXPECT_FALSE(roots.rootHolding(folder_.path()));
}

TEST_F(RootDirectoriesTest, theInnermostRootHolds) {
    publish(RootPolicy::storage);
    const std::string inner = folder_.folder("root/inner");
    ASSERT_TRUE(RootDirectories::shared().add(inner, RootPolicy::storage).ok());
    EXPECT_EQ(RootDirectories::shared().rootHolding(inner + "/a")->path, inner);
    RootDirectories::shared().remove(inner);
    EXPECT_EQ(RootDirectories::shared().rootHolding(inner + "/a")->path, root());
}

TEST_F(RootDirectoriesTest, noLinkLeadsOutOfARoot) {
    publish(RootPolicy::storage);
    folder_.file("secret/a.txt", "secret");
    ASSERT_EQ(::symlink("../secret", (root() + "/relative").c_str()), 0);
    ASSERT_EQ(::symlink((folder_ / "secret").c_str(), (root() + "/absolute").c_str()), 0);
    ASSERT_EQ(::symlink("/proc/self/cwd", (root() + "/magic").c_str()), 0);
    for (const char* name : {"relative", "absolute", "magic"}) {
        EXPECT_FALSE(KsURL::fileURL(root() + "/" + name + "/a.txt").status().ok()) << name;
        EXPECT_TRUE(S_ISLNK(KsURL::fileURL(root() + "/" + name).status().value().mode))
            << "the link itself is an object like another";
    }
    EXPECT_FALSE(KsURL::fileURL(root() + "/../secret/a.txt").status().ok());
}

TEST_F(RootDirectoriesTest, linksInsideAreWalkedInTheStorageOnly) {
    publish(RootPolicy::storage);
    folder_.file("root/inner/a.txt", "hello");
    ASSERT_EQ(::symlink("inner", (root() + "/link").c_str()), 0);
    EXPECT_TRUE(KsURL::fileURL(root() + "/link/a.txt").status().ok());
    publish(RootPolicy::applicationContainer);
    EXPECT_FALSE(KsURL::fileURL(root() + "/link/a.txt").status().ok());
    EXPECT_TRUE(KsURL::fileURL(root() + "/link").status().ok());
    EXPECT_TRUE(KsURL::fileURL(root() + "/inner/a.txt").status().ok());
}

TEST_F(RootDirectoriesTest, aRootStaysTheSameDirectoryWhateverItsPathNames) {
    publish(RootPolicy::storage);
    folder_.file("root/a.txt", "hello");
    ASSERT_EQ(::rename(root().c_str(), (folder_ / "moved").c_str()), 0);
    EXPECT_EQ(KsURL::fileURL(root() + "/a.txt").status().value().size, 5U);
}

TEST_F(RootDirectoriesTest, aPathWithANulNamesNothing) {
    publish(RootPolicy::storage);
    folder_.file("root/a");
    EXPECT_TRUE(KsURL::fileURL(root() + std::string("/a\0b", 4)).status().error().isPosix(EINVAL));
}

TEST_F(RootDirectoriesTest, pathsBeyondTheKernelsLengthAreWalkedInPieces) {
    publish(RootPolicy::storage);
    UniqueFd folder(::open(root().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    std::string path = root();
    const std::string name(200, 'd');
    while (path.size() < 9'000) {
        ASSERT_EQ(::mkdirat(folder.get(), name.c_str(), 0700), 0);
        folder.reset(::openat(folder.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        path += "/" + name;
    }
    EXPECT_TRUE(KsURL::fileURL(path).status().value().isDirectory());
    EXPECT_TRUE(KsURL::fileURL(path + "/missing").status().error().isPosix(ENOENT));
}

TEST_F(RootDirectoriesTest, tellsOnceWhatIsLeftOut) {
    EXPECT_TRUE(RootDirectories::shared().noteLeftOut(folder_ / "mounted", "why"));
    EXPECT_FALSE(RootDirectories::shared().noteLeftOut(folder_ / "mounted", "why"));
    EXPECT_EQ(RootDirectories::shared().leftOut().back().path, folder_ / "mounted");
}

}  // namespace
}  // namespace cindral::test
