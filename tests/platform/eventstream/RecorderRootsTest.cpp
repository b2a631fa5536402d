#include <gmock/gmock.h>

#include <algorithm>

#include "RecorderFixture.h"
#include "platform/eventstream/RootPaths.h"

namespace cindral::test {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using Paths = std::vector<std::string>;

/// A recorder of the storage, and of a second root that comes and goes.
class RecorderRootsTest : public RecorderTest {
protected:
    RecorderRootsTest() : second_(folder_.folder("app/Documents")) { addSecond(); }
    ~RecorderRootsTest() override { RootDirectories::shared().remove(second_); }

    void addSecond() { secondRoot_ = *RootDirectories::shared().add(second_, RootPolicy::applicationContainer); }
    void setRoots(bool withSecond) {
        Recorder::Roots roots{root_};
        if (withSecond) roots.push_back(secondRoot_);
        const Result<void> set = recorder().setRoots(std::move(roots));
        ASSERT_TRUE(set.ok()) << set.error().description();
    }
    std::string inSecond(std::string_view name) const { return second_ + "/" + std::string(name); }
    void listInSecond(std::string_view name) { list("../app/Documents/" + std::string(name)); }
    /// Whole paths of what departed since the event.
    Paths departures(std::uint64_t after) {
        EXPECT_TRUE(recorder().drain().ok());
        const auto batch = recorder().pathEvents(after, 1'000);
        EXPECT_TRUE(batch.ok());
        Paths paths;
        for (const Event& event : batch->events) {
            if (event.flags & EventFlags::removed) paths.push_back(event.path);
        }
        std::ranges::sort(paths);
        return paths;
    }

    std::string second_;
    std::shared_ptr<const RootDirectory> secondRoot_;
};

TEST_P(RecorderRootsTest, whatWasInARootThatWentIsToldOfUnderItsPath) {
    folder_.file("app/Documents/.Trash/a.txt");
    folder_.file("app/Documents/b.txt");
    start();
    setRoots(/*withSecond=*/true);
    listInSecond(".Trash/a.txt");
    listInSecond("b.txt");
    const std::uint64_t before = recorder().currentEventID();
    setRoots(/*withSecond=*/false);
    EXPECT_THAT(departures(before), ElementsAre(inSecond(".Trash/a.txt"), inSecond("b.txt")));
    restartAll();
    EXPECT_THAT(departures(before), ElementsAre(inSecond(".Trash/a.txt"), inSecond("b.txt")));
    restartAll();
    EXPECT_THAT(departures(before), ElementsAre(inSecond(".Trash/a.txt"), inSecond("b.txt")));
}

TEST_P(RecorderRootsTest, whatWasInARootThatWentMeanwhileIsToldOfUnderItsPath) {
    folder_.file("app/Documents/.Trash/a.txt");
    start();
    setRoots(/*withSecond=*/true);
    listInSecond(".Trash/a.txt");
    const std::uint64_t before = recorder().currentEventID();
    // The next one begins with the storage alone.
    restartAll();
    EXPECT_THAT(departures(before), ElementsAre(inSecond(".Trash/a.txt")));
    restartAll();
    EXPECT_THAT(departures(before), ElementsAre(inSecond(".Trash/a.txt")));
}

TEST_P(RecorderRootsTest, aRootThatComesBackIsToldOfAsItIs) {
    folder_.file("app/Documents/a.txt");
    start();
    for (int i = 0; i < 3; ++i) {
        const std::uint64_t before = recorder().currentEventID();
        setRoots(/*withSecond=*/true);
        listInSecond("a.txt");
        EXPECT_THAT(departures(before), IsEmpty());
        setRoots(/*withSecond=*/false);
        EXPECT_THAT(departures(before), ElementsAre(inSecond("a.txt")));
    }
}

INSTANTIATE_TEST_SUITE_P(Inotify, RecorderRootsTest, ::testing::Values(Recorder::Choice::inotify),
                         [](const auto&) { return "byInotify"; });

// Root paths

TEST(RootPaths, decodesWhatItEncoded) {
    const RootPaths current{{FileID{12}, "/home/a/Documents"}, {FileID{~0ULL}, "/odd\nname \xFF"}};
    const RootPaths former{{FileID{3}, "/"}};
    RootPaths all = current;
    all.insert(former.begin(), former.end());
    EXPECT_EQ(decodeRootPaths(encodeRootPaths(current, former)), all);
    EXPECT_EQ(decodeRootPaths({}), RootPaths());
}

TEST(RootPaths, keepsTheCurrentOnesWhereThereIsNoRoomForAll) {
    const std::string longPath = "/" + std::string(4'000, 'x');
    RootPaths former;
    for (std::uint64_t i = 0; i < 30; ++i) former[FileID{i}] = longPath;
    const RootPaths current{{FileID{100}, "/current"}};
    const Bytes bytes = encodeRootPaths(current, former);
    EXPECT_LE(bytes.size(), 65'536u);
    const RootPaths decoded = decodeRootPaths(bytes);
    EXPECT_EQ(decoded.at(FileID{100}), "/current");
    EXPECT_GT(decoded.size(), 10u);
    EXPECT_LT(decoded.size(), 31u);
}

TEST(RootPaths, leavesOutWhatIsNone) {
    const auto decoded = [](std::string_view text) { return decodeRootPaths(std::as_bytes(std::span(text))); };
    using namespace std::string_view_literals;
    const RootPaths one{{FileID{1}, "/a"}};
    EXPECT_EQ(decoded("1 /a\0"sv), one);
    EXPECT_EQ(decoded("x /b\0001 /a\000 /c\0002\0003 d\0004/e\0005 /cut"sv), one);
    EXPECT_EQ(decoded("99999999999999999999 /b\0"sv), RootPaths());
}

}  // namespace
}  // namespace cindral::test
