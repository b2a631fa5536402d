#include "platform/revisions/VolumeStore.h"

#include <algorithm>
#include <cerrno>

#include "platform/foundation/FreeMemory.h"
#include "platform/foundation/Log.h"
#include "platform/revisions/VolumeStoreImplementation.h"
#include "platform/revisions/VolumeStoreReading.h"
#include "platform/revisions/VolumeStoreUpdate.h"

namespace cindral {

// MARK: The public face

VolumeStore::VolumeStore() = default;
VolumeStore::~VolumeStore() = default;

Result<std::unique_ptr<VolumeStore>> VolumeStore::open(const std::string& folder) {
    return open(folder, {});
}

Result<std::unique_ptr<VolumeStore>> VolumeStore::open(const std::string& folder, const VolumeStoreOptions& options) {
    std::unique_ptr<VolumeStore> store(new VolumeStore);
    store->implementation_ = std::make_unique<Implementation>(folder, options);
    TRY(store->implementation_->open());
    return store;
}

KsUUID VolumeStore::uuid() const {
    return implementation_->uuid();
}

Result<void> VolumeStore::identify(std::span<ObjectSighting> sightings) {
    return implementation_->identify(sightings);
}

std::optional<ObjectRecord> VolumeStore::object(FileID fileID) const {
    return implementation_->object(fileID);
}

std::optional<DocumentRecord> VolumeStore::document(DocumentID documentID) const {
    return implementation_->document(documentID);
}

std::optional<VolumeStore::RecordedPath> VolumeStore::recordedPath(FileID fileID, std::span<const FileID> roots) const {
    return implementation_->recordedPath(fileID, roots);
}

std::uint64_t VolumeStore::currentEventID() const {
    return implementation_->currentEventID();
}

Result<std::uint64_t> VolumeStore::advanceEventID() {
    return implementation_->advanceEventID();
}

Result<std::uint64_t> VolumeStore::apply(const IndexChanges& changes, std::span<const FileID> roots) {
    return implementation_->apply(changes, roots);
}

bool VolumeStore::indexed(FileID fileID, const ObjectReceiver& receive) const {
    return implementation_->indexed(fileID, receive);
}

Result<void> VolumeStore::indexed(std::span<const FileID> fileIDs,
                                  const std::function<void(std::size_t, const IndexedObject*)>& receive) const {
    return implementation_->indexed(fileIDs, receive);
}

bool VolumeStore::childrenNamed(FileID parent, std::string_view name, const ObjectReceiver& receive) const {
    return implementation_->childrenNamed(parent, name, receive);
}

Result<void> VolumeStore::children(FileID parent, const ObjectReceiver& receive) const {
    return implementation_->children(parent, receive);
}

std::uint64_t VolumeStore::childCount(FileID parent) const {
    return implementation_->childCount(parent);
}

std::vector<VolumeStore::Name> VolumeStore::otherNames(FileID fileID) const {
    return implementation_->otherNames(fileID);
}

Bytes VolumeStore::attributes(DocumentID document) const {
    return implementation_->attributes(document);
}

Result<void> VolumeStore::rememberAttributes(DocumentID document, ByteView attributes) {
    return implementation_->rememberAttributes(document, attributes);
}

Result<std::vector<JournalEvent>> VolumeStore::events(std::uint64_t after, std::size_t max) const {
    return implementation_->events(after, max);
}

Result<std::vector<JournalEvent>> VolumeStore::documentEvents(std::uint64_t after, std::size_t max) const {
    return implementation_->documentEvents(after, max);
}

std::optional<std::uint64_t> VolumeStore::historyBegin() const {
    return implementation_->historyBegin();
}

std::optional<std::chrono::system_clock::time_point> VolumeStore::oldestEventTime() const {
    return implementation_->oldestEventTime();
}

Result<std::uint64_t> VolumeStore::beginHistory() {
    return implementation_->beginHistory();
}

Result<void> VolumeStore::renewUUID() {
    return implementation_->renewUUID();
}

Result<void> VolumeStore::trimJournal(std::uint64_t eventsMax, std::chrono::seconds ageMax) {
    return implementation_->trimJournal(eventsMax, ageMax);
}

VolumeStore::Counts VolumeStore::counts() const {
    return implementation_->counts();
}

std::optional<KsError> VolumeStore::failure() const {
    return implementation_->failure();
}

const std::string& VolumeStore::replacement() const {
    return implementation_->replacement();
}

Result<std::vector<std::string>> VolumeStore::setAsideWhatStops(const std::string& folder) {
    return Implementation::setAsideWhatStops(folder);
}

std::uint64_t VolumeStore::transactionCount() const {
    return implementation_->transactionCount();
}

Result<void> VolumeStore::checkpoint() {
    return implementation_->checkpoint();
}

// MARK: Looking up

KsUUID VolumeStore::Implementation::uuid() const {
    const MutexLock lock(mutex_);
    return uuid_;
}

Overlay::State VolumeStore::Implementation::findUnsaved(FileID fileID) const {
    if (const Overlay::State state = active_->find(fileID); state.isKnown) return state;
    return frozen_ ? frozen_->find(fileID) : Overlay::State();
}

std::optional<ObjectRecord> VolumeStore::Implementation::object(FileID fileID) const {
    std::optional<ObjectRecord> found;
    Reader(*this).read(fileID, [&](const PackedRecord& record) {
        found.emplace(ObjectRecord{.parent = record.parent,
                                   .birthTime = record.birthTime,
                                   .kind = record.kind,
                                   .documentID = record.documentID,
                                   .name = std::string(record.name)});
    });
    return found;
}

std::optional<DocumentRecord> VolumeStore::Implementation::document(DocumentID documentID) const {
    {
        const MutexLock lock(mutex_);
        if (const auto found = active_->findDocument(documentID)) return found;
        if (const auto found = frozen_ ? frozen_->findDocument(documentID) : std::nullopt) return found;
    }
    return ObjectTables::Snapshot(*tables_).document(documentID);
}

std::optional<VolumeStore::RecordedPath> VolumeStore::Implementation::recordedPath(
    FileID fileID, std::span<const FileID> roots) const {
    RecordedPath found;
    BackwardsPath path;
    Reader reader(*this);
    FileID at = fileID;
    for (std::size_t depth = 0; depth <= kPathDepthMax; ++depth) {
        const auto root = std::ranges::find(roots, at);
        const bool isRoot = root != roots.end();
        bool isGood = true;
        const bool isKnown = reader.read(at, [&](const PackedRecord& record) {
            if (depth == 0) found.birthTime = record.birthTime;
            if (isRoot) return;
            isGood = isFileName(record.name);
            found.isOpen = found.isOpen && record.kind == ObjectKind::folder && !record.isClosed;
            path.prepend(record.name);
            at = record.parent;
        });
        if (isRoot) {
            found.rootIndex = static_cast<std::size_t>(root - roots.begin());
            found.path = path.take();
            return found;
        }
        if (!isKnown || !isGood) return std::nullopt;
    }
    return std::nullopt;
}

// MARK: Recording

namespace {

/// Whether the sighting tells nothing new.
bool isSame(const PackedRecord& record, const ObjectSighting& sighting) {
    if (record.birthTime != sighting.birthTime || !record.isListed) return false;
    if (record.documentID == DocumentID{} && sighting.wantsDocumentID) return false;
    // Where the recorder has looked, a listing has nothing to say of the place.
    return record.changeTime != 0 || (record.isAt(sighting.parent, sighting.name) && record.kind == sighting.kind);
}

}  // namespace

namespace {

/// The places and those of every other sighting of the same objects, in the order of the page: so are the document IDs.
std::vector<std::uint32_t> withTheirLike(std::span<const ObjectSighting> sightings,
                                         const std::vector<std::uint32_t>& places) {
    std::vector<FileID> fileIDs;
    for (const std::uint32_t place : places) fileIDs.push_back(sightings[place].fileID);
    std::ranges::sort(fileIDs);
    std::vector<std::uint32_t> all;
    for (std::uint32_t i = 0; i < sightings.size(); ++i) {
        if (std::ranges::binary_search(fileIDs, sightings[i].fileID)) all.push_back(i);
    }
    return all;
}

}  // namespace

Result<void> VolumeStore::Implementation::identify(std::span<ObjectSighting> sightings) {
    std::vector<std::uint32_t> news;
    const auto fileIDAt = [&](std::size_t i) { return sightings[i].fileID; };
    const Result<void> looked = lookUp(sightings.size(), fileIDAt, [&](std::size_t i, const PackedRecord* record) {
        if (record != nullptr && isSame(*record, sightings[i])) {
            sightings[i].documentID = record->documentID;
        } else {
            news.push_back(static_cast<std::uint32_t>(i));
        }
    });
    return noticed(looked.ok() && !news.empty() ? record(sightings, news) : looked);
}

Result<void> VolumeStore::Implementation::record(std::span<ObjectSighting> sightings,
                                                 const std::vector<std::uint32_t>& newsPlaces) {
    const std::vector<std::uint32_t> places = withTheirLike(sightings, newsPlaces);
    for (const std::uint32_t place : places) {
        if (!canBeName(sightings[place].name))
            return KsError::posix(EINVAL).with("name", std::string(sightings[place].name));
    }
    std::vector<DocumentID> answers(places.size());
    {
        const MutexLock lock(writerMutex_);
        TRY(waitForRoom());
        Update update = beginUpdate(roots_, true);
        // Looks again, because another thread may have recorded the same since.
        TRY(update.load(places.size(), [&](std::size_t i) { return sightings[places[i]].fileID; }));
        for (std::size_t i = 0; i < places.size(); ++i) answers[i] = update.sight(sightings[places[i]]);
        TRY(commit(update));
    }
    for (std::size_t i = 0; i < places.size(); ++i) sightings[places[i]].documentID = answers[i];
    return {};
}

VolumeStore::Implementation::Update VolumeStore::Implementation::beginUpdate(std::span<const FileID> roots,
                                                                             bool journals) {
    return {*this, roots, journals, {.event = numbers_->currentEvent() + 1, .document = numbers_->nextDocument()}};
}

/// Puts the update into the log, and then where readers find it. Nothing at all when nothing is new.
Result<void> VolumeStore::Implementation::commit(Update& update) {
    const std::uint64_t events = update.eventCount();
    const std::int64_t time = events > 0 ? now() : 0;
    const bool marksTime = events > 0 && isTimeMarkDue(time);
    if (marksTime) update.markTime(time);
    batch_.begin();
    update.writeTo(batch_);
    if (batch_.count() == 0) return {};
    // Reserved before they leave; taken only once the batch is in the log, and what it says can be read.
    if (update.documentCount() > 0) TRY(numbers_->reserveDocuments(update.documentCount()));
    if (events > 0) TRY(numbers_->reserveEvents(events));
    TRY(appendBatch());
    if (marksTime) lastTimeMark_ = TimeMark{update.firstEvent(), time};
    {
        const MutexLock lock(mutex_);
        update.writeTo(*active_, counts_, forgottenEvent_);
        saveSoon();
    }
    numbers_->takeDocuments(update.documentCount());
    numbers_->takeEvents(events);
    return {};
}

Result<void> VolumeStore::Implementation::appendBatch() {
    TRY(logs_[activeLog_].append(batch_.finish(uuid(), nextBatch_)));
    ++nextBatch_;
    transactionCount_.fetch_add(1, std::memory_order_relaxed);
    return {};
}

void VolumeStore::Implementation::saveSoon() {
    if (due_) return;
    due_ = std::chrono::steady_clock::now() + kCheckpointDelay;
    dueChanged_.notifyAll();
}

Result<std::uint64_t> VolumeStore::Implementation::advanceEventID() {
    const MutexLock lock(writerMutex_);
    return numbers_->advanceEvent();
}

bool VolumeStore::Implementation::isFull() const {
    // Names of more than a hundred bytes on average fill the room sooner than the count of records.
    constexpr std::size_t kBytesOfARecord = 160;
    const std::size_t recordsMax = std::max<std::size_t>(1, options_.unsavedRecordsMax / 2);
    return active_->count() >= recordsMax || active_->bytes() >= recordsMax * kBytesOfARecord;
}

/// Returns with room for one more batch, however large.
Result<void> VolumeStore::Implementation::waitForRoom() {
    std::optional<std::uint64_t> failuresBefore;
    while (true) {
        {
            const MutexLock lock(mutex_);
            if (!isFull()) return {};
            if (!frozen_) {
                freeze();
                return {};
            }
            // Rather an error, once the disk has been asked again, than a caller who waits for a disk that stays full.
            if (failuresBefore && *failuresBefore != failures_) return *lastFailure_;
            failuresBefore = failures_;
            retryAt_ = std::chrono::steady_clock::now();
            dueChanged_.notifyAll();
        }
        roomChanged_.wait(writerMutex_);
    }
}

// MARK: Checkpoints

void VolumeStore::Implementation::freeze() {
    frozen_ = std::exchange(active_, std::make_shared<Overlay>());
    frozenLastBatch_ = nextBatch_ - 1;
    activeLog_ ^= 1;
    due_.reset();
    retryAt_ = std::chrono::steady_clock::now();
    dueChanged_.notifyAll();
}

TablesHead VolumeStore::Implementation::headFor(const Overlay& overlay, std::uint64_t lastBatch,
                                                const HighWaterMarks& marks) const {
    TablesHead head = tables_->head();
    head.marks = marks;
    head.appliedBatch = lastBatch;
    if (overlay.historyBegin() != 0) {
        head.hasHistory = true;
        head.forgottenEvent = std::max(head.forgottenEvent, overlay.historyBegin());
    }
    if (!overlay.documents().empty()) {
        head.settledDocument = std::max(head.settledDocument, overlay.documents().back().first);
    }
    return head;
}

/// Writes what is frozen, or else freezes what there is and writes that.
Result<void> VolumeStore::Implementation::writeCheckpoint() {
    const MutexLock checkpointLock(checkpointMutex_);
    std::shared_ptr<const Overlay> overlay;
    std::uint64_t lastBatch = 0;
    {
        const MutexLock writerLock(writerMutex_);
        const MutexLock lock(mutex_);
        if (!frozen_ && !active_->empty()) freeze();
        overlay = frozen_;
        lastBatch = frozenLastBatch_;
    }
    if (!overlay) return {};
    const Result<void> written = writeTables(overlay, lastBatch);
    const MutexLock writerLock(writerMutex_);
    if (written.ok()) {
        checkpointSucceeded(lastBatch);
    } else {
        checkpointFailed(written.error());
    }
    return written;
}

Result<void> VolumeStore::Implementation::writeTables(const std::shared_ptr<const Overlay>& overlay,
                                                      std::uint64_t lastBatch) {
    publishChildCounts(*overlay);
    return tables_->write(*overlay, headFor(*overlay, lastBatch, numbers_->reserved()), options_.checkpointPagesMax,
                          options_.onCheckpointStep);
}

/// While the tables are half written, they and the overlay's differences don't add up.
void VolumeStore::Implementation::publishChildCounts(const Overlay& overlay) {
    {
        const MutexLock lock(mutex_);
        if (frozenChildCounts_) return;  // Tried before.
    }
    auto counts = std::make_shared<ChildCounts>();
    const ObjectTables::Snapshot snapshot(*tables_);
    for (const auto& [parent, difference] : overlay.childCountDifferences()) {
        (*counts)[parent] = snapshot.childCount(parent) + static_cast<std::uint64_t>(difference);
    }
    const MutexLock lock(mutex_);
    frozenChildCounts_ = std::move(counts);
}

void VolumeStore::Implementation::checkpointSucceeded(std::uint64_t lastBatch) {
    // Should it fail, the batches' numbers tell that they are in the tables.
    (void)logs_[activeLog_ ^ 1].clear();
    {
        const MutexLock lock(mutex_);
        frozen_.reset();
        frozenChildCounts_.reset();
        savedBatch_ = lastBatch;
        ++frozenCountSaved_;
        lastFailure_.reset();
    }
    roomChanged_.notifyAll();
}

void VolumeStore::Implementation::checkpointFailed(const KsError& error) {
    if (error.isPosix(kDamageCode)) isSuspect_ = true;
    {
        const MutexLock lock(mutex_);
        // One line for a disk that stays full, not one a second.
        if (!lastFailure_) logError("the volume store in {} can't save: {}", folder_, error.description());
        lastFailure_ = error;
        ++failures_;
        retryAt_ = std::chrono::steady_clock::now() + 5 * kCheckpointDelay;
    }
    roomChanged_.notifyAll();
}

/// Returns with nothing left in logs and overlays.
Result<void> VolumeStore::Implementation::saveEverything() {
    while (true) {
        std::shared_ptr<const Overlay> overlay;
        std::uint64_t lastBatch = 0;
        {
            const MutexLock lock(mutex_);
            if (!frozen_ && active_->empty()) return {};
            if (!frozen_) freeze();
            overlay = frozen_;
            lastBatch = frozenLastBatch_;
        }
        const Result<void> written = writeTables(overlay, lastBatch);
        if (!written.ok()) {
            checkpointFailed(written.error());
            return written;
        }
        checkpointSucceeded(lastBatch);
    }
}

Result<void> VolumeStore::Implementation::checkpoint() {
    std::uint64_t wanted = 0;
    {
        const MutexLock writerLock(writerMutex_);
        wanted = nextBatch_ - 1;
    }
    while (true) {
        {
            const MutexLock lock(mutex_);
            if (savedBatch_ >= wanted) return {};
        }
        TRY(writeCheckpoint());
    }
}

std::optional<std::chrono::steady_clock::time_point> VolumeStore::Implementation::nextCheckpoint() const {
    if (!options_.checkpointsItself) return std::nullopt;
    if (frozen_) return retryAt_;
    return due_;
}

/// False when the store closes.
bool VolumeStore::Implementation::waitUntilDue() {
    const MutexLock lock(mutex_);
    while (!stopping_) {
        const auto next = nextCheckpoint();
        if (!next) {
            dueChanged_.wait(mutex_);
        } else if (*next <= std::chrono::steady_clock::now()) {
            return true;
        } else {
            (void)dueChanged_.waitUntil(mutex_, *next);
        }
    }
    return false;
}

void VolumeStore::Implementation::writeCheckpointsWhenDue() {
    while (waitUntilDue()) {
        // A failure was logged, and is tried again later.
        (void)writeCheckpoint();
        returnFreeMemory();
    }
}

VolumeStore::Counts VolumeStore::Implementation::counts() const {
    const MutexLock lock(mutex_);
    return counts_;
}

}  // namespace cindral
