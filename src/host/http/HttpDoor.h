#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "host/DaemonListener.h"
#include "host/http/HttpListener.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// The daemon's door for browsers: open from the start where that is asked for, else from when the person first asks
/// for a link.
///
/// Thread safety: makeLink() from any thread; the rest as DaemonListener.
class HttpDoor final : public DaemonListener {
public:
    struct Options {
        std::optional<std::uint16_t> port;  ///< open from the start, at this port; 0 is any that is free
        std::uint64_t uploadBytesMax = 0;
        HttpListener::Show show;  ///< as HttpListener; a door that opens later shows nothing
    };
    /// Where the door is to be open from the start, its port is taken now. EADDRINUSE where another has it.
    static Result<std::unique_ptr<HttpDoor>> make(Options options);
    /// Stopped before, where it was started.
    ~HttpDoor() override = default;

    /// A link that lets one browser in, once. Opens the door where it is closed. ESHUTDOWN where the end has begun, or
    /// the beginning has not.
    Result<std::string> makeLink();

    Result<void> start(const HostProcess& host) override;
    void stop() override;
    void waitUntilStopped() override;

private:
    explicit HttpDoor(std::uint64_t uploadBytesMax) : uploadBytesMax_(uploadBytesMax) {}

    const std::uint64_t uploadBytesMax_;
    Mutex mutex_;
    const HostProcess* host_ GUARDED_BY(mutex_) = nullptr;  ///< from the start to the end
    std::unique_ptr<HttpListener> listener_ GUARDED_BY(mutex_);
};

}  // namespace cindral
