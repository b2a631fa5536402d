#include "provider/fs/FSChangesEnumerator.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <utility>

#include "platform/foundation/Fatal.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/ThreadPool.h"
#include "platform/revisions/RvStorageManager.h"
#include "platform/revisions/VolumeIndex.h"
#include "platform/tessel/TesselErrors.h"
#include "provider/ContainerContents.h"
#include "provider/KsURL+CdlFileObjectIdentifier.h"
#include "provider/Utilities.h"

namespace cindral {

namespace {

// Times that an object which is not where the store says is looked for again, each time with the store up to date.
constexpr int kLooksForObjectMax = 5;
// Entries of a scan that are made items of together.
constexpr std::size_t kScanEntriesMax = 200;

constexpr std::string_view kFilePrefix = "fid=";

std::uint64_t numberOf(const TesselItemIdentifier& identifier) {
    std::uint64_t number = 0;
    const std::size_t begin = kFilePrefix.size();
    std::from_chars(identifier.data() + begin, identifier.data() + identifier.size(), number);
    return number;
}

bool isFileIdentifier(const TesselItemIdentifier& identifier) {
    return identifier.starts_with(kFilePrefix);
}

/// The object that an identifier stands for, by the store's records.
struct RecordedObject {
    FileID fileID{};
    std::optional<std::int64_t> birthTime;  ///< where only the object of that birth is meant
};

std::optional<RecordedObject> recordedObjectOf(const TesselItemIdentifier& identifier) {
    if (isFileIdentifier(identifier)) return RecordedObject{FileID{numberOf(identifier)}, std::nullopt};
    const auto store = RvStorageManager::defaultManager().store();
    const auto document =
        store ? store->document(DocumentID{static_cast<std::uint32_t>(numberOf(identifier))}) : std::nullopt;
    if (!document) return std::nullopt;
    return RecordedObject{document->fileID, document->birthTime};
}

/// Whether it is the object and not another that has its number or its place.
bool isObject(const RecordedObject& object, const FileStatus& status) {
    return FileID{status.fileID} == object.fileID && (!object.birthTime || status.birthStamp() == *object.birthTime);
}

Result<void> drainHistory() {
    const auto history = EventHistory::shared();
    if (!history) return KsError::posix(ENODEV);
    const ThreadPool::BlockingRegion region;
    return history->drain();
}

}  // namespace

struct FSChangesEnumerator::Answer {
    enum class Kind {
        listed,         ///< under the identifier that was asked for
        notListed,      ///< not at all, or under another
        passedThrough,  ///< a folder of which no item can be made, while what is in it is listed
        trash,          ///< one that is no item by its name, while what is in it is listed
        moving,         ///< it is not where the store says
    };
    Kind kind = Kind::notListed;
    std::shared_ptr<const TesselItem> item{};  ///< listed
    std::string path{};                        ///< moving: where it is not
};

std::shared_ptr<FSChangesEnumerator> FSChangesEnumerator::create(TesselItemIdentifier container,
                                                                 std::vector<KsURL> urls,
                                                                 std::shared_ptr<TesselChangeObserver> observer,
                                                                 FSChangeToken token, std::uint64_t currentEventID,
                                                                 Scans scans) {
    if (urls.empty()) fatal("require at least one URL to init a change enumerator");
    return std::shared_ptr<FSChangesEnumerator>(new FSChangesEnumerator(
        std::move(container), std::move(urls), std::move(observer), std::move(token), currentEventID, scans));
}

FSChangesEnumerator::FSChangesEnumerator(TesselItemIdentifier container, std::vector<KsURL> urls,
                                         std::shared_ptr<TesselChangeObserver> observer, FSChangeToken token,
                                         std::uint64_t currentEventID, Scans scans)
    : container_(std::move(container)),
      urls_(std::move(urls)),
      observer_(std::move(observer)),
      receivedToken_(token),
      sinceFSEventID_(token.streamEventID),
      startupFSEventID_(currentEventID),
      scans_(scans),
      places_(placesOf(urls_)),
      currentToken_(std::move(token)) {}

std::vector<FSChangesEnumerator::Place> FSChangesEnumerator::placesOf(const std::vector<KsURL>& urls) {
    std::vector<Place> places;
    for (const KsURL& url : urls) {
        // What the URL has cached says nothing of now.
        const Result<FileStatus> status = KsURL::fileURL(url.path()).status();
        places.push_back(status.ok() ? Place(std::pair(status->device, status->fileID)) : std::nullopt);
    }
    return places;
}

std::shared_ptr<FSEventReader> FSChangesEnumerator::makeReader(FSEventReaderMode mode, bool verbose) {
    auto reader = FSEventReader::create(urls_, mode, verbose, sinceFSEventID_);
    reader->setDelegate(weak_from_this());
    return reader;
}

void FSChangesEnumerator::start() {
    const MutexLock lock(mutex_);
    if (isOver_ || reader_) return;
    reader_ = makeReader(FSEventReaderMode::pathBased, /*verbose=*/false);
    // With the lock: one that stop() knows of has been started, and can be stopped.
    reader_->start();
}

void FSChangesEnumerator::stop() {
    std::shared_ptr<FSEventReader> reader;
    {
        const MutexLock lock(mutex_);
        if (isOver_ || !reader_) return;
        isOver_ = true;
        reader = reader_;
    }
    reader->stop();
    // Behind what is forwarded now: nothing follows the end.
    reader->async(
        [self = shared_from_this()] { self->observer_->finishEnumeratingWithError(KsError::posix(ECANCELED)); });
}

// What is listed.

/// Under which the object was listed where the event says; none where it was not. A file and a package are listed under
/// their document's identifier, all else under its number's. What became a package, or was one, left its place as what it
/// was.
std::optional<TesselItemIdentifier> FSChangesEnumerator::identifierOf(const Event& event) {
    const auto store = RvStorageManager::defaultManager().store();
    if (event.fileID == FileID{} || !store) return std::nullopt;
    DocumentID documentID = event.documentID;
    if (!(event.flags & EventFlags::removed) && documentID == DocumentID{})
        store->indexed(event.fileID, [&](const IndexedObject& object) { documentID = object.documentID; });
    if (event.kind != ObjectKind::file && event.kind != ObjectKind::package)
        return CdlFileObjectIdentifier::fromFileID(static_cast<std::uint64_t>(event.fileID));
    if (documentID == DocumentID{}) return std::nullopt;
    return CdlFileObjectIdentifier::fromDocumentID(static_cast<std::uint32_t>(documentID));
}

/// Whether nobody was ever given an identifier of the object, which is still recorded.
bool FSChangesEnumerator::isNewcomer(const Event& event) {
    const auto store = RvStorageManager::defaultManager().store();
    bool isListed = true;
    if (store && !(event.flags & EventFlags::removed))
        store->indexed(event.fileID, [&](const IndexedObject& object) { isListed = object.isListed; });
    return !isListed;
}

/// Whether the document ended together with its object: the event before says so, and where.
bool FSChangesEnumerator::isToldByPath(const Event& event) {
    const auto history = EventHistory::shared();
    if (!history || event.id < 2) return false;
    const auto before = history->pathEvents(event.id - 2, 1);
    if (!before.ok() || before->events.empty()) return false;
    const Event& left = before->events.front();
    return left.id == event.id - 1 && (left.flags & EventFlags::removed) && left.documentID == event.documentID;
}

Result<FSChangesEnumerator::Answer> FSChangesEnumerator::ask(FSEventReader& reader,
                                                             const TesselItemIdentifier& identifier, Identifier asked) {
    std::string before;
    for (int looks = 1;; ++looks) {
        Answer answer = TRY(askOnce(reader, identifier, asked));
        if (answer.kind != Answer::Kind::moving) return answer;
        const bool isStill = std::exchange(before, answer.path) == answer.path;
        if (looks == kLooksForObjectMax) {
            // What the store keeps saying of an object that isn't there is wrong; what it says anew may be right soon.
            if (isStill) answer.kind = Answer::Kind::notListed;
            return answer;
        }
        TRY(drainHistory());
        reader.entryFinder().forget();
    }
}

/// By the store's records, which are complete while events are recorded: to look for a number that nothing has any more
/// below all the roots would cost what the tree costs.
Result<FSChangesEnumerator::Answer> FSChangesEnumerator::askOnce(FSEventReader& reader,
                                                                 const TesselItemIdentifier& identifier,
                                                                 Identifier asked) {
    const std::optional<RecordedObject> object = recordedObjectOf(identifier);
    std::optional<std::string> path = object ? recordedPathOf(object->fileID) : std::nullopt;
    if (!path || !container_contents::covers(container_, urls_, *path)) return Answer{};
    FSFoundEntry found = TRY(reader.entryFinder().find(*path));
    if (found.standing == FSFoundEntry::Standing::outside) return Answer{};
    if (found.standing == FSFoundEntry::Standing::missing || !isObject(*object, TRY(found.url->status())))
        return Answer{.kind = Answer::Kind::moving, .path = *std::move(path)};
    return answerOf(*std::move(found.url), identifier, asked);
}

Result<FSChangesEnumerator::Answer> FSChangesEnumerator::answerOf(KsURL entry, const TesselItemIdentifier& identifier,
                                                                  Identifier asked) {
    const bool isEntered = container_contents::isDeep(container_) && entry.ts_isFolder();
    if (!container_contents::isListed(container_, entry)) {
        const bool isTrash = container_contents::isTrashName(entry.lastPathComponent());
        return Answer{.kind = isEntered && isTrash ? Answer::Kind::trash : Answer::Kind::notListed};
    }
    std::vector<KsURL> entries;
    entries.push_back(std::move(entry));
    TesselItems items = TRY(container_contents::itemsOf(std::move(entries)));
    if (items.empty() && isEntered) return Answer{.kind = Answer::Kind::passedThrough};
    const bool isAsked = !items.empty() && (asked == Identifier::any || items.front()->itemIdentifier() == identifier);
    if (!isAsked) return Answer{};
    return Answer{.kind = Answer::Kind::listed, .item = std::move(items.front())};
}

/// Whether the event is where a folder that is no item now ceased to be one. A client that takes a folder out takes out
/// what is in it, too, as far as it has been told: what moved out of it before it ended, but after it moved itself, is
/// still in it when the move is told, and is not told of again.
bool FSChangesEnumerator::isEndOfFolder(const Event& event) const {
    if (!container_contents::isDeep(container_) || event.kind != ObjectKind::folder) return true;
    return !(event.flags & EventFlags::renamed);
}

/// Whether what left its place was a trash there, and so not listed.
bool FSChangesEnumerator::leftTrash(const Event& event) {
    return container_contents::isTrashName(std::string_view(event.path).substr(event.path.rfind('/') + 1));
}

/// With all that is in a folder, where what it left went or moved itself: clients may have had it below something that was
/// told to be gone before this event, and have taken out with that what has no newer event of its own.
Result<void> FSChangesEnumerator::forwardMoved(const Event& event, std::shared_ptr<const TesselItem> item) {
    std::vector<KsURL> folders;
    const bool isCutOff = event.kind == ObjectKind::folder && (event.flags & EventFlags::cutOff);
    if (isCutOff && container_contents::isDeep(container_)) folders.push_back(*item->fileURL());
    forward(std::move(item));
    return scan(folders);
}

/// Puts the identifier that the event's object was listed under to the question.
void FSChangesEnumerator::askAbout(FSEventReader& reader, const Event& event,
                                   const std::optional<TesselItemIdentifier>& identifier) {
    if (!identifier) return;
    if (container_contents::isOfFoldersOnly(container_) && !isFileIdentifier(*identifier)) {
        logDebug("dropping fsevent at {}; item is not a directory", event.path);
        return;
    }
    Result<Answer> answer = ask(reader, *identifier);
    // A folder's number may be a link's now: that is another item, and what was below the folder is gone with it.
    if (answer.ok() && answer->item && event.kind == ObjectKind::folder && !answer->item->fileURL()->ts_isFolder())
        answer->kind = Answer::Kind::notListed;
    if (!answer.ok()) return endWithError(reader, answer.error());
    switch (answer->kind) {
        case Answer::Kind::listed: {
            const Result<void> forwarded = forwardMoved(event, std::move(answer->item));
            if (!forwarded.ok()) return endWithError(reader, forwarded.error());
            break;
        }
        case Answer::Kind::notListed:
            if (isEndOfFolder(event)) forward(*identifier);
            break;
        case Answer::Kind::passedThrough:
            if (event.flags & EventFlags::removed) forward(*identifier);
            break;
        case Answer::Kind::trash:
            if ((event.flags & EventFlags::removed) && isEndOfFolder(event) && !leftTrash(event)) forward(*identifier);
            break;
        case Answer::Kind::moving: return askAgain(reader);
    }
    didHandle(reader, event);
}

/// Of what has just come and is not where the event says: a folder above it may have moved since, of which nothing would
/// tell that it is in there. Where it is not listed there is nothing to tell.
void FSChangesEnumerator::askAboutNewcomer(FSEventReader& reader, const Event& event) {
    const Result<Answer> answer =
        ask(reader, CdlFileObjectIdentifier::fromFileID(static_cast<std::uint64_t>(event.fileID)), Identifier::any);
    if (!answer.ok()) return endWithError(reader, answer.error());
    if (answer->kind == Answer::Kind::moving) return askAgain(reader);
    if (answer->item) forward(answer->item);
    didHandle(reader, event);
}

FSEventReaderDelegate::LookFurther FSChangesEnumerator::readerDidReceiveEvent(FSEventReader& reader, const Event& event,
                                                                              std::string_view path) {
    reader.assertOnQueue();
    if (path.empty()) return isToldByPath(event) ? LookFurther::no : LookFurther::yes;
    if (container_contents::covers(container_, urls_, path)) return LookFurther::yes;
    logDebug("dropping fsevent at {}; URL is not directly in the container (eventID: {})", path, event.id);
    return LookFurther::no;
}

bool FSChangesEnumerator::readerShouldMakeItem(FSEventReader& reader, const Event& /*event*/, const KsURL& entry) {
    reader.assertOnQueue();
    if (container_contents::isListed(container_, entry)) return true;
    // Of a document's event that is said when it is dropped.
    const bool isOfDocument = reader.mode() == FSEventReaderMode::docIDBased;
    if (!isOfDocument && container_contents::isOfFoldersOnly(container_) && !entry.ts_isFolder())
        logDebug("dropping fsevent at {}; item is not a directory", entry.path());
    return false;
}

void FSChangesEnumerator::readerDidUpdateItem(FSEventReader& reader, const Event& event,
                                              const TesselItemIdentifier& identifier,
                                              const std::shared_ptr<const TesselItem>& item) {
    reader.assertOnQueue();
    // Of a document, what is at its file may be another one by now.
    if (reader.mode() == FSEventReaderMode::docIDBased && item->itemIdentifier() != identifier)
        return askAbout(reader, event, identifier);
    forward(item);
    didHandle(reader, event);
}

void FSChangesEnumerator::readerDidDeleteItem(FSEventReader& reader, const Event& event,
                                              const TesselItemIdentifier& identifier) {
    reader.assertOnQueue();
    readerDidDropEvent(reader, event, identifier);
}

void FSChangesEnumerator::readerDidDropEvent(FSEventReader& reader, const Event& event,
                                             const TesselItemIdentifier& identifier) {
    reader.assertOnQueue();
    if (reader.mode() == FSEventReaderMode::docIDBased) return askAbout(reader, event, identifier);
    if (isNewcomer(event)) return askAboutNewcomer(reader, event);
    askAbout(reader, event, identifierOf(event));
}

void FSChangesEnumerator::readerMustScan(FSEventReader& reader, const Event& event) {
    reader.assertOnQueue();
    std::vector<KsURL> folders;
    for (const KsURL& url : urls_) {
        if (isAtOrBelow(url.path(), event.path)) folders.push_back(url);
    }
    if (container_contents::covers(container_, urls_, event.path)) {
        const Result<FSFoundEntry> found = reader.entryFinder().find(event.path);
        if (!found.ok()) return endWithError(reader, found.error());
        if (found->url && container_contents::isListed(container_, *found->url)) {
            const Result<TesselItems> items = container_contents::itemsOf({*found->url});
            if (!items.ok()) return endWithError(reader, items.error());
            for (const auto& item : *items) forward(item);
        }
        if (found->url && found->url->ts_isFolder() && container_contents::isDeep(container_))
            folders.push_back(*found->url);
    }
    const Result<void> scanned = scan(folders);
    if (!scanned.ok()) return endWithError(reader, scanned.error());
    didHandle(reader, event);
}

// What is forwarded.

bool FSChangesEnumerator::isBatchFull() const {
    if (numberOfChanges_ < currentToken_.offset) return false;
    const std::uint64_t unflushed = numberOfChanges_ - currentToken_.offset;
    if (unflushed > kChangesBatchMax)
        logError("invalid number of changes ({} - {} shouldn't be greater than {})", numberOfChanges_,
                 currentToken_.offset, kChangesBatchMax);
    return unflushed > kChangesBatchMax - 1;
}

void FSChangesEnumerator::forward(const Change& change) {
    numberOfChanges_ = checkedSum(numberOfChanges_, 1);
    // An earlier batch from the same event has delivered those before.
    if (numberOfChanges_ <= currentToken_.offset) return;
    if (const auto* item = std::get_if<std::shared_ptr<const TesselItem>>(&change)) {
        observer_->didUpdateItems({*item});
    } else {
        forwardDeletion(std::get<TesselItemIdentifier>(change));
    }
}

void FSChangesEnumerator::forwardDeletion(const TesselItemIdentifier& identifier) {
    logDebug("forward deletion of {}", identifier);
    observer_->didDeleteItemsWithIdentifiers({identifier});
}

/// The event's changes were forwarded: what it stands at is a position.
void FSChangesEnumerator::didHandle(FSEventReader& reader, const Event& event) {
    if (isBatchFull()) finish(reader, event.id);
}

/// Forwards all that is listed in the folders. Never cut: there is no position within an event.
Result<void> FSChangesEnumerator::scan(const std::vector<KsURL>& folders) {
    if (folders.empty()) return {};
    if (scans_ == Scans::refused) return KsError::posix(EAGAIN);
    std::vector<KsURL> entries;
    const auto forwardEntries = [&]() -> Result<void> {
        for (auto& item : TRY(container_contents::itemsOf(std::exchange(entries, {})))) forward(std::move(item));
        return {};
    };
    for (const KsURL& folder : folders) logDebug("scanning folder {}", folder.path());
    FSDirectoryEnumerator enumerator;
    TRY(enumerator.enumerate(container_contents::scanOptions(container_, folders), [&](KsURL entry) -> Result<void> {
        if (container_contents::isListed(container_, entry)) entries.push_back(std::move(entry));
        return entries.size() < kScanEntriesMax ? Result<void>() : forwardEntries();
    }));
    return forwardEntries();
}

// How it ends.

/// True for the one who is to finish the observer.
bool FSChangesEnumerator::end(FSEventReader& reader) {
    reader.stop();
    const MutexLock lock(mutex_);
    return !std::exchange(isOver_, true);
}

void FSChangesEnumerator::endWithError(FSEventReader& reader, const KsError& error) {
    if (end(reader)) observer_->finishEnumeratingWithError(error);
}

/// Nothing is known beyond the anchor that was received: the client asks from it again.
void FSChangesEnumerator::askAgain(FSEventReader& reader) {
    logInfo("folders moved while changes of {} were fetched", container_);
    if (end(reader)) observer_->finishEnumeratingChangesUpToSyncAnchor(receivedToken_.encode(), /*moreComing=*/true);
}

void FSChangesEnumerator::readerDidLoseEvents(FSEventReader& reader, const Event& /*event*/) {
    reader.assertOnQueue();
    logInfo("fetching changes did finish after reset");
    endWithError(reader, tesselErrorForExpiredPage());
}

void FSChangesEnumerator::readerDidFail(FSEventReader& reader, const KsError& error) {
    reader.assertOnQueue();
    endWithError(reader, error);
}

void FSChangesEnumerator::readerDidFinishHistory(FSEventReader& reader, std::uint64_t eventID) {
    reader.assertOnQueue();
    numberOfReaderCaughtUp_ = checkedSum(numberOfReaderCaughtUp_, 1);
    finish(reader, eventID);
}

/// The reader stops, with everything up to the event handled.
void FSChangesEnumerator::finish(FSEventReader& reader, std::uint64_t eventID) {
    const FSReaderState position{eventID, 0, numberOfChanges_};
    logDebug("replayed {} fsevents from {} (offset:{})", numberOfChanges_, reader.description(), position.offset);
    reader.stop();
    if (reader.mode() == FSEventReaderMode::pathBased) {
        finishPathBased(position);
    } else {
        finishDocIDBased(reader, position);
    }
}

void FSChangesEnumerator::finishPathBased(const FSReaderState& position) {
    pathBasedReaderState_ = position;
    numberOfChanges_ = 0;
    std::shared_ptr<FSEventReader> reader = makeReader(FSEventReaderMode::docIDBased, /*verbose=*/true);
    const MutexLock lock(mutex_);
    if (isOver_) return;
    // The one before, whose task this is, is let go of without the lock.
    reader_.swap(reader);
    reader_->start();
}

void FSChangesEnumerator::finishDocIDBased(FSEventReader& reader, const FSReaderState& position) {
    if (!pathBasedReaderState_) fatal("path based reader bookmark is missing");
    // Events bear the paths of now. Of a folder that moved meanwhile, some may have been taken for another's.
    if (placesOf(urls_) != places_) return askAgain(reader);
    choosePosition(position);
    const bool hasCaughtUp = numberOfReaderCaughtUp_ == 2;
    if (hasCaughtUp) logDebug("fetching changes did catch up (eventID:{})", currentToken_.streamEventID);
    if (end(reader)) observer_->finishEnumeratingChangesUpToSyncAnchor(currentToken_.encode(), !hasCaughtUp);
}

/// The earlier of the two readers' positions, so that no change is lost.
void FSChangesEnumerator::choosePosition(FSReaderState docIDBased) {
    const FSReaderState& pathBased = *pathBasedReaderState_;
    if (checkedSum(docIDBased.numberOfChanges, pathBased.numberOfChanges) == 0) {
        if (container_ == kTesselWorkingSetContainerItemIdentifier) return;
        currentToken_.streamEventID = startupFSEventID_;
        currentToken_.offset = 0;
        return;
    }
    // The second reader's present is later than the first's: what happened between, only one of them has seen.
    docIDBased.eventID = std::min(docIDBased.eventID, pathBased.eventID);
    const bool isDocIDBased =
        docIDBased.numberOfChanges > 0 && (docIDBased.eventID <= pathBased.eventID || pathBased.numberOfChanges == 0);
    const FSReaderState& chosen = isDocIDBased ? docIDBased : pathBased;
    currentToken_.streamEventID = chosen.eventID;
    currentToken_.offset = chosen.offset;
}

}  // namespace cindral
