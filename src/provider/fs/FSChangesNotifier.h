#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/KsUUID.h"
#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselTypes.h"
#include "provider/fs/FSEventReader.h"

namespace cindral {

class TesselEnumerator;

/// Signals a container when something happens in its folders, so that the host asks for its changes.
///
/// One signal is enough until the host has enumerated: what is reported meanwhile is in what it will be given. A signal
/// that the host refused, or has not answered in time, is repeated by the next report.
///
/// Events from before the notifier was made are never signalled; those from before start() are.
///
/// Thread safety: all operations, from any thread. Signals are sent on the reader's queue, one at a time.
class FSChangesNotifier : public FSEventReaderDelegate, public std::enable_shared_from_this<FSChangesNotifier> {
public:
    struct Timing {
        std::chrono::milliseconds answerWait{3000};
        /// From start() until the reader is started. What is made for one request is let go of sooner, and costs no
        /// stream; what happens meanwhile is replayed when the reader starts.
        std::chrono::milliseconds startDelay{100};
    };

    /// Null, after an error line, when the volume of the first URL can't be told. An empty list of URLs is a
    /// programming error and stops the process.
    static std::shared_ptr<FSChangesNotifier> create(TesselItemIdentifier container, std::vector<KsURL> urls,
                                                     Timing timing);
    static std::shared_ptr<FSChangesNotifier> create(TesselItemIdentifier container, std::vector<KsURL> urls);
    ~FSChangesNotifier() override;

    /// On whose behalf the container is signalled; once it is gone, nothing is. Borrowed.
    void setClient(std::weak_ptr<TesselEnumerator> client);
    void start();
    void stop();
    bool isStarted();
    /// The host has come, and is given everything up to now: what is reported from here on is news.
    void hostDidEnumerate() { shouldSignalChange_ = false; }

    const KsUUID& deviceUUID() const { return deviceUUID_; }

    LookFurther readerDidReceiveEvent(FSEventReader& reader, const Event& event, std::string_view path) override;
    void readerMustScan(FSEventReader& reader, const Event& event) override;
    void readerDidMoveDirectory(FSEventReader& reader, const Event& event) override;
    void readerDidLoseEvents(FSEventReader& reader, const Event& event) override;
    void readerDidFinishHistory(FSEventReader& reader, std::uint64_t eventID) override;

private:
    FSChangesNotifier(TesselItemIdentifier container, const std::vector<KsURL>& urls, KsUUID deviceUUID, Timing timing);
    void startReader();
    void signal(std::uint64_t eventID);
    bool sendSignal(std::uint64_t eventID);

    // Constant after construction.
    const TesselItemIdentifier container_;
    const std::shared_ptr<FSEventReader> reader_;
    const KsUUID deviceUUID_;
    const Timing timing_;

    /// A report has led to a signal since the host last enumerated.
    std::atomic<bool> shouldSignalChange_ = false;

    Mutex mutex_;
    std::weak_ptr<TesselEnumerator> client_ GUARDED_BY(mutex_);
    bool isStarted_ GUARDED_BY(mutex_) = false;
};

}  // namespace cindral
