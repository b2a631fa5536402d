#pragma once

#include <cstdint>
#include <string>
#include <variant>
#include <vector>

#include "platform/foundation/KsURL.h"

namespace cindral {

/// Whether a listing may go on from a later page: something was deleted since its first page, nothing was, or it can't
/// be told.
struct DeletionOccurred {
    std::string path;
};
struct CanResume {};
struct CantReplayHistoricalFSEvents {};
using FSEventReaderGatherPhaseResumeStatus = std::variant<DeletionOccurred, CanResume, CantReplayHistoricalFSEvents>;

/// Answers what happened below some directories since an event.
///
/// There is no event history to replay. What can be proven is proven from what the listings of this process have seen
/// (FSGatherWitness): a folder whose modification and change time are what they were when it was read has neither
/// gained nor lost an entry.
///
/// Thread safety: all operations, from any thread.
class FSEventReader {
public:
    /// `previousEventID` is the one that the listing's first page was given.
    static FSEventReaderGatherPhaseResumeStatus canResumeGatherPhase(const std::vector<KsURL>& on,
                                                                     std::uint64_t previousEventID);
};

}  // namespace cindral
