#include "host/JsonRpcServer.h"

#include <fmt/format.h>

#include "platform/foundation/SerialQueue.h"

namespace cindral {

/// Where the answers of one line go.
class JsonRpcServer::Answers {
public:
    virtual ~Answers() = default;
    /// JSON text without a newline.
    virtual void add(std::string answer, const std::string& id) = 0;
};

class JsonRpcServer::SingleAnswer final : public Answers {
public:
    explicit SingleAnswer(const Sink& sink) : sink_(sink) {}
    void add(std::string answer, const std::string& /*id*/) override {
        answer += '\n';
        sink_(answer);
    }

private:
    const Sink& sink_;
};

/// Collects until the last of its references is gone: that is when every request of the batch has been answered.
class JsonRpcServer::BatchAnswers final : public Answers {
public:
    explicit BatchAnswers(const Sink& sink) : sink_(sink) {}
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
    const Sink& sink_;
    Mutex mutex_;
    std::string line_ GUARDED_BY(mutex_);
};

class JsonRpcServer::Reply final : public JsonRpcReply {
public:
    Reply(JsonRpcServer& server, std::string id, std::shared_ptr<Answers> answers)
        : server_(server), id_(std::move(id)), answers_(std::move(answers)) {}

    ~Reply() override {
        if (!isAnswered_) error(JsonRpcCode::internalError, "The request was dropped", {});
        answers_.reset();  // Before the request counts as done: the batch's line is written by this.
        server_.leave();
    }

    void result(const std::function<void(std::string& out)>& append) override {
        if (isAnswered_.exchange(true) || isNotification()) return;
        std::string answer = fmt::format(R"({{"jsonrpc":"2.0","id":{},"result":)", id_);
        append(answer);
        answer += '}';
        answers_->add(std::move(answer), id_);
    }

    void error(JsonRpcCode code, std::string_view message, std::string_view data) override {
        if (isAnswered_.exchange(true) || isNotification()) return;
        std::string answer = encodeJsonRpcFault({code, std::string(message), id_});
        if (!data.empty()) answer.insert(answer.size() - 2, fmt::format(R"(,"data":{})", data));
        answers_->add(std::move(answer), id_);
    }

private:
    bool isNotification() const { return id_.empty(); }

    JsonRpcServer& server_;
    const std::string id_;
    std::shared_ptr<Answers> answers_;
    std::atomic<bool> isAnswered_ = false;
};

JsonRpcServer::JsonRpcServer(Methods methods, Sink sink) : methods_(std::move(methods)), sink_(std::move(sink)) {}

JsonRpcServer::~JsonRpcServer() {
    waitUntilIdle();
}

void JsonRpcServer::receiveLine(std::string_view line) {
    JsonRpcLine decoded = decodeJsonRpcLine(line);
    std::shared_ptr<Answers> answers;
    if (decoded.isBatch) {
        answers = std::make_shared<BatchAnswers>(sink_);
    } else {
        answers = std::make_shared<SingleAnswer>(sink_);
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
    std::shared_ptr<JsonRpcReply> reply = std::make_shared<Reply>(*this, std::move(request.id), answers);
    const auto method = methods_.find(request.method);
    if (method == methods_.end()) {
        reply->error(JsonRpcCode::methodNotFound, "There is no such method");
        return;
    }
    if (!request.params.is_object()) {
        reply->error(JsonRpcCode::invalidParams, "Parameters are given by name");
        return;
    }
    // The task keeps the reply too: a request is under way until its answer is written and its task is over.
    dispatchAsync(
        [&run = method->second, params = std::move(request.params), reply = std::move(reply)] { run(params, reply); });
}

void JsonRpcServer::enter() {
    const MutexLock lock(mutex_);
    while (inFlight_ >= kRequestsInFlightMax) changed_.wait(mutex_);
    ++inFlight_;
}

void JsonRpcServer::leave() {
    const MutexLock lock(mutex_);
    --inFlight_;
    // Under the lock: who waits may destroy the server as soon as it is free.
    changed_.notifyAll();
}

void JsonRpcServer::waitUntilIdle() {
    const MutexLock lock(mutex_);
    while (inFlight_ > 0) changed_.wait(mutex_);
}

}  // namespace cindral
