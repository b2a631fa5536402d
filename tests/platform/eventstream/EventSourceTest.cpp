#include "platform/eventstream/EventSource.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sched.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <csignal>
#include <cstdio>
#include <fstream>
#include <map>
#include <string>
#include <vector>

#include "platform/eventstream/FanotifySource.h"
#include "platform/foundation/Sys.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using test::TemporaryFolder;
using ::testing::AnyOf;
using ::testing::Contains;
using ::testing::IsSupersetOf;
using ::testing::Not;

/// A hint that owns its name.
struct Hint {
    EventHint::Kind kind;
    FileID folder{};
    std::string name{};
    FileID fileID{};

    bool operator==(const Hint&) const = default;
    friend std::ostream& operator<<(std::ostream& out, const Hint& hint) {
        constexpr std::array<const char*, 4> kKinds{"entry", "object", "overflow", "lost"};
        return out << kKinds.at(static_cast<std::size_t>(hint.kind)) << " " << static_cast<std::uint64_t>(hint.folder)
                   << "/" << hint.name << " " << static_cast<std::uint64_t>(hint.fileID);
    }
};

Hint entry(FileID folder, std::string name) {
    return {.kind = EventHint::Kind::entry, .folder = folder, .name = std::move(name)};
}
Hint object(FileID fileID) {
    return {.kind = EventHint::Kind::object, .fileID = fileID};
}
Hint lost(FileID fileID) {
    return {.kind = EventHint::Kind::lost, .fileID = fileID};
}
const Hint kOverflow{.kind = EventHint::Kind::overflow};

UniqueFd opened(const std::string& path, int flags = O_PATH | O_NOFOLLOW) {
    auto fd = sys::open(path.c_str(), flags);
    EXPECT_TRUE(fd.ok()) << path;
    return std::move(fd).value();
}

FileID fileIDOf(const std::string& path) {
    return FileID{sys::statx(AT_FDCWD, path.c_str()).value().fileID};
}

struct Kind {
    std::string name;
    std::function<Result<std::unique_ptr<EventSource>>()> make;
};

std::vector<Kind> allKinds() {
    return {{"inotify", makeInotifySource},
            {"fanotify", [] { return makeFanotifySource(); }},
            {"fanotifyOfOlderKernels", [] { return makeFanotifySourceOf(RenameRecords::halves); }}};
}

Result<void> tryOn(const Kind& kind, const std::string& folder) {
    auto source = TRY(kind.make());
    return source->addRoot(opened(folder, O_RDONLY | O_DIRECTORY).get());
}

/// What this process may use, on the file system of temporary folders.
std::vector<Kind> usableKinds() {
    const TemporaryFolder folder;
    std::vector<Kind> kinds = allKinds();
    std::erase_if(kinds, [&](const Kind& kind) { return !tryOn(kind, folder.path()).ok(); });
    return kinds;
}

TEST(EventSourceKinds, areAllTestedButWhatTheKernelRefuses) {
    const TemporaryFolder folder;
    for (const Kind& kind : allKinds()) {
        const auto tried = tryOn(kind, folder.path());
        if (tried.ok()) continue;
        EXPECT_NE(kind.name, "inotify") << tried.error().description();
        EXPECT_THAT(tried.error().code(), AnyOf(EPERM, EXDEV, EOPNOTSUPP)) << kind.name;
    }
}

/// What a call answers to whoever has no privilege.
template <typename Call>
auto asNobody(Call call) {
    const bool isRoot = ::geteuid() == 0;
    if (isRoot) {
        EXPECT_EQ(::seteuid(65534), 0);
    }
    auto answer = call();
    if (isRoot) {
        EXPECT_EQ(::seteuid(0), 0);
    }
    return answer;
}

TEST(EventSourceKinds, fanotifyIsRefusedToWhoeverHasNoPrivilege) {
    const auto source = asNobody([] { return makeFanotifySource(); });
    ASSERT_FALSE(source.ok());
    EXPECT_TRUE(source.error().isPosix(EPERM)) << source.error().description();
}

TEST(EventSourceKinds, inotifyIsForEverybody) {
    const auto source = asNobody(makeInotifySource);
    ASSERT_TRUE(source.ok());
    EXPECT_EQ((*source)->name(), "inotify");
}

