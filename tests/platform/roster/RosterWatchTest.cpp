#include "platform/roster/RosterWatch.h"

#include <fcntl.h>
#include <unistd.h>

#include <fstream>

#include "platform/foundation/Sys.h"
#include "platform/roster/RosterFixture.h"

namespace cindral::test {
namespace {

namespace fs = std::filesystem;
using std::chrono::milliseconds;

/// A watch of what a look depends on, and a clock that stands still.
class RosterWatchTest : public RosterSourcesTest {
protected:
    RosterWatchTest() {
        folder_.folder("entries");
        auto made = RosterWatch::make();
        if (!made.ok()) std::abort();
        watch_.emplace(*std::move(made));
    }
    /// Looks until nothing more is to be watched; how many looks that took.
    int look() {
        RosterScanner scanner(sources_);
        int looks = 1;
        while (watch_->watch(scanner.scan(watch_->filesBeingWritten()).interests)) ++looks;
        return looks;
    }
    bool hasNews() { return watch_->drain(now_); }
    std::set<std::string> beingWritten() const { return watch_->filesBeingWritten(); }
    std::string entryPath(const std::string& name) const { return folder_ / ("entries/" + name); }

    std::optional<RosterWatch> watch_;
    RosterWatch::TimePoint now_{};
};

TEST_F(RosterWatchTest, isQuietWhereNothingHappens) {
    EXPECT_EQ(look(), 2);
    EXPECT_EQ(look(), 1);
    EXPECT_TRUE(watch_->isComplete());
    EXPECT_FALSE(hasNews());
    EXPECT_EQ(watch_->nextMoment(), std::nullopt);
}

TEST_F(RosterWatchTest, tellsOfFlatpaksLinks) {
    auto deployment = FlatpakTree::named("a", "A");
    user_.install("a", deployment);
    look();
    deployment.commit = "2c3d";
    user_.deploy("a", deployment);
    EXPECT_FALSE(hasNews()) << "a deployment that is not active concerns nobody";
    user_.activate("a", deployment);
    EXPECT_TRUE(hasNews());
    look();
    EXPECT_FALSE(hasNews());
    deployment.commit = "3d4e";
    deployment.branch = "beta";
    user_.install("a", deployment);
    EXPECT_TRUE(hasNews());
    look();
    hasNews();
    // The branch that is current now is the one that is watched.
    deployment.commit = "4e5f";
    user_.install("a", deployment);
    EXPECT_TRUE(hasNews());
    user_.uninstall("a");
    EXPECT_TRUE(hasNews());
}

TEST_F(RosterWatchTest, tellsOfSourcesThatAppear) {
    fs::remove(folder_ / "entries");
    look();
    const auto appears = [&](const std::string& path) {
        fs::create_directories(path);
        const bool news = hasNews();
        look();
        hasNews();
        return news;
    };
    EXPECT_TRUE(appears(folder_ / "entries"));
    EXPECT_TRUE(appears(user_.path()));
    EXPECT_TRUE(appears(system_.path() + "/app"));
    EXPECT_TRUE(appears(folder_ / "etc"));
    EXPECT_TRUE(appears(folder_ / "etc/installations.d"));
    EXPECT_TRUE(appears(folder_ / "config"));
    EXPECT_FALSE(appears(folder_ / "home/Documents/unrelated"));
    EXPECT_FALSE(appears(folder_ / "unrelated"));
    fs::rename(folder_ / "entries", folder_ / "elsewhere");
    EXPECT_TRUE(hasNews());
}

TEST_F(RosterWatchTest, tellsOfDocumentsFoldersThatComeAndGo) {
    user_.install("a", FlatpakTree::named("a", "A"));
    look();
    makeContainer("a");
    EXPECT_TRUE(hasNews());
    look();
    hasNews();
    folder_.folder("home/.var/app/a/cache");
    folder_.file("home/.var/app/a/Documents/report.txt");
    EXPECT_FALSE(hasNews());
    fs::rename(folder_ / "home/.var/app/a/Documents", folder_ / "home/.var/app/a/Documents2");
    EXPECT_TRUE(hasNews());
    fs::rename(folder_ / "home/.var", folder_ / "home/.var2");
    EXPECT_TRUE(hasNews());
}

TEST_F(RosterWatchTest, aFileIsBeingWrittenUntilItIsClosed) {
    look();
    const UniqueFd file = *sys::open(entryPath("a.desktop").c_str(), O_WRONLY | O_CREAT, 0600);
    EXPECT_FALSE(hasNews());
    EXPECT_EQ(beingWritten(), std::set<std::string>{entryPath("a.desktop")});
    ASSERT_EQ(::write(file.get(), "[De", 3), 3);
    now_ += RosterWatch::kQuiet - milliseconds(1);
    EXPECT_FALSE(hasNews()) << "it was written to just now";
    EXPECT_EQ(watch_->nextMoment(), now_ + RosterWatch::kQuiet);
    ::close(::dup(file.get()));
    EXPECT_FALSE(hasNews());
    const_cast<UniqueFd&>(file).reset();
    EXPECT_TRUE(hasNews());
    EXPECT_EQ(beingWritten(), std::set<std::string>());
    EXPECT_EQ(watch_->nextMoment(), std::nullopt);
}

TEST_F(RosterWatchTest, aFileThatNobodyClosesIsReadInTheEnd) {
    look();
    const UniqueFd file = *sys::open(entryPath("a.desktop").c_str(), O_WRONLY | O_CREAT, 0600);
    EXPECT_FALSE(hasNews());
    now_ = *watch_->nextMoment();
    EXPECT_TRUE(hasNews());
    EXPECT_EQ(beingWritten(), std::set<std::string>());
    EXPECT_FALSE(hasNews());
}

TEST_F(RosterWatchTest, whatComesWholeIsReadAtOnce) {
    look();
    const auto isReadAtOnce = [&] { return hasNews() && beingWritten().empty(); };
    folder_.file("prepared", entry("P"));
    fs::rename(folder_ / "prepared", entryPath("moved.desktop"));
    EXPECT_TRUE(isReadAtOnce());
    fs::create_hard_link(folder_.file("linked", entry("L")), entryPath("linked.desktop"));
    EXPECT_TRUE(isReadAtOnce());
    fs::create_symlink(folder_ / "linked", entryPath("symbolic.desktop"));
    EXPECT_TRUE(isReadAtOnce());
    fs::remove(entryPath("moved.desktop"));
    EXPECT_TRUE(isReadAtOnce());
    fs::rename(entryPath("linked.desktop"), folder_ / "away");
    EXPECT_TRUE(isReadAtOnce());
    fs::permissions(entryPath("symbolic.desktop"), fs::perms::owner_read, fs::perm_options::replace);
    EXPECT_FALSE(hasNews()) << "what is elsewhere has changed";
}

TEST_F(RosterWatchTest, aPersonsChoiceIsToldOnceItIsWritten) {
    folder_.folder("config");
    look();
    ASSERT_TRUE(PersonalChoices::write(sources_.choicesFile, "a", PersonalChoices::Choice::enabled).ok());
    EXPECT_TRUE(hasNews());
    ASSERT_TRUE(PersonalChoices::write(sources_.choicesFile, "a", PersonalChoices::Choice::disabled).ok());
    EXPECT_TRUE(hasNews());
}

// A queue that was not read in time: what was lost may be anything.
TEST_F(RosterWatchTest, lostEventsAreNews) {
    look();
    std::ifstream limitFile("/proc/sys/fs/inotify/max_queued_events");
    int limit = 0;
    limitFile >> limit;
    ASSERT_GT(limit, 0);
    const UniqueFd file = *sys::open(entryPath("busy.desktop").c_str(), O_WRONLY | O_CREAT, 0600);
    const UniqueFd other = *sys::open(entryPath("other.desktop").c_str(), O_WRONLY | O_CREAT, 0600);
    // Two files in turn: the kernel would fold what happens to one alone.
    for (int i = 0; i < limit / 2 + 2; ++i) {
        ASSERT_EQ(::write(file.get(), "#", 1), 1);
        ASSERT_EQ(::write(other.get(), "#", 1), 1);
    }
    EXPECT_TRUE(hasNews());
    EXPECT_EQ(beingWritten(), std::set<std::string>());
}

}  // namespace
}  // namespace cindral::test
