#include "platform/foundation/BackgroundThread.h"

#include <pthread.h>
#include <signal.h>

#include <array>
#include <cstring>
#include <system_error>
#include <thread>
#include <utility>

namespace cindral {
namespace {

constexpr std::size_t kThreadNameBytesMax = 15;

// All but those that a thread brings upon itself, which must reach it.
sigset_t signalsForOthers() {
    sigset_t signals;
    ::sigfillset(&signals);
    for (const int own : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT, SIGTRAP, SIGSYS}) ::sigdelset(&signals, own);
    return signals;
}

}  // namespace

void nameCurrentThread(std::string_view name) {
    std::array<char, kThreadNameBytesMax + 1> text{};
    name = name.substr(0, kThreadNameBytesMax);
    std::memcpy(text.data(), name.data(), name.size());
    ::pthread_setname_np(::pthread_self(), text.data());
}

int startBackgroundThread(std::function<void()> body) {
    const sigset_t blocked = signalsForOthers();
    sigset_t before;
    // A new thread inherits the mask, so that no signal reaches it before it could set its own.
    ::pthread_sigmask(SIG_SETMASK, &blocked, &before);
    int error = 0;
    try {
        std::thread(std::move(body)).detach();
    } catch (const std::system_error& failure) {
        error = failure.code().value();
    }
    ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
    return error;
}

}  // namespace cindral
