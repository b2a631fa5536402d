#include "host/SocketListener.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <utility>

#include "host/Descriptor.h"
#include "host/JsonRpcMessage.h"
#include "host/LocalSocket.h"
#include "host/RpcConnection.h"
#include "host/SocketOutput.h"
#include "platform/foundation/BackgroundThread.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/Sys.h"

namespace cindral {
namespace {

// How long a client that is about to end by itself may go on after the end has begun.
constexpr std::chrono::seconds kGrace{5};

}  // namespace

/// One client: its connection, and what it is still to read.
class SocketListener::Client {
public:
    explicit Client(UniqueFd connection) : connection_(std::move(connection)), output_(connection_.get()) {}

    Result<void> serve(const HostProcess& host, const MakeLink& makeLink) {
        const UniqueFd never = TRY(descriptor::makeInterrupt());
        const int fd = connection_.get();
        RpcService service = serviceOf(host);
        service.hello = [&](bool endsSoon) { return hello(host, endsSoon); };
        service.makeLink = makeLink;
        auto served = serveRpc(fd, fd, never, output_, service);
        output_.finish();
        return served;
    }

    enum class Which { thoseThatGoOn, all };
    /// What it has sent is still read; then its input is over. A client that ends soon may go on, unless all are meant.
    void end(Which which) {
        const MutexLock lock(mutex_);
        if (which == Which::thoseThatGoOn && endsSoon_) return;
        isEnded_ = true;
        ::shutdown(connection_.get(), SHUT_RD);
        output_.hurry();
    }

private:
    /// One that comes too late is told so, and looks elsewhere.
    std::string hello(const HostProcess& host, bool endsSoon) {
        const MutexLock lock(mutex_);
        endsSoon_ = endsSoon;
        return isEnded_ ? R"({"isEnding":true})" : host.helloText();
    }

    const UniqueFd connection_;
    SocketOutput output_;
    Mutex mutex_;
    bool endsSoon_ GUARDED_BY(mutex_) = false;
    bool isEnded_ GUARDED_BY(mutex_) = false;
};

SocketListener::SocketListener(DaemonSocket socket, Limits limits, MakeLink makeLink)
    : socket_(std::move(socket)), limits_(limits), makeLink_(std::move(makeLink)) {}

SocketListener::~SocketListener() {
    stop();
    waitUntilStopped();
}

Result<void> SocketListener::start(const HostProcess& host) {
    stop_ = TRY(descriptor::makeInterrupt());
    threads_.enter();
    const int failure = startBackgroundThread([this, &host] {
        nameCurrentThread("cindral-accept");
        accept(host);
        threads_.leave();
    });
    if (failure == 0) return {};
    threads_.leave();
    return KsError::posix(failure);
}

void SocketListener::stop() {
    const MutexLock lock(mutex_);
    if (std::exchange(isStopping_, true)) return;
    socket_.close();
    if (stop_) descriptor::interrupt(stop_);
    changed_.notifyAll();
    for (const auto& client : clients_) client->end(Client::Which::thoseThatGoOn);
}

void SocketListener::waitUntilStopped() {
    if (threads_.wait(kGrace) == WaitResult::done) return;
    {
        const MutexLock lock(mutex_);
        for (const auto& client : clients_) client->end(Client::Which::all);
    }
    threads_.wait();
}

// MARK: The accepting thread

void SocketListener::accept(const HostProcess& host) {
    const int listening = socket_.descriptor();
    if (auto spare = sys::open("/dev/null", O_RDONLY); spare.ok()) spare_ = *std::move(spare);
    bool goesOn = true;
    while (goesOn) {
        const auto readiness = descriptor::waitForInput(listening, listening, stop_.get());
        // Who has been let in by the kernel before the end is served too.
        goesOn = acceptAll(host) && readiness.ok() && *readiness == descriptor::Readiness::input;
    }
}

/// False when there will be no more.
bool SocketListener::acceptAll(const HostProcess& host) {
    while (true) {
        auto accepted = local_socket::acceptFrom(socket_.descriptor());
        if (!accepted.ok() && accepted.error().isPosix(EINVAL)) return false;
        if (!accepted.ok()) {
            logError("can't accept a client; {}", accepted.error().description());
            makeDoWithout();
            return true;
        }
        if (!*accepted) return true;
        welcome(**std::move(accepted), host);
    }
}

/// No descriptor or no memory is left for another client. It is turned away, so that it does not wait in vain; where not
/// even that can be done, others have to give something back first.
void SocketListener::makeDoWithout() {
    spare_.reset();
    const auto turnedAway = local_socket::acceptFrom(socket_.descriptor());
    auto spare = sys::open("/dev/null", O_RDONLY);
    if (spare.ok()) spare_ = *std::move(spare);
    if (turnedAway.ok()) return;
    const auto deadline = std::chrono::steady_clock::now() + local_socket::kRespite;
    const MutexLock lock(mutex_);
    if (!isStopping_) (void)changed_.waitUntil(mutex_, deadline);
}

/// Why a client is not served; null where it is.
const char* SocketListener::whyNot(int connection) {
    const auto peer = local_socket::peerOf(connection);
    if (!peer.ok() || peer->user != limits_.user) return "This daemon serves nobody but the person who started it";
    const MutexLock lock(mutex_);
    return clients_.size() < limits_.clientsMax ? nullptr : "There are too many clients";
}

void SocketListener::welcome(UniqueFd connection, const HostProcess& host) {
    if (const char* why = whyNot(connection.get())) {
        const std::string line = encodeJsonRpcFault({JsonRpcCode::operationFailed, why, "null"}) + "\n";
        (void)::send(connection.get(), line.data(), line.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
        return;
    }
    const auto client = std::make_shared<Client>(std::move(connection));
    {
        const MutexLock lock(mutex_);
        clients_.push_back(client);
        if (isStopping_) client->end(Client::Which::thoseThatGoOn);
    }
    threads_.enter();
    const int failure = startBackgroundThread([this, client = client, &host]() mutable {
        nameCurrentThread("cindral-client");
        serve(std::exchange(client, nullptr), host);
        threads_.leave();
    });
    if (failure == 0) return;
    logError("can't serve a client; {}", KsError::posix(failure).description());
    const MutexLock lock(mutex_);
    clients_.remove(client);
    threads_.leave();
}

void SocketListener::serve(const std::shared_ptr<Client>& client, const HostProcess& host) {
    if (const auto served = client->serve(host, makeLink_); !served.ok())
        logError("the connection to a client broke; {}", served.error().description());
    const MutexLock lock(mutex_);
    clients_.remove(client);
    changed_.notifyAll();
}

}  // namespace cindral