class EventSourceTest : public ::testing::TestWithParam<Kind> {
protected:
    void SetUp() override {
        source_ = GetParam().make().value();
        ASSERT_TRUE(source_->addRoot(opened(root_.path(), O_RDONLY | O_DIRECTORY).get()).ok());
        watchFolder(root_.path());
    }

    FileID watchFolder(const std::string& path) {
        const FileID fileID = fileIDOf(path);
        EXPECT_TRUE(source_->watchFolder(opened(path).get(), fileID).ok()) << path;
        return fileID;
    }
    FileID watchFile(const std::string& path) {
        const FileID fileID = fileIDOf(path);
        EXPECT_TRUE(source_->watchFile(opened(path).get(), fileID).ok()) << path;
        return fileID;
    }
    std::vector<Hint> drain() {
        std::vector<Hint> hints;
        const auto drained = source_->drain([&](const EventHint& hint) {
            hints.push_back(
                {.kind = hint.kind, .folder = hint.folder, .name = std::string(hint.name), .fileID = hint.fileID});
        });
        EXPECT_TRUE(drained.ok());
        return hints;
    }
    /// What comes of an action. What is hinted of other objects of the file system, by others' doing, is not looked at.
    template <typename Action>
    std::vector<Hint> hintsOf(Action action) {
        drain();
        action();
        return drain();
    }
    Hint inRoot(std::string name) const { return entry(fileIDOf(root_.path()), std::move(name)); }
    bool isInotify() const { return source_->name() == "inotify"; }
    static void append(const std::string& path, std::string_view text) { std::ofstream(path, std::ios::app) << text; }

    TemporaryFolder root_;
    TemporaryFolder outside_;
    std::unique_ptr<EventSource> source_;
};

std::string nameOfKind(const ::testing::TestParamInfo<Kind>& info) {
    return info.param.name;
}
INSTANTIATE_TEST_SUITE_P(Kinds, EventSourceTest, ::testing::ValuesIn(usableKinds()), nameOfKind);

TEST_P(EventSourceTest, hasNothingToTellOfWhatDidNotHappen) {
    drain();
    EXPECT_THAT(drain(), Not(Contains(inRoot("a"))));
}

TEST_P(EventSourceTest, tellsANewFile) {
    EXPECT_THAT(hintsOf([&] { root_.file("a"); }), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, tellsAnAppendedFile) {
    const std::string path = root_.file("a");
    EXPECT_THAT(hintsOf([&] { append(path, "more"); }), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, tellsAFileThatIsStillOpen) {
    const UniqueFd file = opened(root_.file("a"), O_WRONLY);
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::write(file.get(), "x", 1), 1); }), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, tellsATruncatedFile) {
    const std::string path = root_.file("a", "long");
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::truncate(path.c_str(), 1), 0); }), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, tellsAFileWrittenThroughAMapWhenItIsClosed) {
    const std::string path = root_.file("a", "mapped");
    const auto write = [&] {
        UniqueFd file = opened(path, O_RDWR);
        void* map = ::mmap(nullptr, 6, PROT_READ | PROT_WRITE, MAP_SHARED, file.get(), 0);
        ASSERT_NE(map, MAP_FAILED);
        file.reset();
        static_cast<char*>(map)[0] = 'M';
        ASSERT_EQ(::munmap(map, 6), 0);
    };
    EXPECT_THAT(hintsOf(write), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, tellsAChangedMode) {
    const std::string path = root_.file("a");
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::chmod(path.c_str(), 0600), 0); }), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, tellsAnExtendedAttribute) {
    const std::string path = root_.file("a");
    const auto set = [&] { ASSERT_EQ(::setxattr(path.c_str(), "user.test", "1", 1, 0), 0); };
    EXPECT_THAT(hintsOf(set), Contains(inRoot("a")));
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::removexattr(path.c_str(), "user.test"), 0); }), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, tellsATimeStamp) {
    const std::string path = root_.file("a");
    const auto set = [&] { ASSERT_EQ(::utimensat(AT_FDCWD, path.c_str(), nullptr, 0), 0); };
    EXPECT_THAT(hintsOf(set), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, tellsARemovedFile) {
    const std::string path = root_.file("a");
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::unlink(path.c_str()), 0); }), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, tellsBothNamesOfARename) {
    const std::string path = root_.file("a");
    const auto rename = [&] { ASSERT_EQ(::rename(path.c_str(), (root_ / "b").c_str()), 0); };
    EXPECT_THAT(hintsOf(rename), IsSupersetOf({inRoot("a"), inRoot("b")}));
}

