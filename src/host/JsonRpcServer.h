#pragma once

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>

#include "host/JsonRpcMessage.h"
#include "platform/foundation/Mutex.h"

namespace cindral {

/// The place that one request is answered at, once.
///
/// Whoever lets go of the last reference without an answer has answered with an internal error: no request stays open.
///
/// Thread safety: the answer, from any thread.
class JsonRpcReply {
public:
    virtual ~JsonRpcReply() = default;

    /// Calls back to append the result's JSON text.
    virtual void result(const std::function<void(std::string& out)>& append) = 0;
    /// `data` is JSON text; empty for none.
    virtual void error(JsonRpcCode code, std::string_view message, std::string_view data = {}) = 0;

    /// The request's id as JSON text; empty for a notification.
    virtual const std::string& id() const = 0;
    /// Sends a notification about the request: a line, newline included. None is sent once the request is answered.
    virtual void notify(std::string_view line) = 0;
    /// What to do when the client cancels the request: at once where it has already, never once it is answered.
    virtual void setCancellation(std::function<void()> cancellation) = 0;
};

/// Answers the requests of one client: finds the method, runs it beside others, writes each answer as one line.
///
/// At most kRequestsInFlightMax requests are under way; receiving waits meanwhile, so that a client that sends faster
/// than it is served costs no memory. The answers of a batch come as one line when all are there.
///
/// One method is its own: "cancel", which passes on to a request under way (by its id, "request") that its client no
/// longer wants it. It is answered with {} whether or not there still is such a request.
///
/// Thread safety: one thread receives; answers may come from any.
class JsonRpcServer {
public:
    using Method = std::function<void(const Json& params, std::shared_ptr<JsonRpcReply> reply)>;
    using Methods = std::map<std::string, Method, std::less<>>;
    /// Writes a line, newline included. Called by any thread, by several at a time.
    using Sink = std::function<void(std::string_view line)>;

    static constexpr std::size_t kRequestsInFlightMax = 64;
    /// Answers of a batch beyond this are replaced by errors.
    static constexpr std::size_t kBatchAnswerBytesMax = 256 << 20;

    JsonRpcServer(Methods methods, Sink sink);
    /// Waits until everything is answered.
    ~JsonRpcServer();
    JsonRpcServer(const JsonRpcServer&) = delete;
    JsonRpcServer& operator=(const JsonRpcServer&) = delete;

    void receiveLine(std::string_view line);
    /// The same with a place of its own for the line's answers; what is told of its requests meanwhile goes where the
    /// rest goes. `answers` is let go of when everything in the line is answered, whether or not anything was written.
    void receiveLine(std::string_view line, const Sink& answers);
    /// A line was longer than kJsonRpcLineBytesMax.
    void receiveLongLine();
    /// Returns when everything received is answered.
    void waitUntilIdle();

private:
    class Answers;
    class SingleAnswer;
    class BatchAnswers;
    class Reply;

    void receive(JsonRpcEntry entry, const std::shared_ptr<Answers>& answers);
    void start(JsonRpcRequest request, const std::shared_ptr<Answers>& answers);
    void cancel(const Json& params, JsonRpcReply& reply);
    void enter();
    void leave(const std::string& id);

    const Methods methods_;
    const Sink sink_;

    Mutex mutex_;
    Condition changed_;
    std::size_t inFlight_ GUARDED_BY(mutex_) = 0;
    std::multimap<std::string, std::weak_ptr<Reply>> cancellable_ GUARDED_BY(mutex_);  ///< by id
};

}  // namespace cindral
