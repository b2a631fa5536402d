#include "host/ProgressNotifier.h"

#include <fmt/format.h>

#include <utility>

namespace cindral {

namespace {

// From here on somebody may be waiting for it.
constexpr std::uint64_t kMuchBytes = 1 << 20;
constexpr std::uint64_t kManyItems = 100;

}  // namespace

void ProgressNotifier::follow(const std::shared_ptr<TesselProgress>& progress,
                              const std::shared_ptr<JsonRpcReply>& reply, const Clock& clock) {
    if (progress == nullptr) return;
    reply->setCancellation([progress] { progress->cancel(); });
    const auto notifier = std::make_shared<ProgressNotifier>(reply, clock);
    progress->setObserver([notifier](const TesselProgress::Counts& counts) { notifier->tell(counts); });
}

ProgressNotifier::ProgressNotifier(std::weak_ptr<JsonRpcReply> reply, Clock clock)
    : reply_(std::move(reply)), clock_(std::move(clock)), lastTold_(clock_()) {}

void ProgressNotifier::tell(const TesselProgress::Counts& counts) {
    if (!isTimeToTell(counts)) return;
    const auto reply = reply_.lock();
    if (reply == nullptr) return;
    reply->notify(fmt::format(
        R"({{"jsonrpc":"2.0","method":"progress","params":{{"request":{},"completedBytes":{},"totalBytes":{},)"
        R"("completedItems":{},"totalItems":{}}}}})"
        "\n",
        reply->id(), counts.completedBytes, counts.totalBytes, counts.completedItems, counts.totalItems));
}

bool ProgressNotifier::isTimeToTell(const TesselProgress::Counts& counts) {
    const MutexLock lock(mutex_);
    const auto now = clock_();
    const bool isMuch = counts.totalBytes >= kMuchBytes || counts.totalItems >= kManyItems;
    const bool isFirst = !hasTold_ && isMuch;
    if (!isFirst && now - lastTold_ < kIntervalMin) return false;
    hasTold_ = true;
    lastTold_ = now;
    return true;
}

}  // namespace cindral
