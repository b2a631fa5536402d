#include "host/StopSignals.h"

#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <memory>

#include "host/Descriptor.h"

namespace cindral {
namespace {

// Where the handler writes to; -1 for nowhere. A handler can be given nothing of its own.
std::atomic<int> stopDescriptor{-1};

std::atomic<int> lastSignal{0};

void noteStop(int signal) {
    const int savedErrno = errno;
    lastSignal.store(signal);
    const std::uint64_t one = 1;
    [[maybe_unused]] const ssize_t put = ::write(stopDescriptor.load(), &one, sizeof one);
    errno = savedErrno;
}

void catchSignal(int signal, struct sigaction& before) {
    struct sigaction action {};
    action.sa_handler = noteStop;
    action.sa_flags = SA_RESTART;
    ::sigemptyset(&action.sa_mask);
    ::sigaction(signal, &action, &before);
    if (before.sa_handler == SIG_IGN) ::sigaction(signal, &before, nullptr);
}

}  // namespace

Result<std::unique_ptr<StopSignals>> StopSignals::catchThem() {
    // The constructor is nobody else's to call.
    return std::unique_ptr<StopSignals>(new StopSignals(TRY(descriptor::makeInterrupt())));
}

StopSignals::StopSignals(UniqueFd descriptor) : descriptor_(std::move(descriptor)) {
    lastSignal.store(0);
    stopDescriptor.store(descriptor_.get());
    catchSignal(SIGINT, interruptBefore_);
    catchSignal(SIGTERM, terminateBefore_);
}

int StopSignals::signal() const {
    return lastSignal.load();
}

StopSignals::~StopSignals() {
    ::sigaction(SIGINT, &interruptBefore_, nullptr);
    ::sigaction(SIGTERM, &terminateBefore_, nullptr);
    stopDescriptor.store(-1);
}

}  // namespace cindral
