#pragma once

#include <functional>
#include <memory>
#include <vector>

#include "host/DaemonListener.h"
#include "host/ServiceManager.h"
#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// The host as a service: lets clients in by every listener it is given, until it is asked to stop.
///
/// Nothing happens while no client asks for anything: every thread sleeps without a time-out, but where the service
/// manager wants to hear at intervals that all is well.
///
/// Thread safety: for one thread at a time.
class Daemon {
public:
    /// Both borrowed for life.
    Daemon(HostProcess& host, const ServiceManager& manager) : host_(host), manager_(manager) {}

    void add(std::unique_ptr<DaemonListener> listener) { listeners_.push_back(std::move(listener)); }

    /// Serves until `stop` can be read. Then, in this order: the service manager is told, `willStop` is called, no
    /// listener lets anybody in, everything under way is answered, and what was answered has been taken by who asked,
    /// or was left lying for too long.
    Result<void> run(int stop, const std::function<void()>& willStop);

private:
    Result<void> start();
    void waitForStop(int stop);
    void sayAllIsWell();

    HostProcess& host_;
    const ServiceManager& manager_;
    std::vector<std::unique_ptr<DaemonListener>> listeners_;
    DispatchGroup said_;
};

}  // namespace cindral
