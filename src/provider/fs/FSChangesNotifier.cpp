#include "provider/fs/FSChangesNotifier.h"

#include <utility>

#include "platform/foundation/Dispatch.h"
#include "platform/foundation/Fatal.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/SharedTimer.h"
#include "platform/tessel/TesselManager.h"
#include "provider/ContainerContents.h"

namespace cindral {

namespace {

std::string descriptionOf(const std::vector<KsURL>& urls) {
    std::string text = "[";
    for (const KsURL& url : urls) {
        if (text.size() > 1) text += ", ";
        text += url.description();
    }
    return text + "]";
}

/// What one signal's completions have to say. Outlives the wait: an answer may come later.
struct Answers {
    DispatchGroup group;
    std::atomic<bool> isRefused = false;
};

void signalContainer(const TesselItemIdentifier& container, const std::shared_ptr<Answers>& answers) {
    answers->group.enter();
    // An answer that comes twice counts once.
    auto isAnswered = std::make_shared<std::atomic<bool>>(false);
    TesselManager::defaultManager().signalEnumeratorForContainerItemIdentifier(
        container, [container, answers, isAnswered](const std::optional<KsError>& error) {
            if (isAnswered->exchange(true)) return;
            if (error) {
                logError("can't signal changes for \"{}\"; {}", container, error->description());
                answers->isRefused = true;
            }
            answers->group.leave();
        });
}

}  // namespace

std::shared_ptr<FSChangesNotifier> FSChangesNotifier::create(TesselItemIdentifier container, std::vector<KsURL> urls) {
    return create(std::move(container), std::move(urls), Timing());
}

std::shared_ptr<FSChangesNotifier> FSChangesNotifier::create(TesselItemIdentifier container, std::vector<KsURL> urls,
                                                             Timing timing) {
    if (urls.empty()) fatal("require at least one URL to init a change notifier");
    const std::optional<KsUUID> deviceUUID = EventStream::volumeUUID(urls.front());
    if (!deviceUUID) {
        logError("can't get volume UUID for \"{}\"", urls.front().description());
        return nullptr;
    }
    std::shared_ptr<FSChangesNotifier> notifier(new FSChangesNotifier(std::move(container), urls, *deviceUUID, timing));
    notifier->reader_->setDelegate(notifier);
    return notifier;
}

FSChangesNotifier::FSChangesNotifier(TesselItemIdentifier container, const std::vector<KsURL>& urls, KsUUID deviceUUID,
                                     Timing timing)
    : container_(std::move(container)),
      reader_(
          FSEventReader::create(urls, FSEventReaderMode::pathBased, /*verbose=*/false, EventStream::currentEventID())),
      deviceUUID_(deviceUUID),
      timing_(timing) {}

FSChangesNotifier::~FSChangesNotifier() {
    reader_->stop();
}

void FSChangesNotifier::setClient(std::weak_ptr<TesselEnumerator> client) {
    const MutexLock lock(mutex_);
    client_ = std::move(client);
}

void FSChangesNotifier::start() {
    {
        const MutexLock lock(mutex_);
        if (std::exchange(isStarted_, true)) return;
    }
    SharedTimer::shared().callAt(std::chrono::steady_clock::now() + timing_.startDelay, [weak = weak_from_this()] {
        // Making a stream may wait for the history's locks, and the timer is everybody's.
        if (!weak.expired()) {
            dispatchAsync([weak] {
                if (const auto self = weak.lock()) self->startReader();
            });
        }
    });
}

void FSChangesNotifier::startReader() {
    {
        const MutexLock lock(mutex_);
        if (!isStarted_) return;
    }
    reader_->start();
    bool isStopped = false;
    {
        const MutexLock lock(mutex_);
        isStopped = !isStarted_;
    }
    if (isStopped) reader_->stop();
}

bool FSChangesNotifier::isStarted() {
    const MutexLock lock(mutex_);
    return isStarted_;
}

void FSChangesNotifier::stop() {
    {
        const MutexLock lock(mutex_);
        isStarted_ = false;
    }
    reader_->stop();
}

FSEventReaderDelegate::LookFurther FSChangesNotifier::readerDidReceiveEvent(FSEventReader& /*reader*/,
                                                                            const Event& event, std::string_view path) {
    if (container_contents::covers(container_, reader_->urls(), path)) signal(event.id);
    return LookFurther::no;
}

void FSChangesNotifier::readerMustScan(FSEventReader& /*reader*/, const Event& event) {
    signal(event.id);
}

void FSChangesNotifier::readerDidMoveDirectory(FSEventReader& /*reader*/, const Event& event) {
    signal(event.id);
}

void FSChangesNotifier::readerDidLoseEvents(FSEventReader& /*reader*/, const Event& event) {
    signal(event.id);
}

void FSChangesNotifier::readerDidFinishHistory(FSEventReader& /*reader*/, std::uint64_t /*eventID*/) {}

void FSChangesNotifier::signal(std::uint64_t eventID) {
    reader_->assertOnQueue();
    {
        const MutexLock lock(mutex_);
        if (client_.expired()) return;
    }
    if (shouldSignalChange_.exchange(true)) return;
    if (!sendSignal(eventID)) shouldSignalChange_ = false;
}

/// False when the host has not taken it.
bool FSChangesNotifier::sendSignal(std::uint64_t eventID) {
    const LogSection section("<FSChangesNotifier {}> notifies changes on {}", container_,
                             descriptionOf(reader_->urls()));
    const auto answers = std::make_shared<Answers>();
    for (const TesselItemIdentifier& container : {container_}) signalContainer(container, answers);
    if (answers->group.wait(timing_.answerWait) == WaitResult::timedOut) {
        logDebug("notifying changes up to FSEventID {} timed out", eventID);
        return false;
    }
    logDebug("notified changes up to FSEventID {}", eventID);
    return !answers->isRefused;
}

}  // namespace cindral
