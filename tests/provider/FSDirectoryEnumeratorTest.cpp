#include "provider/fs/FSDirectoryEnumerator.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <set>

#include "platform/foundation/RootDirectories.h"
#include "provider/fs/FSListingPositions.h"
#include "support/LogCapture.h"
#include "support/TemporaryFolder.h"

namespace cindral::test {
namespace {

using Names = std::vector<std::string>;

class FSDirectoryEnumeratorTest : public ::testing::Test {
protected:
    FSDirectoryEnumeratorTest() { EXPECT_TRUE(RootDirectories::shared().add(root_.path(), RootPolicy::storage).ok()); }
    ~FSDirectoryEnumeratorTest() override { RootDirectories::shared().remove(root_.path()); }

    EnumeratorOptions options(bool recursively = false) const {
        EnumeratorOptions options;
        options.urls = {KsURL::fileURL(root_.path())};
        options.recursively = recursively;
        return options;
    }
    static EnumeratorOptions with(EnumeratorOptions options, DirectoryEnumerationOptions bits) {
        options.directoryEnumerationOptionsFor = [bits](const KsURL&) { return bits; };
        return options;
    }
    /// Paths below the root, in the order of delivery.
    Names list(const EnumeratorOptions& options) {
        Names names;
        const auto listed = enumerator_.enumerate(options, [&](const KsURL& entry) -> Result<void> {
            names.push_back(entry.path().starts_with(root_.path() + "/") ? entry.path().substr(root_.path().size() + 1)
                                                                         : entry.path());
            return {};
        });
        EXPECT_TRUE(listed.ok());
        return names;
    }
    Names pages(EnumeratorOptions options, std::uint64_t limit) {
        Names names;
        options.limit = limit;
        while (true) {
            const Names page = list(options);
            names.insert(names.end(), page.begin(), page.end());
            EXPECT_EQ(enumerator_.counter(), options.offset + page.size());
            if (enumerator_.isComplete()) return names;
            EXPECT_EQ(page.size(), limit);
            options.offset = enumerator_.counter();
        }
    }
    static Names sorted(Names names) {
        std::ranges::sort(names);
        return names;
    }
    void nestedTree() {
        for (int i = 0; i < 12; ++i) {
            const std::string folder = "f" + std::to_string(i);
            root_.folder(folder);
            for (int j = 0; j < i; ++j)
                root_.file(folder + "/sub" + std::to_string(j % 3) + "/file" + std::to_string(j));
            root_.file("top" + std::to_string(i));
        }
    }

