#include "platform/foundation/Log.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <ctime>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/foundation/UniqueFd.h"
#include "support/LogCapture.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using test::LogCapture;
using test::TemporaryFolder;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::MatchesRegex;
using ::testing::SizeIs;

/// Puts another file in the place of standard error while it lives.
class StandardErrorAs {
public:
    explicit StandardErrorAs(int fd) : saved_(::dup(STDERR_FILENO)) { ::dup2(fd, STDERR_FILENO); }
    ~StandardErrorAs() { ::dup2(saved_.get(), STDERR_FILENO); }
    StandardErrorAs(const StandardErrorAs&) = delete;
    StandardErrorAs& operator=(const StandardErrorAs&) = delete;

private:
    UniqueFd saved_;
};

/// Puts an environment variable back.
class Environment {
public:
    Environment(const char* name, const std::string& value) : name_(name) {
        if (const char* const before = ::getenv(name)) before_ = before;
        ::setenv(name, value.c_str(), 1);
        log::configureFromEnvironment();
    }
    ~Environment() {
        if (before_) {
            ::setenv(name_, before_->c_str(), 1);
        } else {
            ::unsetenv(name_);
        }
        log::configureFromEnvironment();
    }
    Environment(const Environment&) = delete;
    Environment& operator=(const Environment&) = delete;

private:
    const char* name_;
    std::optional<std::string> before_;
};

class LogTest : public ::testing::Test {
protected:
    ~LogTest() override { log::setLevel(before_); }

    /// What the action writes to standard error.
    template <typename Action>
    std::string written(const Action& action) const {
        {
            const StandardErrorAs redirected(file_.get());
            action();
        }
        std::string text(static_cast<std::size_t>(::lseek(file_.get(), 0, SEEK_END)), '\0');
        EXPECT_EQ(::pread(file_.get(), text.data(), text.size(), 0), static_cast<ssize_t>(text.size()));
        EXPECT_EQ(::ftruncate(file_.get(), 0), 0);
        return text;
    }

    /// The message's part of the one line that a message is written as.
    std::string writtenMessage(std::string_view message) const {
        const std::string line = written([&] { log::write(LogLevel::error, message); });
        const auto begin = line.find(" error ");
        if (begin == std::string::npos || !line.ends_with('\n')) return "not a line: " + line;
        return line.substr(begin + 7, line.size() - begin - 8);
    }

    static std::vector<std::string> linesOf(const std::string& text) {
        std::vector<std::string> lines;
        std::istringstream stream(text);
        for (std::string line; std::getline(stream, line);) lines.push_back(line);
        return lines;
    }

    /// Of a section's opening line.
    static std::uint64_t numberOf(const LogCapture::Line& line) {
        return std::stoull(line.second.substr(std::string_view("[DEBUG] ┏").size()));
    }

    const LogLevel before_ = log::level();
    TemporaryFolder folder_;
    UniqueFd file_{::open((folder_ / "stderr").c_str(), O_RDWR | O_CREAT | O_APPEND | O_CLOEXEC, 0600)};
};

TEST_F(LogTest, prefixesEachLineWithItsLevel) {
    const LogCapture capture;
    logDebug("one {}", 1);
    logInfo("two");
    logError("couldn't set putback xattr ({})", "it's gone");
    EXPECT_THAT(
        capture.lines(),
        ElementsAre(LogCapture::Line(LogLevel::debug, "[DEBUG] one 1"), LogCapture::Line(LogLevel::info, "[INFO] two"),
                    LogCapture::Line(LogLevel::error, "[ERROR] couldn't set putback xattr (it's gone)")));
}

TEST_F(LogTest, prefixesAnEmptyMessageWithThePrefixAndABlank) {
    const LogCapture capture;
    logDebug("{}", "");
    logInfo("{}", "");
    logError("{}", "");
    EXPECT_THAT(capture.lines(),
                ElementsAre(LogCapture::Line(LogLevel::debug, "[DEBUG] "), LogCapture::Line(LogLevel::info, "[INFO] "),
                            LogCapture::Line(LogLevel::error, "[ERROR] ")));
}