// The kernel folds what is unread; whoever looks at every name that is told finds how it ended.
TEST_P(EventSourceTest, tellsBothNamesOfRenamesToAndFro) {
    const std::string a = root_.file("a");
    const std::string b = root_ / "b";
    const auto renames = [&] {
        ASSERT_EQ(::rename(a.c_str(), b.c_str()), 0);
        ASSERT_EQ(::rename(b.c_str(), a.c_str()), 0);
        ASSERT_EQ(::rename(a.c_str(), b.c_str()), 0);
    };
    EXPECT_THAT(hintsOf(renames), IsSupersetOf({inRoot("a"), inRoot("b")}));
}

TEST_P(EventSourceTest, tellsAFileMovedIn) {
    const std::string path = outside_.file("a");
    const auto move = [&] { ASSERT_EQ(::rename(path.c_str(), (root_ / "b").c_str()), 0); };
    EXPECT_THAT(hintsOf(move), Contains(inRoot("b")));
}

TEST_P(EventSourceTest, tellsAFileMovedOut) {
    const std::string path = root_.file("a");
    const auto move = [&] { ASSERT_EQ(::rename(path.c_str(), (outside_ / "b").c_str()), 0); };
    EXPECT_THAT(hintsOf(move), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, tellsAFileRenamedOverAnother) {
    const std::string path = root_.file("a");
    root_.file("b");
    const auto rename = [&] { ASSERT_EQ(::rename(path.c_str(), (root_ / "b").c_str()), 0); };
    EXPECT_THAT(hintsOf(rename), IsSupersetOf({inRoot("a"), inRoot("b")}));
}

TEST_P(EventSourceTest, tellsBothNamesOfAnExchange) {
    const std::string a = root_.file("a");
    const std::string b = root_.folder("b");
    const auto exchange = [&] { ASSERT_EQ(::renameat2(AT_FDCWD, a.c_str(), AT_FDCWD, b.c_str(), RENAME_EXCHANGE), 0); };
    EXPECT_THAT(hintsOf(exchange), IsSupersetOf({inRoot("a"), inRoot("b")}));
}

TEST_P(EventSourceTest, tellsAMoveBetweenFolders) {
    const FileID from = watchFolder(root_.folder("from"));
    const FileID to = watchFolder(root_.folder("to"));
    const std::string path = root_.file("from/a");
    const auto move = [&] { ASSERT_EQ(::rename(path.c_str(), (root_ / "to/b").c_str()), 0); };
    EXPECT_THAT(hintsOf(move), IsSupersetOf({entry(from, "a"), entry(to, "b")}));
}

TEST_P(EventSourceTest, tellsAMovedFolderAndGoesOnWithIt) {
    const FileID folder = watchFolder(root_.folder("a"));
    const auto move = [&] { ASSERT_EQ(::rename((root_ / "a").c_str(), (root_ / "b").c_str()), 0); };
    EXPECT_THAT(hintsOf(move), IsSupersetOf({inRoot("a"), inRoot("b"), object(folder)}));
    EXPECT_THAT(hintsOf([&] { root_.file("b/c"); }), Contains(entry(folder, "c")));
}

TEST_P(EventSourceTest, tellsAMovedRootAndGoesOnWithIt) {
    const FileID folder = watchFolder(outside_.folder("a"));
    const auto move = [&] { ASSERT_EQ(::rename((outside_ / "a").c_str(), (outside_ / "b").c_str()), 0); };
    EXPECT_THAT(hintsOf(move), Contains(object(folder)));
    EXPECT_THAT(hintsOf([&] { outside_.file("b/c"); }), Contains(entry(folder, "c")));
}

TEST_P(EventSourceTest, tellsANewFolder) {
    EXPECT_THAT(hintsOf([&] { root_.folder("a"); }), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, tellsARemovedFolderAndTheEndOfItsWatch) {
    const FileID folder = watchFolder(root_.folder("a"));
    const auto remove = [&] { ASSERT_EQ(::rmdir((root_ / "a").c_str()), 0); };
    EXPECT_THAT(hintsOf(remove), IsSupersetOf({inRoot("a"), lost(folder)}));
}

TEST_P(EventSourceTest, tellsAFolderThatAnotherTookThePlaceOf) {
    const FileID folder = watchFolder(root_.folder("a"));
    root_.folder("b");
    const auto rename = [&] { ASSERT_EQ(::rename((root_ / "b").c_str(), (root_ / "a").c_str()), 0); };
    EXPECT_THAT(hintsOf(rename), IsSupersetOf({inRoot("a"), inRoot("b"), lost(folder)}));
}

TEST_P(EventSourceTest, tellsTheModeOfAWatchedFolder) {
    const FileID folder = watchFolder(root_.folder("a"));
    const auto change = [&] { ASSERT_EQ(::chmod((root_ / "a").c_str(), 0700), 0); };
    EXPECT_THAT(hintsOf(change), Contains(object(folder)));
}

TEST_P(EventSourceTest, tellsASymbolicLinkAndASocketFile) {
    const auto make = [&] {
        ASSERT_EQ(::symlink("nowhere", (root_ / "link").c_str()), 0);
        ASSERT_EQ(::mkfifo((root_ / "fifo").c_str(), 0600), 0);
    };
    EXPECT_THAT(hintsOf(make), IsSupersetOf({inRoot("link"), inRoot("fifo")}));
}

TEST_P(EventSourceTest, tellsAnotherNameOfAFile) {
    const std::string path = root_.file("a");
    const auto link = [&] { ASSERT_EQ(::link(path.c_str(), (root_ / "b").c_str()), 0); };
    EXPECT_THAT(hintsOf(link), Contains(inRoot("b")));
}

TEST_P(EventSourceTest, tellsWhatHappensToAWatchedFileUnderANameOutside) {
    const std::string path = root_.file("a");
    const std::string other = outside_ / "b";
    const FileID file = watchFile(path);
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::link(path.c_str(), other.c_str()), 0); }), Contains(object(file)));
    EXPECT_THAT(hintsOf([&] { append(other, "more"); }), Contains(object(file)));
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::truncate(other.c_str(), 0), 0); }), Contains(object(file)));
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::chmod(other.c_str(), 0600), 0); }), Contains(object(file)));
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::unlink(other.c_str()), 0); }), Contains(object(file)));
}

