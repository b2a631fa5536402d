#include "host/http/HttpListener.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>

#include <cerrno>
#include <chrono>
#include <utility>

#include "host/Descriptor.h"
#include "host/LocalSocket.h"
#include "platform/foundation/BackgroundThread.h"
#include "platform/foundation/Log.h"

namespace cindral {

struct HttpListener::Connection {
    explicit Connection(UniqueFd connected) : socket(std::move(connected)) {}

    const UniqueFd socket;
    bool isWaiting = true;         ///< for a request; under the listener's lock, and so is the next
    std::uint64_t waitingSince{};  ///< a number that grows
};

Result<std::unique_ptr<HttpListener>> HttpListener::make(std::uint16_t port, std::uint64_t uploadBytesMax, Show show) {
    UniqueFd socket(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (!socket) return KsError::errorWithPOSIXCode();
    const int one = 1;
    sockaddr_in address{};
    socklen_t size = sizeof address;
    address.sin_family = AF_INET;
    address.sin_port = htons(port);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    auto* const generic = reinterpret_cast<sockaddr*>(&address);
    if (::setsockopt(socket.get(), SOL_SOCKET, SO_REUSEADDR, &one, sizeof one) != 0 ||
        ::bind(socket.get(), generic, size) != 0 || ::listen(socket.get(), local_socket::kWaitingMax) != 0 ||
        ::getsockname(socket.get(), generic, &size) != 0)
        return KsError::errorWithPOSIXCode();
    // The constructor is nobody else's to call.
    return std::unique_ptr<HttpListener>(
        new HttpListener(std::move(socket), ntohs(address.sin_port), uploadBytesMax, std::move(show)));
}

HttpListener::HttpListener(UniqueFd socket, std::uint16_t port, std::uint64_t uploadBytesMax, Show show)
    : socket_(std::move(socket)), port_(port), uploadBytesMax_(uploadBytesMax), show_(std::move(show)) {}

HttpListener::~HttpListener() {
    stop();
    waitUntilStopped();
}

std::string HttpListener::makeLink() {
    // Behind the "#", which no browser sends anywhere.
    return site_->origin() + "/#" + sessions_.makeLink();
}

void HttpListener::showLink() {
    if (show_ == nullptr) return;
    const MutexLock lock(showMutex_);
    show_(makeLink());
}

Result<void> HttpListener::start(const HostProcess& host) {
    stop_ = TRY(descriptor::makeInterrupt());
    service_.emplace(serviceOf(host));
    site_ = std::make_unique<HttpSite>(*service_, sessions_, port_, uploadBytesMax_, [this] { showLink(); });
    threads_.enter();
    const int failure = startBackgroundThread([this] {
        nameCurrentThread("cindral-http");
        accept();
        threads_.leave();
    });
    if (failure == 0) {
        showLink();
        return {};
    }
    threads_.leave();
    return KsError::posix(failure);
}

void HttpListener::stop() {
    const MutexLock lock(mutex_);
    if (std::exchange(isStopping_, true)) return;
    if (stop_) descriptor::interrupt(stop_);
    changed_.notifyAll();
}

void HttpListener::waitUntilStopped() {
    threads_.wait();
}

// MARK: The accepting thread

void HttpListener::accept() {
    bool goesOn = true;
    while (goesOn) {
        const auto readiness = descriptor::waitForInput(socket_.get(), socket_.get(), stop_.get());
        goesOn = readiness.ok() && *readiness == descriptor::Readiness::input && acceptAll();
    }
    ::shutdown(socket_.get(), SHUT_RD);
}

/// False when there will be no more.
bool HttpListener::acceptAll() {
    while (true) {
        auto accepted = local_socket::acceptFrom(socket_.get());
        if (!accepted.ok()) {
            logError("can't accept a browser; {}", accepted.error().description());
            const auto deadline = std::chrono::steady_clock::now() + local_socket::kRespite;
            const MutexLock lock(mutex_);
            while (!isStopping_ && changed_.waitUntil(mutex_, deadline)) {
            }
            return !isStopping_;
        }
        if (!*accepted) return true;
        welcome(**std::move(accepted));
    }
}

void HttpListener::welcome(UniqueFd socket) {
    const int one = 1;
    ::setsockopt(socket.get(), IPPROTO_TCP, TCP_NODELAY, &one, sizeof one);
    ::fcntl(socket.get(), F_SETFL, O_NONBLOCK);
    const auto connection = std::make_shared<Connection>(std::move(socket));
    {
        const MutexLock lock(mutex_);
        if (connections_.size() >= kConnectionsMax) makeRoom();
        connection->waitingSince = ++turns_;
        connections_.push_back(connection);
    }
    threads_.enter();
    const int failure = startBackgroundThread([this, connection = connection]() mutable {
        nameCurrentThread("cindral-browser");
        serve(*connection);
        {
            const MutexLock lock(mutex_);
            connections_.remove(connection);
            changed_.notifyAll();
        }
        connection.reset();
        threads_.leave();
    });
    if (failure == 0) return;
    logError("can't serve a browser; {}", KsError::posix(failure).description());
    const MutexLock lock(mutex_);
    connections_.remove(connection);
    threads_.leave();
}

/// Who has been waiting longest goes; where everybody is at work, the next one waits for somebody to be done.
void HttpListener::makeRoom() {
    while (!isStopping_ && connections_.size() >= kConnectionsMax) {
        Connection* longest = nullptr;
        for (const auto& each : connections_) {
            if (each->isWaiting && (longest == nullptr || each->waitingSince < longest->waitingSince))
                longest = each.get();
        }
        if (longest != nullptr) ::shutdown(longest->socket.get(), SHUT_RDWR);
        changed_.wait(mutex_);
    }
}

// MARK: A connection's thread

void HttpListener::setWaiting(Connection& connection, bool isWaiting) {
    const MutexLock lock(mutex_);
    connection.isWaiting = isWaiting;
    connection.waitingSince = ++turns_;
    // There may be somebody to go now.
    changed_.notifyAll();
}

void HttpListener::serve(Connection& connection) {
    HttpConnection http(connection.socket.get(), stop_.get(), {});
    while (http.goesOn()) {
        auto next = http.next();
        if (std::holds_alternative<HttpConnection::End>(next)) return;
        setWaiting(connection, false);
        if (const auto* request = std::get_if<HttpRequest>(&next)) {
            site_->serve(http, *request, connection.socket.get(), stop_.get());
        } else {
            http.answer(std::get<HttpResponse>(next));
        }
        setWaiting(connection, true);
    }
    http.linger();
}

}  // namespace cindral