TEST_F(LogTest, leavesAPlainLineWithoutAPrefix) {
    const LogCapture capture;
    logPlain(LogLevel::error, "can't get device ID for \"{}\"; {}", "/a", errnoText(ENOENT));
    EXPECT_THAT(capture.lines(),
                ElementsAre(LogCapture::Line(LogLevel::error, "can't get device ID for \"/a\"; ENOENT (2)")));
}

TEST_F(LogTest, keepsTheFrameworksLogApart) {
    const LogCapture capture;
    logFrameworkDefault(LogLevel::error, "[ERROR] can't find bundle proxy at {}", "file:///a");
    logError("other");
    EXPECT_TRUE(capture.containsOnFrameworkLog(LogLevel::error, "[ERROR] can't find bundle proxy at file:///a"));
    EXPECT_FALSE(capture.containsOnFrameworkLog(LogLevel::error, "[ERROR] other"));
    EXPECT_THAT(capture.lines(), SizeIs(2));
}

TEST_F(LogTest, writesTimeLevelAndMessage) {
    log::setLevel(LogLevel::debug);
    const std::string text = written([] {
        logDebug("a");
        logInfo("b");
        logPlain(LogLevel::error, "c");
    });
    const std::string time = "[0-9]{4}-[0-9]{2}-[0-9]{2}T[0-9]{2}:[0-9]{2}:[0-9]{2}\\.[0-9]{6}Z";
    EXPECT_THAT(linesOf(text), ElementsAre(MatchesRegex(time + " debug \\[DEBUG\\] a"),
                                           MatchesRegex(time + " info \\[INFO\\] b"), MatchesRegex(time + " error c")));
    EXPECT_TRUE(text.ends_with('\n'));
}

TEST_F(LogTest, writesTheTimeOfTheClockInUTC) {
    // Not time(), whose clock is a tick behind the one that is written.
    const auto now = [] {
        timespec time{};
        ::clock_gettime(CLOCK_REALTIME, &time);
        return time.tv_sec;
    };
    const std::time_t before = now();
    const std::string text = written([] { logError("a"); });
    const std::time_t after = now();
    tm parts{};
    ASSERT_NE(::strptime(text.c_str(), "%Y-%m-%dT%H:%M:%S", &parts), nullptr) << text;
    EXPECT_GE(::timegm(&parts), before);
    EXPECT_LE(::timegm(&parts), after);
}

TEST_F(LogTest, dropsWhatIsBelowTheLevel) {
    log::setLevel(LogLevel::error);
    EXPECT_FALSE(log::enabled(LogLevel::info));
    const std::string text = written([] {
        logDebug("a");
        logInfo("b");
        logPlain(LogLevel::info, "c");
        log::write(LogLevel::info, "d");
        logError("e");
    });
    EXPECT_THAT(linesOf(text), ElementsAre(HasSubstr("[ERROR] e")));
}

// Formatting costs, and the text of an item may cost system calls.
TEST_F(LogTest, composesNoMessageThatIsDropped) {
    log::setLevel(LogLevel::error);
    const LogSection section("also {}", "this");
    EXPECT_EQ(written([] { logDebug("{}", std::string(1000, 'x')); }), "");
}

TEST_F(LogTest, takesTheLevelFromTheEnvironment) {
    const auto levelFor = [](const char* value) {
        const Environment environment("CINDRAL_LOG", value);
        return log::level();
    };
    EXPECT_EQ(levelFor("debug"), LogLevel::debug);
    EXPECT_EQ(levelFor("info"), LogLevel::info);
    EXPECT_EQ(levelFor("error"), LogLevel::error);
    EXPECT_EQ(levelFor(""), LogLevel::info);
    EXPECT_EQ(levelFor("loud"), LogLevel::info);
}

