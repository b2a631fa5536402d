#pragma once

#include <memory>
#include <string>

#include "host/HostOptions.h"
#include "host/PresentedPaths.h"
#include "host/SignalDispatcher.h"
#include "host/search/SearchIndex.h"
#include "platform/eventstream/Recorder.h"
#include "platform/foundation/Result.h"
#include "platform/revisions/VolumeStore.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// The host: the folders, the stores and the provider of one process, set up and taken down in order.
///
/// One per process: much of what it sets up is the process's own.
///
/// Thread safety: immutable once started.
class HostProcess {
public:
    /// Errors are the host's own, with a line for people.
    static Result<std::unique_ptr<HostProcess>> start(HostOptions options, const HostEnvironment& environment,
                                                      TesselExtensionFactory makeProvider);
    ~HostProcess();
    HostProcess(const HostProcess&) = delete;
    HostProcess& operator=(const HostProcess&) = delete;

    const HostOptions& options() const { return options_; }
    const PresentedPaths& paths() const { return paths_; }
    const std::shared_ptr<TesselExtension>& provider() const { return provider_; }

    /// Where the provider's signals arrive.
    SignalDispatcher& signals() const { return *signals_; }
    SearchIndex& search() const { return *search_; }

    /// Returns when the roots have been read or compared.
    void waitForHistory() const;
    /// What `status` answers, as JSON text.
    std::string statusText() const;

private:
    HostProcess(HostOptions options, PresentedPaths paths, std::string state, std::shared_ptr<VolumeStore> store);
    Result<void> connect();
    void startRecorder();

    const HostOptions options_;
    const PresentedPaths paths_;
    const std::string state_;
    const std::shared_ptr<SignalDispatcher> signals_ = std::make_shared<SignalDispatcher>();
    std::shared_ptr<VolumeStore> store_;
    std::shared_ptr<Recorder> recorder_;  // Null for commands that don't ask for changes.
    std::shared_ptr<TesselExtension> provider_;
    std::shared_ptr<SearchIndex> search_;
};

}  // namespace cindral
