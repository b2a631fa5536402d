#include "platform/roster/RosterWatcher.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <utility>

#include "platform/foundation/BackgroundThread.h"
#include "platform/foundation/Log.h"

namespace cindral {
namespace {

using std::chrono::milliseconds;
using std::chrono::steady_clock;

// What comes together is looked at together: installing an application is many changes.
constexpr milliseconds kPause{20};
constexpr milliseconds kPausesMax{100};
// Where not everything can be watched.
constexpr milliseconds kLookInterval{2000};
// A look that finds further folders to watch is taken again; sources that never come to rest are looked at with the
// next news.
constexpr int kLooksMax = 8;

int millisecondsUntil(std::optional<steady_clock::time_point> moment) {
    if (!moment) return -1;
    // Rounded up: an early wake-up would find nothing to do.
    const auto left = std::chrono::ceil<milliseconds>(*moment - steady_clock::now()).count();
    return static_cast<int>(std::clamp<std::int64_t>(left, 0, 3'600'000));
}

}  // namespace

RosterWatcher::RosterWatcher(RosterSources sources, Receiver receive)
    : scanner_(std::move(sources)), receive_(std::move(receive)), wakeFd_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
    if (Result<RosterWatch> made = RosterWatch::make(); made.ok()) {
        watch_.emplace(*std::move(made));
    } else {
        logError("can't watch for applications; {}", made.error().description());
    }
}

std::shared_ptr<RosterWatcher> RosterWatcher::start(RosterSources sources, Receiver receive) {
    std::shared_ptr<RosterWatcher> watcher(new RosterWatcher(std::move(sources), std::move(receive)));
    watcher->look();
    if (!watcher->wakeFd_) {
        logError("can't follow the applications; {}", KsError::errorWithPOSIXCode().description());
        return watcher;
    }
    watcher->isRunning_ = true;
    const int error = startBackgroundThread([watcher] { watcher->run(); });
    if (error == 0) return watcher;
    logError("can't follow the applications; {}", errnoText(error));
    watcher->isRunning_ = false;
    return watcher;
}

void RosterWatcher::stop() {
    if (!isRunning_) return;
    const std::uint64_t one = 1;
    [[maybe_unused]] const ssize_t written = ::write(wakeFd_.get(), &one, sizeof one);
    ended_.wait();
}

void RosterWatcher::look() {
    RosterContents contents;
    for (int looks = 0; looks < kLooksMax; ++looks) {
        contents = scanner_.scan(watch_ ? watch_->filesBeingWritten() : std::set<std::string>());
        // Watched first, then looked at: otherwise what happens in between would be missed.
        if (!watch_ || !watch_->watch(contents.interests)) break;
    }
    receive_(std::move(contents));
}

void RosterWatcher::run() {
    nameCurrentThread("cindral.roster");
    while (waitForNews()) look();
    ended_.signal();
}

bool RosterWatcher::poll(std::optional<RosterWatch::TimePoint> until, bool& isReady) {
    pollfd descriptors[] = {{wakeFd_.get(), POLLIN, 0}, {watch_ ? watch_->descriptor() : -1, POLLIN, 0}};
    const int ready = ::poll(descriptors, 2, millisecondsUntil(until));
    isReady = ready > 0 && descriptors[1].revents != 0;
    return descriptors[0].revents == 0;
}

bool RosterWatcher::waitForNews() {
    bool isReady = false;
    while (true) {
        std::optional<RosterWatch::TimePoint> until = watch_ ? watch_->nextMoment() : std::nullopt;
        const bool mustLook = !watch_ || !watch_->isComplete();
        if (mustLook) until = steady_clock::now() + kLookInterval;
        if (!poll(until, isReady)) return false;
        const bool isNews = watch_ && watch_->drain(steady_clock::now());
        if (isNews) break;
        if (mustLook && !isReady) return true;
    }
    const auto begin = steady_clock::now();
    do {
        if (!poll(steady_clock::now() + kPause, isReady)) return false;
        if (isReady) watch_->drain(steady_clock::now());
    } while (isReady && steady_clock::now() - begin < kPausesMax);
    return true;
}

}  // namespace cindral
