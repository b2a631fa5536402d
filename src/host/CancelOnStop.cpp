#include "host/CancelOnStop.h"

#include <unistd.h>

#include <csignal>
#include <utility>

#include "host/Descriptor.h"
#include "platform/foundation/BackgroundThread.h"

namespace cindral {

Result<std::unique_ptr<CancelOnStop>> CancelOnStop::start(DaemonConnection& connection) {
    auto signals = TRY(StopSignals::catchThem());
    // The constructor is nobody else's to call.
    std::unique_ptr<CancelOnStop> made(
        new CancelOnStop(std::move(signals), TRY(descriptor::makeInterrupt()), connection));
    made->running_.enter();
    const int failure = startBackgroundThread([self = made.get()] {
        nameCurrentThread("cindral-cancel");
        self->run();
        self->running_.leave();
    });
    if (failure == 0) return made;
    made->running_.leave();
    return KsError::posix(failure);
}

CancelOnStop::~CancelOnStop() {
    descriptor::interrupt(over_);
    running_.wait();
}

void CancelOnStop::run() {
    const auto ready = descriptor::waitForInput(signals_->descriptor(), over_.get(), over_.get());
    if (!ready.ok() || *ready != descriptor::Readiness::input) return;
    const int signal = signals_->signal();
    signals_.reset();
    connection_.cancelAll();
    ::kill(::getpid(), signal);
}

}  // namespace cindral
