#include "host/DaemonConnection.h"

#include <fmt/format.h>
#include <sys/socket.h>

#include <cstddef>
#include <utility>
#include <vector>

#include "host/Awaited.h"
#include "host/Descriptor.h"
#include "host/HostError.h"
#include "host/JsonText.h"
#include "host/LineSplitter.h"
#include "host/RemoteError.h"
#include "platform/foundation/BackgroundThread.h"

namespace cindral {
namespace {

// The answer to one request may be a batch of thumbnails; a daemon is trusted, its user's own.
constexpr std::size_t kAnswerBytesMax = std::size_t{1} << 30;

KsError lostConnection() {
    return hostFailure("the connection to the daemon was lost");
}

}  // namespace

DaemonConnection::Params& DaemonConnection::Params::add(std::string_view key, std::string_view text) {
    return addJson(key, jsonString(text));
}

DaemonConnection::Params& DaemonConnection::Params::addJson(std::string_view key, std::string_view json) {
    if (text_.size() > 1) text_ += ',';
    appendJsonString(text_, key);
    text_ += ':';
    text_ += json;
    return *this;
}

DaemonConnection::DaemonConnection(UniqueFd socket, SignalDispatcher& signals, std::function<void()> didEnd)
    : socket_(std::move(socket)), signals_(signals), didEnd_(std::move(didEnd)) {
    reading_.enter();
    const int failure = startBackgroundThread([this] {
        nameCurrentThread("cindral-answers");
        read();
        reading_.leave();
    });
    if (failure == 0) return;
    reading_.leave();
    isOver_ = true;
}

DaemonConnection::~DaemonConnection() {
    {
        const MutexLock lock(mutex_);
        isClosing_ = true;
    }
    ::shutdown(socket_.get(), SHUT_RDWR);
    reading_.wait();
}

// MARK: Requests

void DaemonConnection::send(std::string_view method, const Params& params, Completion completion,
                            std::shared_ptr<TesselProgress> progress) {
    start(
        method, params,
        {[completion = std::move(completion)](Result<Json> answer, std::string_view) { completion(std::move(answer)); },
         std::move(progress)});
}

void DaemonConnection::start(std::string_view method, const Params& params, Pending pending) {
    std::uint64_t id = 0;
    {
        const MutexLock lock(mutex_);
        if (!isOver_) {
            id = ++lastID_;
            pending.isSent = !isCancelled_;
            pending_.emplace(id, pending);
        }
    }
    if (id == 0) return pending.completion(lostConnection(), {});
    if (pending.isSent) write(id, method, params);
}

/// A daemon that is gone is found out by who reads.
void DaemonConnection::write(std::uint64_t id, std::string_view method, const Params& params) {
    const std::string line = fmt::format(R"({{"jsonrpc":"2.0","id":{},"method":"{}","params":{}}})"
                                         "\n",
                                         id, method, params.text());
    const MutexLock lock(writeMutex_);
    (void)descriptor::writeAll(socket_.get(), line);
}

Result<Json> DaemonConnection::call(std::string_view method, const Params& params) {
    Awaited<Result<Json>> answer;
    send(method, params, answer.completion());
    return answer.wait();
}

Result<std::string> DaemonConnection::callForText(std::string_view method, const Params& params) {
    static constexpr std::string_view kResult = R"("result":)";  // The last of an answer's members.
    Awaited<Result<std::string>> answer;
    start(method, params,
          {[done = answer.completion()](const Result<Json>& result, std::string_view line) {
               if (!result.ok()) return done(result.error());
               line.remove_prefix(line.find(kResult) + kResult.size());
               done(std::string(line.substr(0, line.rfind('}'))));
           },
           nullptr});
    return answer.wait();
}

std::vector<std::uint64_t> DaemonConnection::cancellable() {
    std::vector<std::uint64_t> ids;
    for (const auto& [id, pending] : pending_) {
        if (pending.progress) ids.push_back(id);
    }
    return ids;
}

void DaemonConnection::cancelAll() {
    std::vector<std::uint64_t> cancelled;
    {
        const MutexLock lock(mutex_);
        isCancelled_ = true;
        cancelled = cancellable();
    }
    for (const std::uint64_t id : cancelled) write(0, "cancel", Params().addJson("request", fmt::to_string(id)));
    const MutexLock lock(mutex_);
    while (!cancellable().empty()) answered_.wait(mutex_);
}

// MARK: Answers

class DaemonConnection::Lines final : public LineSplitter::Receiver {
public:
    explicit Lines(DaemonConnection& connection) : connection_(connection) {}
    void didReadLine(std::string_view line) override { connection_.receive(line); }
    void didSkipLongLine() override {}

private:
    DaemonConnection& connection_;
};

void DaemonConnection::read() {
    Lines lines(*this);
    LineSplitter splitter(lines, kAnswerBytesMax);
    std::vector<char> buffer(descriptor::kReadBytes);
    while (true) {
        const auto got = descriptor::read(socket_.get(), buffer);
        if (!got.ok() || *got == 0) break;
        splitter.feed({buffer.data(), *got});
    }
    failAll();
}

void DaemonConnection::receive(std::string_view line) {
    Json message = Json::parse(line, nullptr, /*allow_exceptions=*/false);
    if (!message.is_object()) return;
    const auto id = message.find("id");
    if (id == message.end()) {
        notify(message);
    } else if (id->is_number_unsigned()) {
        answer(message, line, id->get<std::uint64_t>());
    }
}

/// None where nobody is to have the answer.
std::optional<DaemonConnection::Pending> DaemonConnection::take(std::uint64_t id) {
    const MutexLock lock(mutex_);
    const auto node = pending_.extract(id);
    answered_.notifyAll();
    if (node.empty() || isCancelled_) return std::nullopt;
    return std::move(node.mapped());
}

void DaemonConnection::answer(Json& message, std::string_view line, std::uint64_t id) {
    const auto pending = take(id);
    if (!pending) return;
    if (const auto error = message.find("error"); error != message.end()) {
        pending->completion(errorFromJson(*error), line);
    } else if (const auto result = message.find("result"); result != message.end()) {
        pending->completion(std::move(*result), line);
    } else {
        pending->completion(unreadableAnswer(), line);
    }
}

void DaemonConnection::notify(const Json& message) {
    const auto method = message.find("method");
    const auto params = message.find("params");
    if (method == message.end() || params == message.end() || !params->is_object()) return;
    if (*method == "signal") {
        const auto container = params->find("container");
        if (container != params->end() && container->is_string())
            signals_.signalEnumerator(container->get<std::string>(), nullptr);
    } else if (*method == "progress" && params->value("request", Json()).is_number_unsigned()) {
        std::shared_ptr<TesselProgress> progress;
        {
            const MutexLock lock(mutex_);
            const auto found = pending_.find(params->at("request").get<std::uint64_t>());
            if (found != pending_.end()) progress = found->second.progress;
        }
        const auto count = [&](const char* key) {
            const auto value = params->find(key);
            return value != params->end() && value->is_number_unsigned() ? value->get<std::uint64_t>() : 0;
        };
        if (progress)
            progress->setCounts(
                {count("completedBytes"), count("totalBytes"), count("completedItems"), count("totalItems")});
    }
}

void DaemonConnection::failAll() {
    std::map<std::uint64_t, Pending> unanswered;
    bool isLost = false;
    {
        const MutexLock lock(mutex_);
        isOver_ = true;
        isLost = !isClosing_;
        unanswered.swap(pending_);
        answered_.notifyAll();
        if (isCancelled_) return;
    }
    for (const auto& [id, pending] : unanswered) pending.completion(lostConnection(), {});
    if (isLost && didEnd_) didEnd_();
}

}  // namespace cindral
