#include "host/SocketOutput.h"

#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "host/Descriptor.h"
#include "platform/foundation/BackgroundThread.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/ThreadPool.h"

namespace cindral {
namespace {

/// Bytes that the socket takes without waiting; none where the connection is broken, as errno says.
std::optional<std::size_t> sendWithoutWaiting(int socket, std::string_view bytes) {
    while (true) {
        const ssize_t sent = ::send(socket, bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
        if (sent >= 0) return static_cast<std::size_t>(sent);
        if (errno == EAGAIN) return 0;
        if (errno != EINTR) return std::nullopt;
    }
}

bool isReaderGone(int code) {
    return code == EPIPE || code == ECONNRESET;
}

}  // namespace

SocketOutput::~SocketOutput() {
    {
        const MutexLock lock(mutex_);
        isEnding_ = true;
        isBroken_ = true;
        if (hasThread_) descriptor::interrupt(wake_);
        changed_.notifyAll();
    }
    running_.wait();
}

// MARK: Who writes

void SocketOutput::write(std::string_view line) {
    const MutexLock lock(mutex_);
    if (isBroken_) return;
    // What is kept goes first.
    if (backlogBytes_ == 0) line.remove_prefix(sendNow(line));
    if (!isBroken_ && !line.empty()) keep(line);
}

/// Under the lock, because lines may not run into each other; it doesn't wait.
std::size_t SocketOutput::sendNow(std::string_view bytes) {
    const auto sent = sendWithoutWaiting(socket_, bytes);
    if (!sent) breakOff(isReaderGone(errno) ? std::nullopt : std::optional(KsError::errorWithPOSIXCode()));
    return sent.value_or(0);
}

void SocketOutput::keep(std::string_view bytes) {
    if (backlogBytes_ == 0) lastTaken_ = std::chrono::steady_clock::now();
    const bool wasWithinBounds = backlogBytes_ <= kBacklogBytesMax;
    chunks_.emplace_back(bytes);
    backlogBytes_ += bytes.size();
    if (!hasThread_) {
        startThread();
    } else if (wasWithinBounds && backlogBytes_ > kBacklogBytesMax) {
        descriptor::interrupt(wake_);  // It may be waiting without an end.
    }
    changed_.notifyAll();
}

void SocketOutput::breakOff(std::optional<KsError> error) {
    isBroken_ = true;
    error_ = std::move(error);
    chunks_.clear();
    backlogBytes_ = 0;
    // Whoever reads from the client learns of it.
    ::shutdown(socket_, SHUT_RDWR);
    changed_.notifyAll();
}

void SocketOutput::waitForRoom() {
    const ThreadPool::BlockingRegion region;
    const MutexLock lock(mutex_);
    while (backlogBytes_ > kRoomBytes && !isBroken_) {
        const Moment deadline = lastTaken_ + patience_;
        if (std::chrono::steady_clock::now() >= deadline) return;  // It does not read: what it asks for will end it.
        (void)changed_.waitUntil(mutex_, deadline);
    }
}

std::optional<KsError> SocketOutput::error() const {
    const MutexLock lock(mutex_);
    return error_;
}

void SocketOutput::hurry() {
    const MutexLock lock(mutex_);
    isHurried_ = true;
    if (hasThread_) descriptor::interrupt(wake_);
}

void SocketOutput::finish() {
    const ThreadPool::BlockingRegion region;
    const MutexLock lock(mutex_);
    while (backlogBytes_ > 0 && !isBroken_) changed_.wait(mutex_);
}

// MARK: The thread

void SocketOutput::startThread() {
    auto wake = descriptor::makeInterrupt();
    if (!wake.ok()) return breakOff(std::move(wake).error());
    wake_ = *std::move(wake);
    running_.enter();
    const int failure = startBackgroundThread([this] {
        nameCurrentThread("cindral-output");
        run();
        running_.leave();
    });
    hasThread_ = failure == 0;
    if (hasThread_) return;
    running_.leave();
    breakOff(KsError::posix(failure));
}

void SocketOutput::run() {
    std::string chunk;
    while (takeChunk(chunk)) {
        std::string_view left = chunk;
        while (sendSome(left)) waitUntilItTakes();
    }
}

/// False when the output ends.
bool SocketOutput::takeChunk(std::string& chunk) {
    const MutexLock lock(mutex_);
    while (chunks_.empty() && !isEnding_) changed_.wait(mutex_);
    if (isEnding_) return false;
    chunk = std::move(chunks_.front());
    chunks_.pop_front();
    return true;
}

/// Whether there is something left for later.
bool SocketOutput::sendSome(std::string_view& bytes) {
    const MutexLock lock(mutex_);
    if (isBroken_) return false;
    const std::size_t sent = sendNow(bytes);
    bytes.remove_prefix(sent);
    if (isBroken_) return false;
    if (sent > 0) {
        backlogBytes_ -= sent;
        lastTaken_ = std::chrono::steady_clock::now();
        changed_.notifyAll();
    }
    return !bytes.empty();
}

bool SocketOutput::isOverdue() const {
    return (backlogBytes_ > kBacklogBytesMax || isHurried_) &&
           std::chrono::steady_clock::now() >= lastTaken_ + patience_;
}

/// Without an end for as long as there is no reason to drop the client.
void SocketOutput::waitUntilItTakes() {
    int timeout = -1;
    {
        const MutexLock lock(mutex_);
        if (isBroken_) return;
        if (backlogBytes_ > kBacklogBytesMax || isHurried_) {
            const auto left = lastTaken_ + patience_ - std::chrono::steady_clock::now();
            timeout = std::max(0, static_cast<int>(std::chrono::ceil<std::chrono::milliseconds>(left).count()));
        }
    }
    pollfd entries[] = {{socket_, POLLOUT, 0}, {wake_.get(), POLLIN, 0}};
    const int ready = ::poll(entries, std::size(entries), timeout);
    if (ready < 0 && errno != EINTR) return;
    if (ready > 0 && entries[1].revents != 0) descriptor::clearInterrupt(wake_);
    const MutexLock lock(mutex_);
    if (ready > 0 || isBroken_ || !isOverdue()) return;
    logError("a client that does not read is dropped, with {} bytes not yet taken", backlogBytes_);
    breakOff(std::nullopt);
}

}  // namespace cindral
