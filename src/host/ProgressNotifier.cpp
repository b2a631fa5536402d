#include "host/ProgressNotifier.h"

#include <fmt/format.h>

#include <utility>

namespace cindral {

void ProgressNotifier::follow(const std::shared_ptr<TesselProgress>& progress,
                              const std::shared_ptr<JsonRpcReply>& reply, const ProgressPace::Clock& clock) {
    if (progress == nullptr) return;
    reply->setCancellation([progress] { progress->cancel(); });
    const auto notifier = std::make_shared<ProgressNotifier>(reply, clock);
    progress->setObserver([notifier](const TesselProgress::Counts& counts) { notifier->tell(counts); });
}

ProgressNotifier::ProgressNotifier(std::weak_ptr<JsonRpcReply> reply, ProgressPace::Clock clock)
    : reply_(std::move(reply)), pace_(std::move(clock)) {}

void ProgressNotifier::tell(const TesselProgress::Counts& counts) {
    if (!pace_.isTimeToTell(counts)) return;
    const auto reply = reply_.lock();
    if (reply == nullptr) return;
    reply->notify(fmt::format(
        R"({{"jsonrpc":"2.0","method":"progress","params":{{"request":{},"completedBytes":{},"totalBytes":{},)"
        R"("completedItems":{},"totalItems":{}}}}})"
        "\n",
        reply->id(), counts.completedBytes, counts.totalBytes, counts.completedItems, counts.totalItems));
}

}  // namespace cindral