TEST_F(LogTest, escapesControlCharacters) {
    EXPECT_EQ(writtenMessage("a\nb\rc\td\x7f"), R"(a\x0ab\x0dc\x09d\x7f)");
    EXPECT_EQ(writtenMessage(std::string_view("\0\x1b[2J", 5)), R"(\x00\x1b[2J)");
    EXPECT_EQ(writtenMessage("next\u0085line\u009b\u00a0"), "next\\xc2\\x85line\\xc2\\x9b\u00a0");
    EXPECT_EQ(writtenMessage("line\u2028paragraph\u2029\u202a"), "line\\xe2\\x80\\xa8paragraph\\xe2\\x80\\xa9\u202a");
}

TEST_F(LogTest, escapesWhatIsNotUTF8) {
    EXPECT_EQ(writtenMessage("caf\xe9"), R"(caf\xe9)");
    EXPECT_EQ(writtenMessage("\xc0\x80 \xc1\xbf"), R"(\xc0\x80 \xc1\xbf)");          // Overlong, two bytes.
    EXPECT_EQ(writtenMessage("\xe0\x9f\xbf"), R"(\xe0\x9f\xbf)");                    // Overlong, three bytes.
    EXPECT_EQ(writtenMessage("\xf0\x8f\xbf\xbf"), R"(\xf0\x8f\xbf\xbf)");            // Overlong, four bytes.
    EXPECT_EQ(writtenMessage("\xed\xa0\x80"), R"(\xed\xa0\x80)");                    // A surrogate.
    EXPECT_EQ(writtenMessage("\xf4\x90\x80\x80 \xf5"), R"(\xf4\x90\x80\x80 \xf5)");  // Beyond the last code point.
    EXPECT_EQ(writtenMessage("\xe2\x94"), R"(\xe2\x94)");                            // Cut short.
    EXPECT_EQ(writtenMessage("\x80z"), R"(\x80z)");                                  // A continuation of nothing.
}

TEST_F(LogTest, leavesTextAsItIs) {
    const std::string text = "plain ~ \\x41 \u00e9 \u20ac \ud7ff\ue000 \U00010000 \U0010ffff \u250f17";
    EXPECT_EQ(writtenMessage(text), text);
}

TEST_F(LogTest, writesAMessageOfAnyLength) {
    const std::string message(3'000'000, 'm');
    EXPECT_EQ(writtenMessage(message), message);
}

// A pipe takes a long line in parts; another thread's line must not come between them.
TEST_F(LogTest, writesWholeLinesFromManyThreads) {
    constexpr int kThreads = 4;
    constexpr int kLines = 20;
    constexpr std::size_t kLength = 100'000;
    std::array<int, 2> ends{};
    ASSERT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
    const UniqueFd source(ends[0]);
    UniqueFd target(ends[1]);
    std::string text;
    std::thread reader([&] {
        std::array<char, 65536> buffer{};
        for (ssize_t count = 0; (count = ::read(source.get(), buffer.data(), buffer.size())) > 0;)
            text.append(buffer.data(), static_cast<std::size_t>(count));
    });
    {
        const StandardErrorAs redirected(target.get());
        target.reset();
        std::vector<std::thread> writers;
        for (int i = 0; i < kThreads; ++i) {
            writers.emplace_back([letter = static_cast<char>('a' + i)] {
                for (int line = 0; line < kLines; ++line) log::write(LogLevel::error, std::string(kLength, letter));
            });
        }
        for (std::thread& writer : writers) writer.join();
    }
    reader.join();
    const auto lines = linesOf(text);
    EXPECT_THAT(lines, SizeIs(kThreads * kLines));
    for (const std::string& line : lines) {
        ASSERT_GT(line.size(), kLength);
        EXPECT_EQ(line.substr(line.size() - kLength), std::string(kLength, line.back()));
    }
}

