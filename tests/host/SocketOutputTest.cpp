#include "host/SocketOutput.h"

#include <gtest/gtest.h>
#include <sys/socket.h>

#include <cerrno>
#include <thread>
#include <vector>

#include "host/Descriptor.h"
#include "platform/foundation/UniqueFd.h"
#include "support/LogCapture.h"

namespace cindral {
namespace {

constexpr std::chrono::milliseconds kNoPatience{0};
constexpr std::chrono::hours kMuchPatience{1};

class SocketOutputTest : public ::testing::Test {
protected:
    SocketOutputTest() {
        int fds[2];
        if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) std::abort();
        ours_.reset(fds[0]);
        clients_.reset(fds[1]);
    }

    /// What comes, until that many bytes are there or the connection ends.
    std::string read(std::size_t count) {
        std::string text;
        std::vector<char> buffer(65'536);
        while (text.size() < count) {
            const auto got =
                descriptor::read(clients_.get(), std::span(buffer).first(std::min(buffer.size(), count - text.size())));
            if (!got.ok() || *got == 0) break;
            text.append(buffer.data(), *got);
        }
        return text;
    }
    static std::string line(std::size_t bytes, char letter) { return std::string(bytes - 1, letter) + "\n"; }

    UniqueFd ours_;
    UniqueFd clients_;
};

TEST_F(SocketOutputTest, writesAtOnceWhatTheSocketTakes) {
    SocketOutput output(ours_.get());
    output.write("a\n");
    output.write("b\n");
    EXPECT_EQ(read(4), "a\nb\n");
    output.finish();
    EXPECT_FALSE(output.error());
}

TEST_F(SocketOutputTest, keepsWhatTheSocketDoesNotTakeInItsOrder) {
    SocketOutput output(ours_.get());
    std::string expected;
    for (char letter = 'a'; letter <= 'z'; ++letter) {
        expected += line(100'000, letter);
        output.write(line(100'000, letter));
    }
    EXPECT_EQ(read(expected.size()), expected);
    output.finish();
}

TEST_F(SocketOutputTest, linesOfManyThreadsStayWhole) {
    constexpr int kThreads = 4;
    constexpr int kLines = 200;
    constexpr std::size_t kBytes = 5'000;
    SocketOutput output(ours_.get());
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i) {
        threads.emplace_back([&, i] {
            for (int j = 0; j < kLines; ++j) output.write(line(kBytes, static_cast<char>('a' + i)));
        });
    }
    const std::string text = read(kThreads * kLines * kBytes);
    for (auto& thread : threads) thread.join();
    ASSERT_EQ(text.size(), kThreads * kLines * kBytes);
    for (std::size_t at = 0; at < text.size(); at += kBytes) EXPECT_EQ(text.substr(at, kBytes), line(kBytes, text[at]));
}

TEST_F(SocketOutputTest, oneLineMayBeLongerThanTheBound) {
    SocketOutput output(ours_.get(), kMuchPatience);
    const std::string giant = line(SocketOutput::kBacklogBytesMax * 2, 'x');
    output.write(giant);
    output.write("after\n");
    EXPECT_EQ(read(giant.size() + 6), giant + "after\n");
}

// As slowly as it likes: what counts is that it takes something.
TEST_F(SocketOutputTest, dropsAClientThatDoesNotReadAndNoOther) {
    const test::LogCapture log;
    SocketOutput output(ours_.get(), kNoPatience);
    output.write(line(SocketOutput::kBacklogBytesMax / 2, 'x'));
    output.write(line(SocketOutput::kBacklogBytesMax, 'y'));
    output.finish();
    EXPECT_FALSE(output.error()) << "that is the client's own affair";
    // What the socket held is still there; then the connection is over, for those who read from the client as well.
    EXPECT_LT(read(SocketOutput::kBacklogBytesMax).size(), SocketOutput::kBacklogBytesMax / 2);
    std::vector<char> buffer(1);
    EXPECT_EQ(*descriptor::read(ours_.get(), buffer), 0U);
    output.write("more\n");
    output.waitForRoom();
}

TEST_F(SocketOutputTest, waitsForRoomUntilTheClientHasRead) {
    SocketOutput output(ours_.get(), kMuchPatience);
    output.waitForRoom();
    const std::string much = line(SocketOutput::kRoomBytes * 2, 'x');
    output.write(much);
    std::thread reader([&] { EXPECT_EQ(read(much.size()), much); });
    output.waitForRoom();
    reader.join();
}

TEST_F(SocketOutputTest, waitsForRoomInVainForAClientThatDoesNotRead) {
    SocketOutput output(ours_.get(), kNoPatience);
    output.write(line(SocketOutput::kRoomBytes * 2, 'x'));
    output.waitForRoom();
}

TEST_F(SocketOutputTest, keepsLittleForAsLongAsItTakes) {
    SocketOutput output(ours_.get(), kNoPatience);
    const std::string much = line(SocketOutput::kBacklogBytesMax / 2, 'x');
    output.write(much);
    EXPECT_EQ(read(much.size()), much);
}

TEST_F(SocketOutputTest, inAHurryDropsAClientThatLeavesLittleLying) {
    const test::LogCapture log;
    SocketOutput output(ours_.get(), kNoPatience);
    output.write(line(SocketOutput::kRoomBytes, 'x'));
    output.hurry();
    output.finish();
    EXPECT_LT(read(SocketOutput::kRoomBytes).size(), SocketOutput::kRoomBytes);
}

TEST_F(SocketOutputTest, aClientThatIsGoneIsNoError) {
    SocketOutput output(ours_.get());
    output.write(line(SocketOutput::kRoomBytes, 'x'));
    clients_.reset();
    output.finish();
    output.write("more\n");
    EXPECT_FALSE(output.error());
}

TEST_F(SocketOutputTest, endsWithMuchUnsent) {
    SocketOutput output(ours_.get());
    output.write(line(SocketOutput::kRoomBytes, 'x'));
}

}  // namespace
}  // namespace cindral
