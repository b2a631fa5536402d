#pragma once

#include <functional>
#include <memory>
#include <string>

#include "host/ErrorLog.h"
#include "host/HostOptions.h"
#include "host/PresentedPaths.h"
#include "host/SignalDispatcher.h"
#include "host/search/SearchIndex.h"
#include "platform/eventstream/Recorder.h"
#include "platform/foundation/Result.h"
#include "platform/revisions/VolumeStore.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// Before a provider is made: sets aside what would keep one from starting, in the folder in which providers keep what
/// they know. Answers the new paths.
using ProviderRepair = Result<std::vector<std::string>> (*)(const std::string& applicationSupport);

/// The host: the folders, the stores and the provider of one process, set up and taken down in order.
///
/// One per process: much of what it sets up is the process's own.
///
/// Thread safety: immutable once started.
class HostProcess {
public:
    /// What else is to be done on the way, with the state folder's real path. An error ends the start; null does nothing.
    struct Steps {
        std::function<Result<void>(const std::string& state)> stateIsThere;  ///< and may be another process's
        std::function<Result<void>(const std::string& state)> stateIsOurs;   ///< its store is locked
    };
    /// Errors are the host's own, with a line for people. Where another process uses the state folder, "holder" in the user
    /// info says which.
    static Result<std::unique_ptr<HostProcess>> start(HostOptions options, const HostEnvironment& environment,
                                                      TesselExtensionFactory makeProvider, const Steps& steps = {});
    /// Before a start, of a state folder that nobody uses: sets aside what would keep one from coming to its end. Answers
    /// the new paths.
    static Result<std::vector<std::string>> setAsideWhatStops(const std::string& state, ProviderRepair repairProvider);
    ~HostProcess();
    HostProcess(const HostProcess&) = delete;
    HostProcess& operator=(const HostProcess&) = delete;

    const HostOptions& options() const { return options_; }
    const PresentedPaths& paths() const { return paths_; }
    /// The state folder's real path.
    const std::string& state() const { return state_; }
    const std::shared_ptr<TesselExtension>& provider() const { return provider_; }

    /// Where the provider's signals arrive.
    SignalDispatcher& signals() const { return *signals_; }
    SearchIndex& search() const { return *search_; }

    /// Returns when the roots have been read or compared.
    void waitForHistory() const;
    /// What `status` answers, as JSON text.
    std::string statusText() const;
    /// Compares and repairs, and answers what `doctor` answers, as JSON text. May take as long as a first reading.
    Result<std::string> doctorText() const;
    /// What `hello` answers, as JSON text: what a command that finds the daemon has to know of it.
    std::string helloText() const;
    /// The end is near: who waits for the first reading of the roots is told that it will not come to its end.
    void beginStop() const;

private:
    HostProcess(HostOptions options, PresentedPaths paths, std::string state, std::shared_ptr<VolumeStore> store,
                std::unique_ptr<ErrorLog> errors);
    Result<void> connect();
    void startRecorder();

    const HostOptions options_;
    const PresentedPaths paths_;
    const std::string state_;
    const std::unique_ptr<ErrorLog> errors_;  // Before what may log.
    const std::shared_ptr<SignalDispatcher> signals_ = std::make_shared<SignalDispatcher>();
    std::shared_ptr<VolumeStore> store_;
    std::shared_ptr<Recorder> recorder_;  // Null for commands that don't ask for changes.
    std::shared_ptr<TesselExtension> provider_;
    std::shared_ptr<SearchIndex> search_;
};

}  // namespace cindral