TEST_F(LogTest, writesPrioritiesToTheJournal) {
    struct stat status {};
    ASSERT_EQ(::fstat(file_.get(), &status), 0);
    const Environment environment("JOURNAL_STREAM", fmt::format("{}:{}", status.st_dev, status.st_ino));
    log::setLevel(LogLevel::debug);
    EXPECT_EQ(written([] {
                  logDebug("a");
                  logInfo("b");
                  logError("c");
              }),
              "<7>debug [DEBUG] a\n<6>info [INFO] b\n<3>error [ERROR] c\n");
}

TEST_F(LogTest, writesTimesWhereTheJournalIsAnotherFile) {
    struct stat status {};
    ASSERT_EQ(::fstat(file_.get(), &status), 0);
    for (const std::string& stream :
         {fmt::format("{}:{}", status.st_dev, status.st_ino + 1),
          fmt::format("{}:{}", status.st_dev + 1, status.st_ino), fmt::format("{}", status.st_dev),
          fmt::format("{}:{}x", status.st_dev, status.st_ino), std::string(":")}) {
        const Environment environment("JOURNAL_STREAM", stream);
        EXPECT_THAT(written([] { logError("a"); }), ::testing::StartsWith("2")) << stream;
    }
}

TEST_F(LogTest, goesOnWhenStandardErrorIsClosed) {
    std::array<int, 2> ends{};
    ASSERT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
    ::close(ends[0]);
    {
        const UniqueFd target(ends[1]);
        const StandardErrorAs redirected(target.get());
        logError("nobody reads this");
        ::close(STDERR_FILENO);
        logError("nor this");
    }
    sigset_t pending;
    ASSERT_EQ(::sigpending(&pending), 0);
    EXPECT_EQ(::sigismember(&pending, SIGPIPE), 0);
}

TEST_F(LogTest, goesOnWhenStandardErrorIsFull) {
    const UniqueFd full(::open("/dev/full", O_WRONLY | O_CLOEXEC));
    ASSERT_TRUE(full);
    const StandardErrorAs redirected(full.get());
    logError("lost");
}

