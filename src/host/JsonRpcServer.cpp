#include "host/JsonRpcServer.h"

#include <fmt/format.h>

#include <iterator>
#include <utility>
#include <vector>

#include "platform/foundation/SerialQueue.h"

namespace cindral {

namespace {

constexpr std::string_view kCancelMethod = "cancel";

}  // namespace

/// Where the answers of one line go.
class JsonRpcServer::Answers {
public:
    virtual ~Answers() = default;
    /// JSON text without a newline.
    virtual void add(std::string answer, const std::string& id) = 0;
};

class JsonRpcServer::SingleAnswer final : public Answers {
public:
    explicit SingleAnswer(Sink sink) : sink_(std::move(sink)) {}
    void add(std::string answer, const std::string& /*id*/) override {
        answer += '\n';
        sink_(answer);
    }

private:
    const Sink sink_;
};

/// Collects until the last of its references is gone: that is when every request of the batch has been answered.
class JsonRpcServer::BatchAnswers final : public Answers {
public:
    explicit BatchAnswers(Sink sink) : sink_(std::move(sink)) {}
    ~BatchAnswers() override {
        if (line_.empty()) return;  // Nothing but notifications: no answer at all.
        line_ += "]\n";
        sink_(line_);
    }

    void add(std::string answer, const std::string& id) override {
        const MutexLock lock(mutex_);
        if (line_.size() + answer.size() > kBatchAnswerBytesMax) {
            answer = encodeJsonRpcFault({JsonRpcCode::internalError, "The batch's answers are too long", id});
        }
        line_ += line_.empty() ? '[' : ',';
        line_ += answer;
    }

private:
    const Sink sink_;
    Mutex mutex_;
    std::string line_ GUARDED_BY(mutex_);
};

class JsonRpcServer::Reply final : public JsonRpcReply {
public:
    Reply(JsonRpcServer& server, std::string id, std::shared_ptr<Answers> answers)
        : server_(server), id_(std::move(id)), answers_(std::move(answers)) {}

    ~Reply() override {
        error(JsonRpcCode::internalError, "The request was dropped", {});
        answers_.reset();  // Before the request counts as done: the batch's line is written by this.
        server_.leave(id_);
    }

    void result(const std::function<void(std::string& out)>& append) override {
        if (!beginAnswer() || isNotification()) return;
        std::string answer = fmt::format(R"({{"jsonrpc":"2.0","id":{},"result":)", id_);
        append(answer);
        answer += '}';
        answers_->add(std::move(answer), id_);
    }

    void error(JsonRpcCode code, std::string_view message, std::string_view data) override {
        if (!beginAnswer() || isNotification()) return;
        std::string answer = encodeJsonRpcFault({code, std::string(message), id_});
        if (!data.empty()) answer.insert(answer.size() - 2, fmt::format(R"(,"data":{})", data));
        answers_->add(std::move(answer), id_);
    }

    const std::string& id() const override { return id_; }

    void notify(std::string_view line) override {
        // Under the lock, so that it is out before the answer is.
        const MutexLock lock(mutex_);
        if (!isAnswered_ && !isNotification()) server_.sink_(line);
    }

    void setCancellation(std::function<void()> cancellation) override {
        {
            const MutexLock lock(mutex_);
            if (isAnswered_) return;
            if (!isCancelled_) {
                cancellation_ = std::move(cancellation);
                return;
            }
        }
        cancellation();
    }

    void cancel() {
        std::function<void()> cancellation;
        {
            const MutexLock lock(mutex_);
            isCancelled_ = true;
            cancellation.swap(cancellation_);
        }
        if (cancellation) cancellation();
    }

private:
    bool isNotification() const { return id_.empty(); }

    /// False when the request has been answered before.
    bool beginAnswer() {
        std::function<void()> cancellation;  // What it holds goes after the lock.
        const MutexLock lock(mutex_);
        cancellation.swap(cancellation_);
        return !std::exchange(isAnswered_, true);
    }

