#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "host/HostOptions.h"
#include "host/StateHandover.h"
#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"

namespace cindral {

/// A daemon that answers, and what it says of itself. Paths are absolute.
struct FoundDaemon {
    UniqueFd socket;  ///< connected; nothing is under way on it
    std::uint64_t process = 0;
    std::string storage;        ///< the real path
    std::string storageOption;  ///< as the daemon's own call says it
    std::string recorderOption;
    std::vector<std::string> applications;
    bool flatpak = true;
    bool desktopTags = false;
};

/// Either there is a daemon for the state folder; or there is none, and there won't be while the handover is held: until
/// the caller has the store's lock, or was refused it by a process that is no daemon.
struct DaemonSearch {
    std::optional<FoundDaemon> daemon;
    std::optional<StateHandover> handover;  ///< none also where there is no state folder yet
};

/// Looks for the daemon of the options' state folder. Waits for one that is being started or stopped.
///
/// Errors are the host's own: the daemon is another person's, or can't be understood.
Result<DaemonSearch> findDaemon(const HostOptions& options);

/// The options with what the daemon was started with in place of what the call's words don't say. An error where they
/// say something else than the daemon was started with.
Result<HostOptions> agreeWithDaemon(HostOptions options, const FoundDaemon& daemon);

}  // namespace cindral
