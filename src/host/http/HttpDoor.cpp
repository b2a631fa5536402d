#include "host/http/HttpDoor.h"

#include <cerrno>
#include <utility>

namespace cindral {

Result<std::unique_ptr<HttpDoor>> HttpDoor::make(Options options) {
    // The constructor is nobody else's to call.
    std::unique_ptr<HttpDoor> door(new HttpDoor(options.uploadBytesMax));
    if (!options.port) return door;
    auto listener = TRY(HttpListener::make(*options.port, options.uploadBytesMax, std::move(options.show)));
    const MutexLock lock(door->mutex_);
    door->listener_ = std::move(listener);
    return door;
}

Result<void> HttpDoor::start(const HostProcess& host) {
    const MutexLock lock(mutex_);
    host_ = &host;
    if (listener_ != nullptr) return listener_->start(host);
    return {};
}

Result<std::string> HttpDoor::makeLink() {
    const MutexLock lock(mutex_);
    if (host_ == nullptr) return KsError::posix(ESHUTDOWN);
    if (listener_ == nullptr) {
        auto listener = TRY(HttpListener::make(0, uploadBytesMax_, nullptr));
        TRY(listener->start(*host_));
        listener_ = std::move(listener);
    }
    return listener_->makeLink();
}

void HttpDoor::stop() {
    const MutexLock lock(mutex_);
    host_ = nullptr;
    if (listener_ != nullptr) listener_->stop();
}

void HttpDoor::waitUntilStopped() {
    HttpListener* listener = nullptr;
    {
        const MutexLock lock(mutex_);
        listener = listener_.get();
    }
    // It stays the one that it is: after stop() none is made.
    if (listener != nullptr) listener->waitUntilStopped();
}

}  // namespace cindral