// A pipe that does not block takes a part of a line: what comes later begins on a line of its own.
TEST_F(LogTest, endsALineThatWasCutShort) {
    std::array<int, 2> ends{};
    ASSERT_EQ(::pipe2(ends.data(), O_CLOEXEC | O_NONBLOCK), 0);
    const UniqueFd source(ends[0]);
    const UniqueFd target(ends[1]);
    const auto drained = [&] {
        std::string text(1'000'000, '\0');
        std::size_t size = 0;
        for (ssize_t count = 0; (count = ::read(source.get(), text.data() + size, text.size() - size)) > 0;)
            size += static_cast<std::size_t>(count);
        text.resize(size);
        return text;
    };
    std::string first;
    std::string second;
    {
        const StandardErrorAs redirected(target.get());
        log::write(LogLevel::error, std::string(500'000, 'x'));
        log::write(LogLevel::error, "lost as a whole");
        first = drained();
        log::write(LogLevel::error, "after");
        second = drained();
    }
    EXPECT_FALSE(first.ends_with('\n'));
    EXPECT_THAT(second, ::testing::StartsWith("\n"));
    EXPECT_THAT(second, ::testing::EndsWith(" error after\n"));
    EXPECT_EQ(writtenMessage("whole again"), "whole again");
}

TEST_F(LogTest, leavesErrnoAlone) {
    const UniqueFd full(::open("/dev/full", O_WRONLY | O_CLOEXEC));
    const StandardErrorAs redirected(full.get());
    errno = ESTALE;
    logError("lost");
    EXPECT_EQ(errno, ESTALE);
}

TEST_F(LogTest, showsTheObserverTheMessageAsItIs) {
    const LogCapture capture;
    log::write(LogLevel::info, "two\nlines\xff");
    EXPECT_TRUE(capture.contains(LogLevel::info, "two\nlines\xff"));
}

// An observer reads its owner's members: it must be safe to take the owner down after taking the observer away.
TEST_F(LogTest, callsNoObserverThatWasTakenAway) {
    log::setLevel(LogLevel::error);
    std::atomic<bool> ends = false;
    std::thread writer([&] {
        const UniqueFd null(::open("/dev/null", O_WRONLY | O_CLOEXEC));
        const StandardErrorAs redirected(null.get());
        while (!ends) logError("a");
    });
    for (int i = 0; i < 20; ++i) {
        auto seen = std::make_unique<std::atomic<std::uint64_t>>(0);
        log::setObserver([&](LogLevel, std::string_view, LogChannel) { ++*seen; });
        while (*seen == 0) std::this_thread::yield();
        log::setObserver(nullptr);
        seen.reset();
    }
    ends = true;
    writer.join();
}

TEST_F(LogTest, printsASectionsNumberInDecimal) {
    const LogCapture capture;
    openLogSection(17, "enumerate items");
    closeLogSection(17);
    EXPECT_THAT(capture.lines(), ElementsAre(LogCapture::Line(LogLevel::debug, "[DEBUG] ┏17 enumerate items"),
                                             LogCapture::Line(LogLevel::debug, "[DEBUG] ┗17")));
}

TEST_F(LogTest, bracketsAScopeWithOneNumber) {
    const LogCapture capture;
    {
        const LogSection section("rename {} to {}", "a", "b");
        logDebug("inside");
    }
    const auto lines = capture.lines();
    ASSERT_THAT(lines, SizeIs(3));
    ASSERT_THAT(lines[0].second, MatchesRegex("\\[DEBUG\\] ┏[0-9]+ rename a to b"));
    EXPECT_EQ(lines[1].second, "[DEBUG] inside");
    EXPECT_EQ(lines[2].second, fmt::format("[DEBUG] ┗{}", numberOf(lines[0])));
}

TEST_F(LogTest, numbersSectionsUpwards) {
    const std::uint64_t first = newLogSection();
    EXPECT_GT(first, 0U);
    EXPECT_EQ(newLogSection(), first + 1);
}

TEST_F(LogTest, givesSectionsOnManyThreadsDifferentNumbers) {
    constexpr std::size_t kThreads = 8;
    constexpr std::size_t kSections = 500;
    std::array<std::vector<std::uint64_t>, kThreads> numbers;
    std::vector<std::thread> threads;
    for (auto& own : numbers) {
        threads.emplace_back([&own] {
            for (std::size_t i = 0; i < kSections; ++i) own.push_back(newLogSection());
        });
    }
    for (std::thread& thread : threads) thread.join();
    std::set<std::uint64_t> all;
    for (const auto& own : numbers) {
        EXPECT_TRUE(std::ranges::is_sorted(own, std::less_equal<>())) << "strictly increasing on each thread";
        all.insert(own.begin(), own.end());
    }
    EXPECT_THAT(all, SizeIs(kThreads * kSections));
}

// Two sections that are open at the same time: each closing line repeats its own number.
TEST_F(LogTest, closesConcurrentSectionsWithTheirOwnNumbers) {
    const LogCapture capture;
    {
        std::unique_ptr<LogSection> outer(new LogSection("outer"));
        std::thread other([&] {
            const LogSection inner("inner");
            outer.reset();
        });
        other.join();
    }
    const auto lines = capture.lines();
    ASSERT_THAT(lines, SizeIs(4));
    EXPECT_NE(numberOf(lines[0]), numberOf(lines[1]));
    EXPECT_EQ(lines[2].second, fmt::format("[DEBUG] ┗{}", numberOf(lines[0])));
    EXPECT_EQ(lines[3].second, fmt::format("[DEBUG] ┗{}", numberOf(lines[1])));
}

TEST(ErrnoText, namesTheSymbolAndTheNumber) {
    EXPECT_EQ(errnoText(ENOENT), "ENOENT (2)");
    EXPECT_EQ(errnoText(ESTALE), "ESTALE (116)");
    EXPECT_EQ(errnoText(99999), "unknown (99999)");
}

}  // namespace
}  // namespace cindral
