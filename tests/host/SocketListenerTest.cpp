#include "host/SocketListener.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <cerrno>
#include <csignal>
#include <filesystem>

#include "host/Daemon.h"
#include "host/Descriptor.h"
#include "host/FakeProvider.h"
#include "host/LocalSocket.h"
#include "support/LogCapture.h"
#include "support/TemporaryFolder.h"

namespace cindral {
namespace {

using ::testing::HasSubstr;

/// A host with a listener that is stopped by the test.
class SocketListenerTest : public ::testing::Test {
protected:
    SocketListenerTest() { std::signal(SIGPIPE, SIG_IGN); }
    ~SocketListenerTest() override { stop(); }

    void start(SocketListener::Limits limits = {}) {
        HostOptions options;
        options.command = HostCommand::serve;
        options.storage = folder_ / "Documents";
        options.state = folder_ / "state";
        options.flatpak = false;
        HostProcess::Steps steps;
        steps.stateIsOurs = [&](const std::string& state) -> Result<void> {
            listener_ = std::make_unique<SocketListener>(TRY(DaemonSocket::listenFor(state, environment_)), limits);
            return {};
        };
        auto host = HostProcess::start(
            options, environment_,
            []() -> std::shared_ptr<TesselExtension> { return std::make_shared<test::FakeProvider>(); }, steps);
        ASSERT_TRUE(host.ok()) << host.error().description();
        host_ = *std::move(host);
        ASSERT_TRUE(listener_->start(*host_).ok());
    }
    void stop() {
        if (!listener_) return;
        listener_->stop();
        listener_->waitUntilStopped();
        listener_.reset();
        host_.reset();
    }

    UniqueFd connect() { return *local_socket::connectTo(DaemonSocket::linkIn(folder_ / "state")); }
    static std::string line(int fd) {
        std::string text;
        char c = 0;
        while (true) {
            const auto got = descriptor::read(fd, {&c, 1});
            if (!got.ok() || *got == 0 || c == '\n') return text;
            text += c;
        }
    }
    /// Whether the other end is closed once all is read.
    static bool isOver(int fd) {
        char c = 0;
        const auto got = descriptor::read(fd, {&c, 1});
        return !got.ok() || *got == 0;
    }
    static void ask(int fd, std::string_view method, std::string_view params = "{}") {
        ASSERT_TRUE(descriptor::writeAll(fd, fmt::format(R"({{"jsonrpc":"2.0","id":1,"method":"{}","params":{}}})"
                                                         "\n",
                                                         method, params))
                        .ok());
    }

    const test::LogCapture log_;
    const test::TemporaryFolder folder_;
    const HostEnvironment environment_;
    std::unique_ptr<SocketListener> listener_;
    std::unique_ptr<HostProcess> host_;
};

TEST_F(SocketListenerTest, sendsOtherUsersAway) {
    start({.user = ::geteuid() + 1});
    const UniqueFd stranger = connect();
    EXPECT_THAT(line(stranger.get()), HasSubstr("This daemon serves nobody but the person who started it"));
    EXPECT_TRUE(isOver(stranger.get()));
}

TEST_F(SocketListenerTest, servesSoManyClientsAndNoMore) {
    start({.clientsMax = 2});
    UniqueFd clients[] = {connect(), connect()};
    for (const UniqueFd& client : clients) {
        ask(client.get(), "status");
        EXPECT_THAT(line(client.get()), HasSubstr("result"));
    }
    const UniqueFd third = connect();
    EXPECT_THAT(line(third.get()), HasSubstr("There are too many clients"));
    EXPECT_TRUE(isOver(third.get()));
    clients[0].reset();
    // As soon as it is gone, which is nobody's to wait for, there is room again.
    std::string answer;
    while (answer.find("result") == std::string::npos) {
        const UniqueFd next = connect();
        (void)descriptor::writeAll(next.get(), R"({"jsonrpc":"2.0","id":1,"method":"status"})"
                                               "\n");
        answer = line(next.get());
    }
}

TEST_F(SocketListenerTest, aClientThatEndsSoonIsServedToItsEnd) {
    start();
    const UniqueFd command = connect();
    const UniqueFd browser = connect();
    ask(command.get(), "hello", R"({"endsSoon":true})");
    EXPECT_THAT(line(command.get()), HasSubstr("\"process\""));
    ask(browser.get(), "hello");
    EXPECT_THAT(line(browser.get()), HasSubstr("\"process\""));
    listener_->stop();
    EXPECT_TRUE(isOver(browser.get()));
    ask(command.get(), "status");
    EXPECT_THAT(line(command.get()), HasSubstr("result"));
    EXPECT_FALSE(local_socket::connectTo(DaemonSocket::linkIn(folder_ / "state")).ok());
    // Without its going there would be an end all the same, somewhat later.
    ::shutdown(command.get(), SHUT_RDWR);
    listener_->waitUntilStopped();
}

TEST_F(SocketListenerTest, whoGreetsAnEndingListenerIsToldSo) {
    start();
    const UniqueFd late = connect();
    // What was sent before the end is still answered; whether as before it or as after it is not to be said.
    ask(late.get(), "hello", R"({"endsSoon":true})");
    listener_->stop();
    const std::string answer = line(late.get());
    EXPECT_TRUE(answer.find("isEnding") != std::string::npos || answer.find("process") != std::string::npos) << answer;
}

TEST_F(SocketListenerTest, stopsWithoutHavingHadAClient) {
    start();
    stop();
    EXPECT_FALSE(std::filesystem::exists(std::filesystem::symlink_status(folder_ / "state/socket")));
}

/// One that counts what the daemon asks of it.
class CountingListener final : public DaemonListener {
public:
    explicit CountingListener(std::string& said, bool fails = false) : said_(said), fails_(fails) {}
    Result<void> start(const HostProcess& /*host*/) override {
        said_ += "start ";
        return fails_ ? Result<void>(KsError::posix(EADDRINUSE)) : Result<void>();
    }
    void stop() override { said_ += "stop "; }
    void waitUntilStopped() override { said_ += "wait "; }

private:
    std::string& said_;
    const bool fails_;
};

TEST_F(SocketListenerTest, aDaemonStartsAndStopsAllItsListeners) {
    start();
    std::string said;
    const ServiceManager manager;
    Daemon daemon(*host_, manager);
    for (int i = 0; i < 2; ++i) daemon.add(std::make_unique<CountingListener>(said));
    const UniqueFd stop = *descriptor::makeInterrupt();
    descriptor::interrupt(stop);
    EXPECT_TRUE(daemon.run(stop.get(), [&] { said += "end "; }).ok());
    EXPECT_EQ(said, "start start end stop stop wait wait ");
}

TEST_F(SocketListenerTest, aListenerThatCannotStartEndsTheDaemon) {
    start();
    std::string said;
    const ServiceManager manager;
    Daemon daemon(*host_, manager);
    daemon.add(std::make_unique<CountingListener>(said));
    daemon.add(std::make_unique<CountingListener>(said, /*fails=*/true));
    daemon.add(std::make_unique<CountingListener>(said));
    const UniqueFd never = *descriptor::makeInterrupt();
    const auto served = daemon.run(never.get(), [] {});
    ASSERT_FALSE(served.ok());
    EXPECT_TRUE(served.error().isPosix(EADDRINUSE));
    EXPECT_EQ(said, "start start stop stop stop wait wait wait ");
}

}  // namespace
}  // namespace cindral
