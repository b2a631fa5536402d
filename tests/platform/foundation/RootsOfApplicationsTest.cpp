#include "platform/foundation/RootDirectories.h"

#include <fcntl.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "support/TemporaryFolder.h"

namespace cindral::test {
namespace {

namespace fs = std::filesystem;
using Paths = std::vector<std::string>;

class RootsOfApplicationsTest : public ::testing::Test {
protected:
    RootsOfApplicationsTest() {
        storage_ = folder_.folder("storage");
        if (!roots_.add(storage_, RootPolicy::storage).ok()) std::abort();
        listen();
    }
    // What the last changes set off may not be heard yet.
    ~RootsOfApplicationsTest() override { roots_.setObserver(nullptr); }
    void listen() {
        roots_.setObserver([this](const auto& roots) { heard_.push_back(pathsOf(roots)); });
    }
    /// What the observer heard since it listens.
    std::vector<Paths> heard() {
        roots_.setObserver(nullptr);
        return std::exchange(heard_, {});
    }
    static Paths pathsOf(const std::vector<std::shared_ptr<const RootDirectory>>& roots) {
        Paths paths;
        for (const auto& root : roots) paths.push_back(root->path);
        std::ranges::sort(paths);
        return paths;
    }
    Paths paths() const { return pathsOf(roots_.all()); }
    std::uint64_t fileIDOf(const std::string& path) const { return roots_.rootHolding(path)->status.fileID; }

    TemporaryFolder folder_;
    RootDirectories roots_;
    std::string storage_;
    std::vector<Paths> heard_;
};

TEST_F(RootsOfApplicationsTest, applicationsContainersComeAndGoTogether) {
    const std::string a = folder_.folder("a");
    const std::string b = folder_.folder("b");
    const std::string c = folder_.folder("c");
    // What is heard is how the roots are when it is heard, so each change is waited for.
    const auto heardOnce = [&] {
        const auto heardNow = heard();
        listen();
        EXPECT_EQ(heardNow, std::vector<Paths>{paths()});
        return paths();
    };
    roots_.setApplicationContainers({a, b});
    EXPECT_EQ(heardOnce(), (Paths{a, b, storage_}));
    roots_.setApplicationContainers({b, c});
    EXPECT_EQ(heardOnce(), (Paths{b, c, storage_}));
    EXPECT_EQ(roots_.rootHolding(c + "/x")->policy, RootPolicy::applicationContainer);
    roots_.addApplicationContainers({a});
    EXPECT_EQ(heardOnce(), (Paths{a, b, c, storage_}));
    roots_.setApplicationContainers({});
    EXPECT_EQ(heardOnce(), Paths{storage_});
}

TEST_F(RootsOfApplicationsTest, whatStaysAsItWasIsNoChange) {
    const std::string a = folder_.folder("a");
    roots_.setApplicationContainers({a});
    const auto before = roots_.rootHolding(a);
    EXPECT_EQ(heard().size(), 1U);
    listen();
    roots_.setApplicationContainers({a});
    roots_.addApplicationContainers({a});
    roots_.remove(folder_ / "none");
    EXPECT_EQ(roots_.rootHolding(a), before);
    EXPECT_TRUE(heard().empty());
}

TEST_F(RootsOfApplicationsTest, aFolderThatTookAnothersPlaceIsOpenedAnew) {
    const std::string a = folder_.folder("a");
    roots_.setApplicationContainers({a});
    const std::uint64_t before = fileIDOf(a);
    // The first is kept, so that its number is not given to the second.
    fs::rename(a, folder_ / "kept");
    folder_.folder("a");
    roots_.setApplicationContainers({a});
    EXPECT_NE(fileIDOf(a), before);
    EXPECT_EQ(heard().size(), 2U);
}

TEST_F(RootsOfApplicationsTest, aContainerThatCannotBeOpenedIsLeftOut) {
    const std::string a = folder_.folder("a");
    folder_.folder("secret");
    fs::create_directory_symlink(folder_ / "secret", folder_ / "link");
    folder_.file("file");
    roots_.setApplicationContainers({a, folder_ / "link", folder_ / "file", folder_ / "none"});
    EXPECT_EQ(paths(), (Paths{a, storage_}));
    fs::remove(a);
    roots_.setApplicationContainers({a});
    EXPECT_EQ(paths(), Paths{storage_});
}

TEST_F(RootsOfApplicationsTest, theStorageMayBeALink) {
    fs::create_directory_symlink(storage_, folder_ / "link");
    EXPECT_TRUE(roots_.add(folder_ / "link", RootPolicy::storage).ok());
    EXPECT_EQ(heard(), (std::vector<Paths>{{folder_ / "link", storage_}}));
    listen();
    roots_.remove(folder_ / "link");
    EXPECT_EQ(heard(), std::vector<Paths>{{storage_}});
}

TEST_F(RootsOfApplicationsTest, anObserverThatWasReplacedHearsNothing) {
    roots_.setObserver(nullptr);
    roots_.setApplicationContainers({folder_.folder("a")});
    EXPECT_TRUE(heard().empty());
}

}  // namespace
}  // namespace cindral::test
