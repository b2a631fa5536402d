#include "host/ServiceManager.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/socket.h>

#include <cstdint>
#include <cstdlib>
#include <utility>

#include "platform/foundation/Log.h"

namespace cindral {
namespace {

constexpr const char* kLibrary = "libsystemd.so.0";
constexpr int kFirstSocket = 3;  // Part of the service manager's interface.

template <typename Function>
Function find(void* library, const char* name) {
    return reinterpret_cast<Function>(::dlsym(library, name));
}

int optionOf(int socket, int option) {
    int value = 0;
    socklen_t size = sizeof value;
    return ::getsockopt(socket, SOL_SOCKET, option, &value, &size) == 0 ? value : -1;
}

bool isLocalListener(int fd) {
    return optionOf(fd, SO_DOMAIN) == AF_UNIX && optionOf(fd, SO_TYPE) == SOCK_STREAM &&
           optionOf(fd, SO_ACCEPTCONN) == 1;
}

bool isStartedByOne() {
    for (const char* variable : {"NOTIFY_SOCKET", "LISTEN_FDS", "WATCHDOG_USEC"}) {
        if (std::getenv(variable) != nullptr) return true;
    }
    return false;
}

}  // namespace

ServiceManager::ServiceManager() {
    if (!isStartedByOne()) return;
    library_ = ::dlopen(kLibrary, RTLD_NOW | RTLD_LOCAL);
    if (library_ == nullptr) {
        logError("started by a service manager, which can't be told anything: {} is not installed", kLibrary);
        return;
    }
    notify_ = find<int (*)(int, const char*)>(library_, "sd_notify");
    // What is meant for this process is not to be found by one that it starts. The notification socket is needed to the
    // end.
    constexpr int kForget = 1;
    if (const auto listen = find<int (*)(int)>(library_, "sd_listen_fds")) {
        const int count = listen(kForget);
        for (int i = 0; i < count; ++i) sockets_.emplace_back(kFirstSocket + i);
    }
    std::uint64_t microseconds = 0;
    const auto watchdog = find<int (*)(int, std::uint64_t*)>(library_, "sd_watchdog_enabled");
    if (watchdog != nullptr && watchdog(kForget, &microseconds) > 0)
        watchdog_ = std::chrono::microseconds(microseconds) / 2;
}

ServiceManager::~ServiceManager() {
    if (library_ != nullptr) ::dlclose(library_);
}

void ServiceManager::notify(const std::string& state) const {
    constexpr int kKeep = 0;
    if (notify_ != nullptr) notify_(kKeep, state.c_str());
}

std::vector<UniqueFd> ServiceManager::takeLocalSockets() {
    std::vector<UniqueFd> local;
    std::vector<UniqueFd> others;
    for (UniqueFd& each : sockets_) {
        const bool isLocal = isLocalListener(each.get());
        // Accepting is by who is woken: it must never wait.
        if (isLocal) ::fcntl(each.get(), F_SETFL, ::fcntl(each.get(), F_GETFL) | O_NONBLOCK);
        (isLocal ? local : others).push_back(std::move(each));
    }
    sockets_ = std::move(others);
    return local;
}

}  // namespace cindral