TEST_P(EventSourceTest, tellsOfAWatchedFileThatAnotherTookThePlaceOf) {
    const std::string path = root_.file("a");
    const std::string other = outside_ / "b";
    ASSERT_EQ(::link(path.c_str(), other.c_str()), 0);
    const FileID file = watchFile(path);
    const std::string usurper = outside_.file("c");
    const auto rename = [&] { ASSERT_EQ(::rename(usurper.c_str(), other.c_str()), 0); };
    EXPECT_THAT(hintsOf(rename), Contains(object(file)));
}

TEST_P(EventSourceTest, tellsTheEndOfAWatchedFile) {
    const std::string path = root_.file("a");
    const FileID file = watchFile(path);
    const auto remove = [&] { ASSERT_EQ(::unlink(path.c_str()), 0); };
    EXPECT_THAT(hintsOf(remove), IsSupersetOf({inRoot("a"), lost(file)}));
}

TEST_P(EventSourceTest, tellsAFileThatWasMadeWithoutAName) {
    const UniqueFd file = opened(root_.path(), O_TMPFILE | O_RDWR);
    const FileID fileID{sys::statx(file.get(), "").value().fileID};
    const auto link = [&] {
        const std::string from = "/proc/self/fd/" + std::to_string(file.get());
        ASSERT_EQ(::linkat(AT_FDCWD, from.c_str(), AT_FDCWD, (root_ / "a").c_str(), AT_SYMLINK_FOLLOW), 0);
    };
    EXPECT_THAT(hintsOf(link), Contains(inRoot("a")));
    // Its writer knows it by no name.
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::write(file.get(), "x", 1), 1); }), Contains(object(fileID)));
}

TEST_P(EventSourceTest, tellsNamesOfAnyBytes) {
    for (const std::string& name : {std::string("new\nline"), std::string("\xFF\xFE"), std::string("#12"),
                                    std::string("#12x"), std::string("#"), std::string(255, 'x')})
        EXPECT_THAT(hintsOf([&] { root_.file(name); }), Contains(inRoot(name)));
}

TEST_P(EventSourceTest, tellsNothingOfWhatIsBelowAFolderThatIsNotWatched) {
    root_.folder("a");
    const auto hints = hintsOf([&] { root_.file("a/b"); });
    EXPECT_TRUE(std::ranges::none_of(hints, [](const Hint& hint) { return hint.name == "b"; }));
}

