#include "host/Daemon.h"

#include <poll.h>

#include <algorithm>
#include <cerrno>
#include <chrono>

#include "platform/foundation/SerialQueue.h"

namespace cindral {

Result<void> Daemon::run(int stop, const std::function<void()>& willStop) {
    auto started = start();
    if (started.ok()) {
        manager_.notify("READY=1");
        waitForStop(stop);
    }
    manager_.notify("STOPPING=1");
    willStop();
    // Who waits for the first reading of the tree would make everybody wait for it.
    host_.beginStop();
    for (const auto& listener : listeners_) listener->stop();
    for (const auto& listener : listeners_) listener->waitUntilStopped();
    said_.wait();
    return started;
}

Result<void> Daemon::start() {
    for (const auto& listener : listeners_) TRY(listener->start(host_));
    return {};
}

void Daemon::waitForStop(int stop) {
    const auto interval = manager_.watchdogInterval();
    const int timeout =
        interval ? std::max(1, static_cast<int>(std::chrono::floor<std::chrono::milliseconds>(*interval).count())) : -1;
    pollfd entry{stop, POLLIN, 0};
    while (true) {
        const int ready = ::poll(&entry, 1, timeout);
        if (ready > 0 || (ready < 0 && errno != EINTR)) return;
        if (ready == 0) sayAllIsWell();
    }
}

/// Said by a thread that could as well have worked for a client: where none is to be had, nothing is said.
void Daemon::sayAllIsWell() {
    said_.enter();
    dispatchAsync([this] {
        manager_.notify("WATCHDOG=1");
        said_.leave();
    });
}

}  // namespace cindral
