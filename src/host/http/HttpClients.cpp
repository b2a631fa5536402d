#include "host/http/HttpClients.h"

#include <fmt/format.h>
#include <poll.h>
#include <sys/socket.h>

#include <cerrno>
#include <utility>

#include "host/SocketOutput.h"
#include "host/http/HttpResponse.h"
#include "platform/foundation/Dispatch.h"
#include "platform/foundation/KsUUID.h"

namespace cindral {
namespace {

// The first two take paths, and could be told of any. Whom else to let in is not a browser's to say.
constexpr std::string_view kMethodsNotToBeHad[] = {"importDocument", "identifierForItemAtURL", "makeLink"};

/// Returns when the other end is gone or `stop` can be read.
void waitForEnd(int socket, int stop) {
    // A page sends nothing more on its stream; what it does send is not looked at.
    pollfd entries[] = {{socket, POLLRDHUP, 0}, {stop, POLLIN, 0}};
    while (::poll(entries, std::size(entries), -1) < 0 && errno == EINTR) {
    }
}

/// Takes the answers of one message, and tells when there will be none any more.
class Answers {
public:
    JsonRpcServer::Sink sink() {
        // Let go of by the last request of the message: that is the end, with or without an answer.
        const auto end = std::shared_ptr<State>(state_.get(), [kept = state_](State* state) { state->ended.signal(); });
        return [end](std::string_view line) {
            const MutexLock lock(end->mutex);
            end->text += line;
        };
    }
    std::string wait() {
        state_->ended.wait();
        const MutexLock lock(state_->mutex);
        return std::move(state_->text);
    }

private:
    struct State {
        DispatchSemaphore ended{0};
        Mutex mutex;
        std::string text GUARDED_BY(mutex);
    };
    std::shared_ptr<State> state_ = std::make_shared<State>();
};

}  // namespace

/// What a page is told by, for as long as somebody listens: who has something to tell may outlive the connection.
class HttpClients::Outlet {
public:
    explicit Outlet(int socket) : output_(std::make_unique<SocketOutput>(socket)) {}

    void write(std::string_view event) {
        const MutexLock lock(mutex_);
        if (output_) output_->write(event);
    }
    /// Nothing is written any more when this has returned.
    void close() {
        const MutexLock lock(mutex_);
        output_.reset();
    }

private:
    Mutex mutex_;
    std::unique_ptr<SocketOutput> output_ GUARDED_BY(mutex_);
};

bool HttpClients::stream(HttpConnection& connection, int socket, int stop,
                         const std::shared_ptr<const HttpSession>& session) {
    const std::string name = KsUUID::random().string();
    const auto outlet = std::make_shared<Outlet>(socket);
    // A line ends with its newline; the empty one after it ends the event.
    auto client = std::make_shared<ServedClient>(
        service_, [outlet](std::string_view line) { outlet->write(fmt::format("data: {}\n", line)); },
        kMethodsNotToBeHad);
    {
        const MutexLock lock(mutex_);
        if (pages_.size() >= kStreamsMax) return false;
        pages_.emplace(name, Page{session, socket, std::move(client)});
    }
    HttpResponse response;
    response.contentType = "text/event-stream";
    if (connection.beginAnswer(response, std::nullopt)) {
        outlet->write(fmt::format("event: connection\ndata: \"{}\"\n\n", name));
        waitForEnd(socket, stop);
    }
    {
        const MutexLock lock(mutex_);
        client = std::move(pages_.at(name).client);
        pages_.erase(name);
    }
    outlet->close();
    return true;
}

bool HttpClients::answer(const HttpSession& session, std::string_view name, std::string_view message,
                         std::string& answer) {
    const auto client = find(session, name);
    if (client == nullptr) return false;
    Answers answers;
    client->server().receiveLine(message, answers.sink());
    answer = answers.wait();
    return true;
}

std::shared_ptr<ServedClient> HttpClients::find(const HttpSession& session, std::string_view name) {
    if (name.empty())
        return std::make_shared<ServedClient>(
            service_, [](std::string_view) {}, kMethodsNotToBeHad);
    const MutexLock lock(mutex_);
    const auto found = pages_.find(name);
    return found != pages_.end() && found->second.session.get() == &session ? found->second.client : nullptr;
}

void HttpClients::end(const HttpSession& session) {
    const MutexLock lock(mutex_);
    for (const auto& [name, page] : pages_) {
        if (page.session.get() == &session) ::shutdown(page.socket, SHUT_RDWR);
    }
}

}  // namespace cindral