TEST_P(EventSourceTest, tellsAFolderOnceThoughItIsWatchedTwice) {
    const FileID folder = watchFolder(root_.folder("a"));
    EXPECT_EQ(watchFolder(root_ / "a"), folder);
    const auto hints = hintsOf([&] { ASSERT_EQ(::mkdir((root_ / "a/b").c_str(), 0700), 0); });
    EXPECT_EQ(std::ranges::count(hints, entry(folder, "b")), 1);
    EXPECT_EQ(source_->usage().used, isInotify() ? 2U : 1U);
}

TEST_P(EventSourceTest, forgetsAFolder) {
    const FileID folder = watchFolder(root_.folder("a"));
    source_->forget(folder);
    EXPECT_THAT(hintsOf([&] { root_.file("a/b"); }), Not(Contains(entry(folder, "b"))));
    source_->forget(folder);
    watchFolder(root_ / "a");
    EXPECT_THAT(hintsOf([&] { root_.file("a/c"); }), Contains(entry(folder, "c")));
}

TEST_P(EventSourceTest, forgetsAFolderThatIsGone) {
    const FileID folder = watchFolder(root_.folder("a"));
    ASSERT_EQ(::rmdir((root_ / "a").c_str()), 0);
    source_->forget(folder);
    EXPECT_THAT(drain(), Not(Contains(lost(folder))));
}

// File systems give a removed folder's number to the next one.
TEST_P(EventSourceTest, watchesANewFolderUnderTheNumberOfARemovedOne) {
    const FileID number = watchFolder(root_.folder("a"));
    ASSERT_EQ(::rmdir((root_ / "a").c_str()), 0);
    root_.folder("b");
    ASSERT_TRUE(source_->watchFolder(opened(root_ / "b").get(), number).ok());
    EXPECT_THAT(drain(), Not(Contains(lost(number))));
    EXPECT_THAT(hintsOf([&] { root_.file("b/c"); }), Contains(entry(number, "c")));
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::unlink((root_ / "b/c").c_str()), 0); }), Contains(entry(number, "c")));
    EXPECT_THAT(hintsOf([&] { ASSERT_EQ(::rmdir((root_ / "b").c_str()), 0); }), Contains(lost(number)));
}

TEST_P(EventSourceTest, watchesANewFolderUnderTheNumberOfOneThatIsStillThere) {
    const FileID number = watchFolder(root_.folder("a"));
    root_.folder("b");
    ASSERT_TRUE(source_->watchFolder(opened(root_ / "b").get(), number).ok());
    const auto hints = hintsOf([&] {
        root_.file("a/of-a");
        root_.file("b/of-b");
    });
    EXPECT_THAT(hints, Contains(entry(number, "of-b")));
    EXPECT_THAT(hints, Not(Contains(entry(number, "of-a"))));
}

// Done by the receiver while hints of one read are under way.
TEST_P(EventSourceTest, watchesAndForgetsWithinADrain) {
    const FileID root = fileIDOf(root_.path());
    const FileID first = watchFolder(root_.folder("first"));
    drain();
    root_.folder("second");
    root_.file("first/a");
    root_.file("third");
    std::vector<std::string> names;
    ASSERT_TRUE(source_
                    ->drain([&](const EventHint& hint) {
                        if (hint.folder == root) names.emplace_back(hint.name);
                        if (hint.name != "second") return;
                        source_->forget(first);
                        watchFolder(root_ / "second");
                    })
                    .ok());
    EXPECT_THAT(names, Contains("third"));
    const FileID second = fileIDOf(root_ / "second");
    const auto hints = hintsOf([&] {
        root_.file("first/b");
        root_.file("second/b");
    });
    EXPECT_THAT(hints, Contains(entry(second, "b")));
    EXPECT_THAT(hints, Not(Contains(entry(first, "b"))));
}

TEST_P(EventSourceTest, isReadableWhenThereAreHints) {
    drain();
    root_.file("a");
    pollfd descriptor{.fd = source_->pollDescriptor(), .events = POLLIN, .revents = 0};
    EXPECT_EQ(::poll(&descriptor, 1, 0), 1);
}