    JsonRpcServer& server_;
    const std::string id_;
    std::shared_ptr<Answers> answers_;
    Mutex mutex_;
    bool isAnswered_ GUARDED_BY(mutex_) = false;
    bool isCancelled_ GUARDED_BY(mutex_) = false;
    std::function<void()> cancellation_ GUARDED_BY(mutex_);
};

JsonRpcServer::JsonRpcServer(Methods methods, Sink sink) : methods_(std::move(methods)), sink_(std::move(sink)) {}

JsonRpcServer::~JsonRpcServer() {
    waitUntilIdle();
}

void JsonRpcServer::receiveLine(std::string_view line) {
    receiveLine(line, sink_);
}

void JsonRpcServer::receiveLine(std::string_view line, const Sink& sink) {
    JsonRpcLine decoded = decodeJsonRpcLine(line);
    std::shared_ptr<Answers> answers;
    if (decoded.isBatch) {
        answers = std::make_shared<BatchAnswers>(sink);
    } else {
        answers = std::make_shared<SingleAnswer>(sink);
    }
    for (JsonRpcEntry& entry : decoded.entries) receive(std::move(entry), answers);
}

void JsonRpcServer::receiveLongLine() {
    SingleAnswer(sink_).add(encodeJsonRpcFault({JsonRpcCode::invalidRequest, "The line is longer than 16 MiB"}),
                            "null");
}

void JsonRpcServer::receive(JsonRpcEntry entry, const std::shared_ptr<Answers>& answers) {
    if (const auto* fault = std::get_if<JsonRpcFault>(&entry)) {
        answers->add(encodeJsonRpcFault(*fault), fault->id);
    } else {
        start(std::get<JsonRpcRequest>(std::move(entry)), answers);
    }
}

void JsonRpcServer::start(JsonRpcRequest request, const std::shared_ptr<Answers>& answers) {
    enter();
    const auto reply = std::make_shared<Reply>(*this, std::move(request.id), answers);
    const auto method = methods_.find(request.method);
    const bool isCancel = request.method == kCancelMethod;
    if (method == methods_.end() && !isCancel) {
        reply->error(JsonRpcCode::methodNotFound, "There is no such method", {});
        return;
    }
    if (!request.params.is_object()) {
        reply->error(JsonRpcCode::invalidParams, "Parameters are given by name", {});
        return;
    }
    // On the thread that receives: what was sent before is known here, whether or not it has begun.
    if (isCancel) return cancel(request.params, *reply);
    {
        const MutexLock lock(mutex_);
        if (!reply->id().empty()) cancellable_.emplace(reply->id(), reply);
    }
    // The task keeps the reply too: a request is under way until its answer is written and its task is over.
    dispatchAsync([&run = method->second, params = std::move(request.params), reply] { run(params, reply); });
}

void JsonRpcServer::cancel(const Json& params, JsonRpcReply& reply) {
    const auto given = params.find("request");
    const auto id = given != params.end() ? jsonRpcIDText(*given) : std::nullopt;
    if (!id) return reply.error(JsonRpcCode::invalidParams, "\"request\" is not the id of a request");
    std::vector<std::shared_ptr<Reply>> cancelled;
    {
        const MutexLock lock(mutex_);
        const auto [first, last] = cancellable_.equal_range(*id);
        for (auto each = first; each != last; ++each) {
            if (auto present = each->second.lock()) cancelled.push_back(std::move(present));
        }
    }
    for (const auto& each : cancelled) each->cancel();
    reply.result([](std::string& out) { out += "{}"; });
}

void JsonRpcServer::enter() {
    const MutexLock lock(mutex_);
    while (inFlight_ >= kRequestsInFlightMax) changed_.wait(mutex_);
    ++inFlight_;
}

void JsonRpcServer::leave(const std::string& id) {
    const MutexLock lock(mutex_);
    const auto [first, last] = cancellable_.equal_range(id);
    for (auto each = first; each != last;) each = each->second.expired() ? cancellable_.erase(each) : std::next(each);
    --inFlight_;
    // Under the lock: who waits may destroy the server as soon as it is free.
    changed_.notifyAll();
}

void JsonRpcServer::waitUntilIdle() {
    const MutexLock lock(mutex_);
    while (inFlight_ > 0) changed_.wait(mutex_);
}

}  // namespace cindral
