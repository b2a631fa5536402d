#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "platform/foundation/Mutex.h"
#include "platform/tessel/TesselEnumerator.h"
#include "provider/fs/FSChangeToken.h"
#include "provider/fs/FSEventReader.h"

namespace cindral {

/// Changes that a client is given at once.
inline constexpr std::uint64_t kChangesBatchMax = 100;

/// Where a reader stopped, and how many changes it had reported.
struct FSReaderState {
    std::uint64_t eventID = 0;
    std::uint64_t offset = 0;
    std::uint64_t numberOfChanges = 0;
};

/// Answers one request for the changes of a container since an anchor.
///
/// The history is replayed twice, first by paths, then by documents, and every event is put to one question: would a
/// listing of the container deliver this object now, under this identifier? If so, the item is forwarded as an update,
/// otherwise the identifier as deleted. So a client that applies what it is given, and then lists, finds nothing new.
///
/// An event whose object is not where the event says puts the identifiers that it had there to that question: that of
/// the document that it was, or of its file ID where it was none.
///
/// An event comes to one change at most, but for a scan, which is never cut: the anchor that is handed back stands behind
/// the last event that was handled wholly. Of what changes with a folder that moves (it is in the trash now, or in a
/// package), the events of what is below it tell.
///
/// Thread safety: create(), start() and stop(), from any thread. All else on the reader's queue.
class FSChangesEnumerator : public FSEventReaderDelegate, public std::enable_shared_from_this<FSChangesEnumerator> {
public:
    /// Whether folders are scanned where events alone don't tell, which may take as long as all of the container takes,
    /// or the observer is finished with EAGAIN there.
    enum class Scans { made, refused };
    /// `token` is the anchor's, `currentEventID` the newest event when the request came. An empty list of URLs is a
    /// programming error and stops the process.
    static std::shared_ptr<FSChangesEnumerator> create(TesselItemIdentifier container, std::vector<KsURL> urls,
                                                       std::shared_ptr<TesselChangeObserver> observer,
                                                       FSChangeToken token, std::uint64_t currentEventID,
                                                       Scans scans = Scans::made);

    void start();
    /// Ends the enumeration, unless it has ended: the observer is finished with ECANCELED, soon, on the reader's queue.
    void stop();

    LookFurther readerDidReceiveEvent(FSEventReader& reader, const Event& event, std::string_view path) override;
    bool readerShouldMakeItem(FSEventReader& reader, const Event& event, const KsURL& entry) override;
    void readerDidUpdateItem(FSEventReader& reader, const Event& event, const TesselItemIdentifier& identifier,
                             const std::shared_ptr<const TesselItem>& item) override;
    void readerDidDeleteItem(FSEventReader& reader, const Event& event,
                             const TesselItemIdentifier& identifier) override;
    void readerDidDropEvent(FSEventReader& reader, const Event& event, const TesselItemIdentifier& identifier) override;
    void readerMustScan(FSEventReader& reader, const Event& event) override;
    void readerDidLoseEvents(FSEventReader& reader, const Event& event) override;
    void readerDidFail(FSEventReader& reader, const KsError& error) override;
    void readerDidFinishHistory(FSEventReader& reader, std::uint64_t eventID) override;

private:
    /// One change of what a client has: an item as it is now, or an identifier of nothing that is listed.
    using Change = std::variant<std::shared_ptr<const TesselItem>, TesselItemIdentifier>;
    /// What came of one question.
    struct Answer;
    /// Which object an URL named when the enumeration began; none where none.
    using Place = std::optional<std::pair<std::uint64_t, std::uint64_t>>;

    FSChangesEnumerator(TesselItemIdentifier container, std::vector<KsURL> urls,
                        std::shared_ptr<TesselChangeObserver> observer, FSChangeToken token,
                        std::uint64_t currentEventID, Scans scans);
    static std::vector<Place> placesOf(const std::vector<KsURL>& urls);
    std::shared_ptr<FSEventReader> makeReader(FSEventReaderMode mode, bool verbose);

    // What is listed.
    static std::optional<TesselItemIdentifier> identifierOf(const Event& event);
    bool isEndOfFolder(const Event& event) const;
    Result<void> forwardMoved(const Event& event, std::shared_ptr<const TesselItem> item);
    static bool leftTrash(const Event& event);
    static bool isToldByPath(const Event& event);
    /// Whether the object is asked for under the identifier alone, or under whatever it is listed by.
    enum class Identifier { thatOne, any };
    Result<Answer> ask(FSEventReader& reader, const TesselItemIdentifier& identifier,
                       Identifier asked = Identifier::thatOne);
    Result<Answer> askOnce(FSEventReader& reader, const TesselItemIdentifier& identifier, Identifier asked);
    Result<Answer> answerOf(KsURL entry, const TesselItemIdentifier& identifier, Identifier asked);
    void askAbout(FSEventReader& reader, const Event& event, const std::optional<TesselItemIdentifier>& identifier);
    void askAboutNewcomer(FSEventReader& reader, const Event& event);
    static bool isNewcomer(const Event& event);

    // What is forwarded.
    bool isBatchFull() const;
    void forward(const Change& change);
    void forwardDeletion(const TesselItemIdentifier& identifier);
    void didHandle(FSEventReader& reader, const Event& event);
    Result<void> scan(const std::vector<KsURL>& folders);

    // How it ends.
    bool end(FSEventReader& reader);
    void endWithError(FSEventReader& reader, const KsError& error);
    void askAgain(FSEventReader& reader);
    void finish(FSEventReader& reader, std::uint64_t eventID);
    void finishPathBased(const FSReaderState& position);
    void finishDocIDBased(FSEventReader& reader, const FSReaderState& position);
    void choosePosition(FSReaderState docIDBased);

    // Constant after construction.
    const TesselItemIdentifier container_;
    const std::vector<KsURL> urls_;
    const std::shared_ptr<TesselChangeObserver> observer_;
    const FSChangeToken receivedToken_;
    const std::uint64_t sinceFSEventID_;
    const std::uint64_t startupFSEventID_;
    const Scans scans_;
    const std::vector<Place> places_;

    // The current reader's queue's.
    FSChangeToken currentToken_;
    std::uint64_t numberOfChanges_ = 0;
    std::uint64_t numberOfReaderCaughtUp_ = 0;
    std::optional<FSReaderState> pathBasedReaderState_;

    Mutex mutex_;
    std::shared_ptr<FSEventReader> reader_ GUARDED_BY(mutex_);
    bool isOver_ GUARDED_BY(mutex_) = false;  ///< stopped or finished: the observer is nobody else's to finish
};

}  // namespace cindral