TEST_P(EventSourceTest, tellsThousandsOfFoldersApart) {
    constexpr int kFolders = 3000;
    std::map<int, FileID> folders;
    for (int i = 0; i < kFolders; ++i) {
        folders[i] = watchFolder(root_.folder("folder " + std::to_string(i)));
        drain();
    }
    const auto makeOneInEach = [&](const std::string& name) {
        for (int i = 0; i < kFolders; ++i) root_.file("folder " + std::to_string(i) + "/" + name);
    };
    const auto foldersToldOf = [&](const std::string& name) {
        std::vector<FileID> told;
        for (const Hint& hint : drain()) {
            if (hint.kind == EventHint::Kind::entry && hint.name == name) told.push_back(hint.folder);
        }
        std::ranges::sort(told);
        told.erase(std::unique(told.begin(), told.end()), told.end());
        return told;
    };
    makeOneInEach("first");
    EXPECT_EQ(foldersToldOf("first").size(), kFolders);
    std::vector<FileID> kept;
    for (const auto& [number, folder] : folders) {
        if (number % 2 == 0)
            source_->forget(folder);
        else
            kept.push_back(folder);
    }
    makeOneInEach("second");
    std::ranges::sort(kept);
    EXPECT_EQ(foldersToldOf("second"), kept);
    EXPECT_EQ(source_->usage().used, isInotify() ? kept.size() + 1 : 1U);
}

// More files than an inotify queue holds: each is told, or that some were not.
TEST_P(EventSourceTest, tellsEveryFileOfAStormOrThatHintsWereLost) {
    std::ifstream limit("/proc/sys/fs/inotify/max_queued_events");
    int files = 0;
    limit >> files;
    ASSERT_GT(files, 0);
    files += 1000;
    drain();
    for (int i = 0; i < files; ++i) {
        const std::string path = root_ / std::to_string(i);
        ASSERT_EQ(::mknod(path.c_str(), S_IFREG | 0600, 0), 0);
    }
    std::vector<bool> told(static_cast<std::size_t>(files));
    const auto hints = drain();
    for (const Hint& hint : hints) {
        if (hint.kind == EventHint::Kind::entry) told[std::stoul(hint.name)] = true;
    }
    EXPECT_EQ(std::ranges::count(hints, kOverflow), isInotify() ? 1 : 0);
    EXPECT_EQ(std::ranges::count(told, false) == 0, !isInotify());
    // And goes on.
    EXPECT_THAT(hintsOf([&] { root_.file("a"); }), Contains(inRoot("a")));
}

TEST_P(EventSourceTest, refusesADescriptorThatIsNotOpen) {
    EXPECT_FALSE(source_->watchFolder(-1, FileID{1}).ok());
    EXPECT_FALSE(source_->watchFile(-1, FileID{1}).ok());
}

// A number that comes again while events of its earlier watch still wait: they are not the new folder's.
TEST(InotifySource, keepsApartTheWatchesThatHadANumberOneAfterTheOther) {
    const TemporaryFolder root;
    const auto source = makeInotifySource().value();
    ASSERT_TRUE(source->watchFolder(opened(root.folder("a")).get(), FileID{1}).ok());
    root.file("a/of-a");
    source->forget(FileID{1});
    // The first number of an instance is 1. Refused by kernels that can't restore processes: then the number is 2.
    constexpr unsigned long kSetNextNumber = _IOW('I', 0, std::int32_t);
    const bool isSame = ::ioctl(source->pollDescriptor(), kSetNextNumber, 1) == 0;
    ASSERT_TRUE(source->watchFolder(opened(root.folder("b")).get(), FileID{2}).ok());
    root.file("b/of-b");
    std::vector<std::string> told;
    const auto receive = [&](const EventHint& hint) { told.emplace_back(hint.name); };
    ASSERT_TRUE(source->drain(receive).ok());
    EXPECT_THAT(told, Contains("of-b")) << (isSame ? "same number" : "another number");
    EXPECT_THAT(told, Not(Contains("of-a")));
    root.file("b/more");
    ASSERT_TRUE(source->drain(receive).ok());
    EXPECT_THAT(told, Contains("more"));
}

