#include "host/DaemonBridge.h"

#include <fmt/format.h>
#include <sys/socket.h>

#include <atomic>
#include <cerrno>
#include <memory>
#include <vector>

#include "host/Descriptor.h"
#include "host/HostError.h"
#include "platform/foundation/BackgroundThread.h"

namespace cindral {
namespace {

/// What the thread that passes the input on has, also when nobody waits for it any more.
struct Way {
    explicit Way(UniqueFd connected) : socket(std::move(connected)) {}
    const UniqueFd socket;
    std::atomic<bool> isInputOver = false;
};

void passInputOn(int input, Way& way) {
    std::vector<char> buffer(descriptor::kReadBytes);
    while (true) {
        const auto got = descriptor::read(input, buffer);
        if (!got.ok() || *got == 0) break;
        if (!descriptor::writeAll(way.socket.get(), {buffer.data(), *got}).ok()) return;
    }
    way.isInputOver.store(true);
    ::shutdown(way.socket.get(), SHUT_WR);
}

}  // namespace

Result<void> bridgeToDaemon(int input, int output, UniqueFd socket) {
    const auto way = std::make_shared<Way>(std::move(socket));
    const UniqueFd never = TRY(descriptor::makeInterrupt());
    // It may read for ever: nobody waits for it.
    if (const int error = startBackgroundThread([way, input] { passInputOn(input, *way); }); error != 0)
        return KsError::posix(error);
    std::vector<char> buffer(descriptor::kReadBytes);
    while (TRY(descriptor::waitForInput(way->socket.get(), output, never.get())) == descriptor::Readiness::input) {
        const auto got = descriptor::read(way->socket.get(), buffer);
        if (!got.ok() || *got == 0) {
            if (way->isInputOver.load()) return {};
            return hostFailure("the connection to the daemon was lost");
        }
        if (const auto written = descriptor::writeAll(output, {buffer.data(), *got}); !written.ok()) {
            if (written.error().isPosix(EPIPE)) return {};
            return hostFailure(fmt::format("can't write to standard output: {}", written.error().reason()));
        }
    }
    return {};
}

}  // namespace cindral
