#pragma once

#include "host/HostProcess.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// A way in which clients reach the daemon: its socket, or another that is put beside it.
///
/// Thread safety: for one thread at a time, the daemon's.
class DaemonListener {
public:
    virtual ~DaemonListener() = default;

    /// Begins to serve clients, on threads of its own, and returns. `host` lives until stopped() has returned. An error
    /// keeps the daemon from running.
    virtual Result<void> start(const HostProcess& host) = 0;
    /// No new clients and no new requests: what is under way goes on to its end. Returns at once.
    virtual void stop() = 0;
    /// Returns when everything is answered and every client gone. After stop() alone.
    virtual void waitUntilStopped() = 0;
};

}  // namespace cindral
