#include "provider/fs/FSEventReader.h"

#include "provider/fs/FSGatherWitness.h"

namespace cindral {

FSEventReaderGatherPhaseResumeStatus FSEventReader::canResumeGatherPhase(const std::vector<KsURL>& on,
                                                                         std::uint64_t previousEventID) {
    if (FSGatherWitness::shared().holds(on, previousEventID)) return CanResume();
    return CantReplayHistoricalFSEvents();
}

}  // namespace cindral