/// Runs in a process of its own whose user may have so many watches. Answers whether everything held there.
bool holdsWithWatches(int watches, const std::function<bool()>& check) {
    // Born there: a thread sanitizer has a thread of its own in each process, and only who is alone may go there.
    const auto child =
        static_cast<pid_t>(::syscall(SYS_clone, CLONE_NEWUSER | SIGCHLD, nullptr, nullptr, nullptr, nullptr));
    if (child == 0) {
        std::ofstream limit("/proc/sys/user/max_inotify_watches");
        limit << watches << std::flush;
        ::_exit(limit.good() && check() ? 0 : 1);
    }
    if (child < 0) return false;
    int status = 0;
    EXPECT_EQ(::waitpid(child, &status, 0), child);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

TEST(InotifySource, saysSoAtTheWatchLimitAndGoesOnWhenOthersAreForgotten) {
    const TemporaryFolder root;
    std::vector<UniqueFd> folders;
    for (int i = 0; i < 4; ++i) folders.push_back(opened(root.folder(std::to_string(i))));
    const UniqueFd file = opened(root.file("file"));
    EXPECT_TRUE(holdsWithWatches(3, [&] {
        const auto source = makeInotifySource().value();
        for (int i = 0; i < 3; ++i) {
            if (!source->watchFolder(folders[static_cast<std::size_t>(i)].get(), FileID(i + 1)).ok()) return false;
        }
        const auto refused = source->watchFolder(folders[3].get(), FileID{4});
        if (refused.ok() || !refused.error().isPosix(ENOSPC)) return false;
        const auto refusedFile = source->watchFile(file.get(), FileID{5});
        if (refusedFile.ok() || !refusedFile.error().isPosix(ENOSPC)) return false;
        const auto usage = source->usage();
        if (usage.used != 3 || usage.limit != 3) return false;
        source->forget(FileID{1});
        return source->watchFolder(folders[3].get(), FileID{4}).ok() && source->usage().used == 3;
    }));
}

TEST(InotifySource, refusesToWatchAFileAsAFolder) {
    const TemporaryFolder root;
    const auto source = makeInotifySource().value();
    const auto refused = source->watchFolder(opened(root.file("a")).get(), FileID{1});
    ASSERT_FALSE(refused.ok());
    EXPECT_TRUE(refused.error().isPosix(ENOTDIR));
}

class FanotifySourceTest : public ::testing::TestWithParam<Kind> {};

std::vector<Kind> usableFanotifyKinds() {
    auto kinds = usableKinds();
    std::erase_if(kinds, [](const Kind& kind) { return kind.name == "inotify"; });
    return kinds;
}
GTEST_ALLOW_UNINSTANTIATED_PARAMETERIZED_TEST(FanotifySourceTest);
INSTANTIATE_TEST_SUITE_P(Kinds, FanotifySourceTest, ::testing::ValuesIn(usableFanotifyKinds()), nameOfKind);

TEST_P(FanotifySourceTest, marksAFileSystemOnce) {
    const TemporaryFolder a;
    const TemporaryFolder b;
    const auto source = GetParam().make().value();
    for (const std::string& path : {a.path(), b.path(), a.path()})
        ASSERT_TRUE(source->addRoot(opened(path, O_RDONLY | O_DIRECTORY).get()).ok());
    EXPECT_EQ(source->usage().used, 1U);
    EXPECT_EQ(source->usage().limit, 0U);
}

TEST_P(FanotifySourceTest, isRefusedWhereFilesHaveNoHandles) {
    const auto source = GetParam().make().value();
    const auto refused = source->addRoot(opened("/proc", O_RDONLY | O_DIRECTORY).get());
    ASSERT_FALSE(refused.ok());
    EXPECT_TRUE(refused.error().isPosix(EOPNOTSUPP)) << refused.error().description();
}

// What is then done to the file under that name is told once it is watched.
TEST_P(FanotifySourceTest, tellsAFileThatIsNotWatchedWhenItGetsANameOutside) {
    const TemporaryFolder root;
    const TemporaryFolder outside;
    const auto source = GetParam().make().value();
    ASSERT_TRUE(source->addRoot(opened(root.path(), O_RDONLY | O_DIRECTORY).get()).ok());
    const std::string path = root.file("a");
    std::vector<FileID> objects;
    ASSERT_EQ(::link(path.c_str(), (outside / "b").c_str()), 0);
    ASSERT_TRUE(source->drain([&](const EventHint& hint) { objects.push_back(hint.fileID); }).ok());
    EXPECT_THAT(objects, Contains(fileIDOf(path)));
}

}  // namespace
}  // namespace cindral