    TemporaryFolder root_;
    FSDirectoryEnumerator enumerator_;
    LogCapture log_;
};

TEST_F(FSDirectoryEnumeratorTest, listsTheEntriesWithoutDots) {
    root_.file("a");
    root_.file(".hidden");
    root_.file("b/inner");
    EXPECT_EQ(sorted(list(options())), (Names{".hidden", "a", "b"}));
    EXPECT_EQ(enumerator_.counter(), 3U);
    EXPECT_TRUE(enumerator_.isComplete());
}

TEST_F(FSDirectoryEnumeratorTest, anOffsetAtTheEndDeliversNothing) {
    for (int i = 0; i < 5; ++i) root_.file("f" + std::to_string(i));
    EnumeratorOptions five = options();
    five.offset = 5;
    EXPECT_EQ(list(five), Names());
    EXPECT_TRUE(enumerator_.isComplete());
    EXPECT_EQ(enumerator_.counter(), 5U);
}

TEST_F(FSDirectoryEnumeratorTest, aLimitOfZeroTellsWhetherThereIsMore) {
    EnumeratorOptions none = options();
    none.limit = 0;
    EXPECT_EQ(list(none), Names());
    EXPECT_TRUE(enumerator_.isComplete());
    root_.file("a");
    EXPECT_EQ(list(none), Names());
    EXPECT_FALSE(enumerator_.isComplete());
    EXPECT_EQ(enumerator_.counter(), 0U);
    none.offset = 1;
    EXPECT_EQ(list(none), Names());
    EXPECT_TRUE(enumerator_.isComplete());
}

TEST_F(FSDirectoryEnumeratorTest, hiddenNamesAreNeitherDeliveredNorCounted) {
    root_.file(".Trash/x");
    root_.file(".dot");
    root_.file("a");
    EXPECT_EQ(list(with(options(), DirectoryEnumerationOptions::skipsHiddenNames)), Names{"a"});
    EXPECT_EQ(enumerator_.counter(), 1U);
}

TEST_F(FSDirectoryEnumeratorTest, descendsInPreOrder) {
    nestedTree();
    const Names names = list(options(true));
    std::set<std::string> seen;
    for (const std::string& name : names) {
        const std::size_t slash = name.rfind('/');
        if (slash != std::string::npos) {
            EXPECT_TRUE(seen.contains(name.substr(0, slash))) << name;
        }
        EXPECT_TRUE(seen.insert(name).second) << name;
    }
}

TEST_F(FSDirectoryEnumeratorTest, packagesAndFoldersAreEnteredAsTheBitsSay) {
    root_.file("report.folio/index");
    root_.file("folder/a");
    EXPECT_EQ(sorted(list(options(true))), (Names{"folder", "folder/a", "report.folio", "report.folio/index"}));
    EXPECT_EQ(sorted(list(with(options(true), DirectoryEnumerationOptions::skipsPackageDescendants))),
              (Names{"folder", "folder/a", "report.folio"}));
    EXPECT_EQ(sorted(list(with(options(true), DirectoryEnumerationOptions::skipsFolderDescendants))),
              (Names{"folder", "report.folio", "report.folio/index"}));
}

TEST_F(FSDirectoryEnumeratorTest, theBitsAreChosenForEachDirectory) {
    root_.file("open/.hidden");
    root_.file("shut/.hidden");
    EnumeratorOptions chosen = options(true);
    chosen.directoryEnumerationOptionsFor = [](const KsURL& url) -> std::optional<DirectoryEnumerationOptions> {
        if (url.lastPathComponent() == "shut") return DirectoryEnumerationOptions::skipsHiddenNames;
        return std::nullopt;
    };
    EXPECT_EQ(sorted(list(chosen)), (Names{"open", "open/.hidden", "shut"}));
}

TEST_F(FSDirectoryEnumeratorTest, linksAreNotEntered) {
    root_.file("folder/a");
    ASSERT_EQ(::symlink("folder", (root_ / "link").c_str()), 0);
    ASSERT_EQ(::symlink(".", (root_ / "loop").c_str()), 0);
    EXPECT_EQ(sorted(list(options(true))), (Names{"folder", "folder/a", "link", "loop"}));
}

TEST_F(FSDirectoryEnumeratorTest, pagesAddUpToTheWholeOnNestedTrees) {
    nestedTree();
    const Names whole = list(options(true));
    FSListingPositions positions(1000);
    for (const std::uint64_t limit : {1, 2, 3, 7, 10, 50, 1000}) {
        EXPECT_EQ(pages(options(true), limit), whole) << "counting, " << limit;
        EnumeratorOptions hinted = options(true);
        hinted.positions = &positions;
        hinted.positionsKey = std::to_string(limit);
        EXPECT_EQ(pages(hinted, limit), whole) << "with positions, " << limit;
    }
}

TEST_F(FSDirectoryEnumeratorTest, pagesGoOnOverSeveralDirectories) {
    const TemporaryFolder other;
    root_.file("a");
    root_.file("b/c");
    other.file("d");
    other.file("e");
    EnumeratorOptions both = options(true);
    both.urls.push_back(KsURL::fileURL(other.path()));
    const Names whole = list(both);
    EXPECT_EQ(whole.size(), 5U);
    EXPECT_EQ(pages(both, 2), whole);
    FSListingPositions positions(10);
    both.positions = &positions;
    EXPECT_EQ(pages(both, 2), whole);
}

TEST_F(FSDirectoryEnumeratorTest, aPositionIsOnlyUsedWhileTheDirectoryIsWhatItWas) {
    for (int i = 0; i < 20; ++i) root_.file("f" + std::to_string(i));
    FSListingPositions positions(10);
    EnumeratorOptions page = options();
    page.positions = &positions;
    page.limit = 10;
    (void)list(page);
    root_.file("new");
    page.offset = 10;
    const Names hinted = list(page);
    page.positions = nullptr;
    EXPECT_EQ(hinted, list(page)) << "counted from the start";
}

TEST_F(FSDirectoryEnumeratorTest, aPositionAtTheVeryEndNeedsNoCounting) {
    for (int i = 0; i < 10; ++i) root_.file("f" + std::to_string(i));
    FSListingPositions positions(10);
    EnumeratorOptions page = options();
    page.positions = &positions;
    page.limit = 10;
    EXPECT_EQ(list(page).size(), 10U);
    EXPECT_TRUE(enumerator_.isComplete());
    ASSERT_TRUE(positions.find("", 10));
    page.offset = 10;
    EXPECT_EQ(list(page), Names());
    EXPECT_EQ(enumerator_.counter(), 10U);
    EXPECT_TRUE(enumerator_.isComplete());
}

TEST_F(FSDirectoryEnumeratorTest, aDirectoryThatCannotBeOpenedIsLogged) {
    EnumeratorOptions missing = options();
    missing.urls = {KsURL::fileURL(root_ / "missing")};
    EXPECT_EQ(list(missing), Names());
    ASSERT_TRUE(enumerator_.openError());
    EXPECT_TRUE(enumerator_.openError()->isPosix(ENOENT));
    EXPECT_TRUE(log_.containsPart(LogLevel::error, "[ERROR] can't open directory at " + (root_ / "missing") + "; "));
}

TEST_F(FSDirectoryEnumeratorTest, aFifoIsNoDirectoryAndIsNotOpened) {
    ASSERT_EQ(::mkfifo((root_ / "fifo").c_str(), 0600), 0);
    EXPECT_EQ(list(options(true)), Names{"fifo"});
    EnumeratorOptions fifo = options();
    fifo.urls = {KsURL::fileURL(root_ / "fifo")};
    EXPECT_EQ(list(fifo), Names());
    EXPECT_TRUE(enumerator_.openError()->isPosix(ENOTDIR));
}

TEST_F(FSDirectoryEnumeratorTest, theBodysFailureIsPassedOnUnchanged) {
    for (int i = 0; i < 5; ++i) root_.file("f" + std::to_string(i));
    int calls = 0;
    const auto stopped = enumerator_.enumerate(options(), [&](const KsURL&) -> Result<void> {
        if (++calls == 3) return KsError::posix(EIO).with("path", "third");
        return {};
    });
    ASSERT_FALSE(stopped.ok());
    EXPECT_TRUE(stopped.error().isPosix(EIO));
    EXPECT_EQ(stopped.error().userInfo().at("path"), "third");
    EXPECT_EQ(calls, 3);
}

TEST_F(FSDirectoryEnumeratorTest, aSubdirectoryWhoseKindCannotBeReadIsDeliveredAndNotEntered) {
    const TemporaryFolder elsewhere;
    for (int i = 0; i < 10; ++i) root_.file("d" + std::to_string(i) + "/inner");
    Names top;
    Names inner;
    // All ten are in the directory's records already when the first is delivered, and nine are gone then.
    const auto listed = enumerator_.enumerate(options(true), [&](const KsURL& entry) -> Result<void> {
        const std::string name(entry.lastPathComponent());
        (name == "inner" ? inner : top).push_back(name);
        if (top.size() == 1 && inner.empty()) {
            for (int i = 0; i < 10; ++i) {
                const std::string other = "d" + std::to_string(i);
                if (other != name) {
                    EXPECT_EQ(::rename((root_ / other).c_str(), (elsewhere / other).c_str()), 0);
                }
            }
        }
        return {};
    });
    EXPECT_TRUE(listed.ok());
    EXPECT_EQ(top.size(), 10U);
    EXPECT_EQ(inner.size(), 1U);
    EXPECT_EQ(enumerator_.counter(), 11U);
}

TEST_F(FSDirectoryEnumeratorTest, aDeepTreeNeedsFewDescriptorsAndNoShortPaths) {
    // Deeper than a path may be long, made a level at a time.
    UniqueFd folder(::open(root_.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const std::string name(50, 'd');
    constexpr int kDepth = 120;
    for (int i = 0; i < kDepth; ++i) {
        ASSERT_EQ(::mkdirat(folder.get(), name.c_str(), 0700), 0);
        UniqueFd file(::openat(folder.get(), "file", O_CREAT | O_WRONLY | O_CLOEXEC, 0600));
        ASSERT_TRUE(file);
        folder.reset(::openat(folder.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
        ASSERT_TRUE(folder);
    }
    const Names whole = list(options(true));
    EXPECT_EQ(whole.size(), 2U * kDepth);
    EXPECT_EQ(pages(options(true), 7), whole);
    FSListingPositions positions(1000);
    EnumeratorOptions hinted = options(true);
    hinted.positions = &positions;
    EXPECT_EQ(pages(hinted, 7), whole);
}

TEST_F(FSDirectoryEnumeratorTest, namesAreBytes) {
    const Names strange = sorted({"new\nline", "\xff\xfe", "a b", std::string(255, 'n'), "\x01"});
    for (const std::string& name : strange) root_.file(name);
    EXPECT_EQ(sorted(list(options())), strange);
}

TEST(FSListingPositions, keepsTheNewest) {
    FSListingPositions positions(2);
    positions.put("k", 1, {});
    positions.put("k", 2, {});
    EXPECT_TRUE(positions.find("k", 1));
    positions.put("k", 3, {});
    EXPECT_TRUE(positions.find("k", 1)) << "used since";
    EXPECT_FALSE(positions.find("k", 2));
    EXPECT_TRUE(positions.find("k", 3));
    EXPECT_FALSE(positions.find("other", 1));
}

}  // namespace
}  // namespace cindral::test
