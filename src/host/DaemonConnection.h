#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "host/JsonRpcMessage.h"
#include "host/SignalDispatcher.h"
#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"
#include "platform/tessel/TesselProgress.h"

namespace cindral {

/// A command's connection to the daemon: sends requests, and hands their answers, in whatever order they come, to who
/// asked.
///
/// A thread of its own reads. When the connection ends, everything that is not answered is, with an error of the host's.
///
/// Thread safety: all operations, from any thread. Completions run on the reading thread, once; so do signals.
class DaemonConnection {
public:
    /// The parameters of a request, as JSON text.
    class Params {
    public:
        Params& add(std::string_view key, std::string_view text);
        Params& addJson(std::string_view key, std::string_view json);
        Params& addNull(std::string_view key) { return addJson(key, "null"); }
        std::string text() const { return text_ + "}"; }

    private:
        std::string text_ = "{";
    };

    /// `signals` is told of what the daemon signals; borrowed for life. `didEnd` is called on the reading thread when the
    /// connection ends other than by the destructor.
    DaemonConnection(UniqueFd socket, SignalDispatcher& signals, std::function<void()> didEnd);
    /// Ends the connection, and waits for the reading thread.
    ~DaemonConnection();
    DaemonConnection(const DaemonConnection&) = delete;
    DaemonConnection& operator=(const DaemonConnection&) = delete;

    using Completion = std::function<void(Result<Json>)>;
    /// With a progress, how far the daemon has come with it is put there, and cancelAll() cancels
    /// the request.
    void send(std::string_view method, const Params& params, Completion completion,
              std::shared_ptr<TesselProgress> progress = nullptr);
    Result<Json> call(std::string_view method, const Params& params);
    /// The result as it was written.
    Result<std::string> callForText(std::string_view method, const Params& params);

    /// Asks the daemon to cancel what can be cancelled, and returns when that is answered. From the call on nothing more
    /// is asked, and nobody gets an answer: who waits for one waits for ever.
    void cancelAll();

private:
    using TextCompletion = std::function<void(Result<Json>, std::string_view line)>;
    struct Pending {
        TextCompletion completion;
        std::shared_ptr<TesselProgress> progress;
        bool isSent = true;
    };
    class Lines;
    void read();
    void receive(std::string_view line);
    void start(std::string_view method, const Params& params, Pending pending);
    void answer(Json& message, std::string_view line, std::uint64_t id);
    void notify(const Json& message);
    void failAll();
    void write(std::uint64_t id, std::string_view method, const Params& params);
    std::optional<Pending> take(std::uint64_t id);
    std::vector<std::uint64_t> cancellable() REQUIRES(mutex_);

    const UniqueFd socket_;
    SignalDispatcher& signals_;
    const std::function<void()> didEnd_;
    DispatchGroup reading_;

    Mutex writeMutex_;  ///< held while a line is written, so that lines stay whole
    Mutex mutex_;
    std::map<std::uint64_t, Pending> pending_ GUARDED_BY(mutex_);
    std::uint64_t lastID_ GUARDED_BY(mutex_) = 0;
    bool isOver_ GUARDED_BY(mutex_) = false;
    bool isClosing_ GUARDED_BY(mutex_) = false;
    bool isCancelled_ GUARDED_BY(mutex_) = false;
    Condition answered_;
};

}  // namespace cindral
