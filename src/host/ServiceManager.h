#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// What there is to say to the service manager, and to be had from it. Without one, and where its library is not
/// installed, nothing is said, and there is nothing.
///
/// The library is loaded when a daemon begins: it costs a command's start nothing, and no system needs it.
///
/// Thread safety: notify(), from any thread; the rest, for one thread at a time.
class ServiceManager {
public:
    ServiceManager();
    ~ServiceManager();
    ServiceManager(const ServiceManager&) = delete;
    ServiceManager& operator=(const ServiceManager&) = delete;

    /// "READY=1", "STOPPING=1", "WATCHDOG=1", "STATUS=…"; several a line each.
    void notify(const std::string& state) const;
    /// How often to say that all is well; none where nobody listens.
    std::optional<std::chrono::microseconds> watchdogInterval() const { return watchdog_; }

    /// The sockets that the service manager listens on for us: those that take connections, of this machine's own. Once.
    std::vector<UniqueFd> takeLocalSockets();

private:
    void* library_ = nullptr;
    int (*notify_)(int, const char*) = nullptr;
    std::optional<std::chrono::microseconds> watchdog_;
    std::vector<UniqueFd> sockets_;
};

}  // namespace cindral
