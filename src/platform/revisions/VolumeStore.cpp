#include "platform/revisions/VolumeStore.h"

#include <algorithm>
#include <cerrno>

#include "platform/foundation/Log.h"
#include "platform/revisions/VolumeStoreImplementation.h"

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
    return implementation_->numbers().currentEvent();
}

Result<std::uint64_t> VolumeStore::advanceEventID() {
    return implementation_->numbers().advanceEvent();
}

VolumeStore::Counts VolumeStore::counts() const {
    return implementation_->counts();
}

std::uint64_t VolumeStore::transactionCount() const {
    return implementation_->transactionCount();
}

Result<void> VolumeStore::checkpoint() {
    return implementation_->checkpoint();
}

// MARK: Looking up

namespace {

// A chain this long is no path that the file system could have made; one in a circle gets here, too.
constexpr std::size_t kPathDepthMax = 4096;
// Sightings that are looked up at once: enough that memory is never waited for, few enough to stay in the nearest
// cache.
constexpr std::size_t kLookupsAtOnceMax = 128;

bool isSame(const PackedRecord& record, const ObjectSighting& sighting) {
    return record.birthTime == sighting.birthTime && record.parent == sighting.parent && record.kind == sighting.kind &&
           record.name == sighting.name && (record.documentID != DocumentID{} || !sighting.wantsDocumentID);
}

/// A path put together from its end.
class BackwardsPath {
public:
    void prepend(std::string_view name) {
        const std::size_t needed = name.size() + (isEmpty() ? 0 : 1);
        if (needed > begin_) grow(needed);
        if (!isEmpty()) text_[--begin_] = '/';
        begin_ -= name.size();
        name.copy(text_.data() + begin_, name.size());
        hasNames_ = true;
    }
    std::string take() { return std::move(text_.erase(0, begin_)); }

private:
    bool isEmpty() const { return !hasNames_; }
    void grow(std::size_t needed) {
        const std::size_t more = text_.size() + needed;
        text_.insert(0, more, '\0');
        begin_ += more;
    }

    std::string text_ = std::string(256, '\0');
    std::size_t begin_ = 256;
    bool hasNames_ = false;
};

/// What a record of any age may hold is checked before it becomes part of a path.
bool isFileName(std::string_view name) {
    return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos;
}

}  // namespace

std::optional<PackedRecord> VolumeStore::Implementation::findUnsaved(FileID fileID) const {
    if (auto record = active_->find(fileID)) return record;
    return frozen_ ? frozen_->find(fileID) : std::nullopt;
}

/// Reads records one by one: first of what is not in the tables yet, then of the tables.
class VolumeStore::Implementation::Reader {
public:
    explicit Reader(const Implementation& store) : store_(store) {}

    /// Calls `use` with the record and answers true, or answers false when there is none.
    template <typename Use>
    bool read(FileID fileID, Use use) {
        if (readUnsaved(fileID, use)) return true;
        const auto record = snapshot_->object(fileID);
        if (record) use(*record);
        return record.has_value();
    }

private:
    template <typename Use>
    bool readUnsaved(FileID fileID, Use use) {
        {
            const MutexLock lock(store_.mutex_);
            if (const auto record = store_.findUnsaved(fileID)) {
                use(*record);
                return true;
            }
            if (saved_ != store_.frozenCountSaved_) snapshot_.reset();
            saved_ = store_.frozenCountSaved_;
        }
        if (!snapshot_) snapshot_.emplace(*store_.tables_);
        return false;
    }

    const Implementation& store_;
    std::optional<ObjectTables::Snapshot> snapshot_;
    std::uint64_t saved_ = 0;
};

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

/// Calls `use` with the place of each file ID and its record, or null.
template <typename FileIDAt, typename Use>
Result<void> VolumeStore::Implementation::lookUp(std::size_t count, FileIDAt fileIDAt, Use use) const {
    std::array<tablepages::Lookup, kLookupsAtOnceMax> lookups;
    std::array<std::size_t, kLookupsAtOnceMax> places;
    for (std::size_t begin = 0; begin < count; begin += kLookupsAtOnceMax) {
        const std::size_t end = std::min(count, begin + kLookupsAtOnceMax);
        std::size_t missing = 0;
        {
            const MutexLock lock(mutex_);
            for (std::size_t i = begin; i < end; ++i) {
                const FileID fileID = fileIDAt(i);
                if (const auto record = findUnsaved(fileID)) {
                    use(i, &*record);
                } else {
                    lookups[missing].key = static_cast<std::uint64_t>(fileID);
                    places[missing++] = i;
                }
            }
        }
        if (missing == 0) continue;
        // After the overlays: what leaves them is in the tables before.
        const ObjectTables::Snapshot snapshot(*tables_);
        TRY(snapshot.objects(std::span(lookups).first(missing)));
        for (std::size_t i = 0; i < missing; ++i) {
            const auto record = lookups[i].found ? PackedRecord::decode(lookups[i].value) : std::nullopt;
            use(places[i], record ? &*record : nullptr);
        }
    }
    return {};
}

// MARK: Recording

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
    Result<void> done = looked.ok() && !news.empty() ? record(sightings, news) : looked;
    if (!done.ok() && done.error().isPosix(kDamageCode)) isSuspect_ = true;
    return done;
}

/// What becomes of a sighting that looked new.
struct VolumeStore::Implementation::Outcome {
    DocumentID documentID{};
    bool isRecorded = false;  ///< there is something to write
    bool isNewObject = false;
    bool givesDocument = false;
};

namespace {

constexpr std::uint32_t kNone = ~std::uint32_t{0};

/// For each sighting the one of the same object before it in the page, as a file with two names gives.
std::vector<std::uint32_t> earlierOnes(std::span<const ObjectSighting* const> news) {
    std::vector<std::pair<FileID, std::uint32_t>> order;
    order.reserve(news.size());
    for (std::uint32_t i = 0; i < news.size(); ++i) order.emplace_back(news[i]->fileID, i);
    std::ranges::sort(order);
    std::vector<std::uint32_t> earlier(news.size(), kNone);
    for (std::size_t i = 1; i < order.size(); ++i) {
        if (order[i].first == order[i - 1].first) earlier[order[i].second] = order[i - 1].second;
    }
    return earlier;
}

PackedRecord recordOf(const ObjectSighting& sighting, DocumentID documentID) {
    return {.parent = sighting.parent,
            .birthTime = sighting.birthTime,
            .documentID = documentID,
            .kind = sighting.kind,
            .name = sighting.name};
}

bool canBeRecorded(const ObjectSighting& sighting) {
    return sighting.name.size() <= PackedRecord::kNameBytesMax &&
           sighting.name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

}  // namespace

Result<void> VolumeStore::Implementation::record(std::span<ObjectSighting> sightings,
                                                 const std::vector<std::uint32_t>& newsPlaces) {
    std::vector<const ObjectSighting*> news;
    // In the order of the page, not in that of the look-up: so are the document IDs.
    std::vector<std::uint32_t> places = newsPlaces;
    std::ranges::sort(places);
    for (const std::uint32_t place : places) {
        if (!canBeRecorded(sightings[place]))
            return KsError::posix(EINVAL).with("name", std::string(sightings[place].name));
        news.push_back(&sightings[place]);
    }

    std::vector<Outcome> outcomes(news.size());
    {
        const MutexLock lock(writerMutex_);
        TRY(waitForRoom());
        TRY(decide(news, outcomes));
        if (batch_.count() > 0) {
            TRY(logs_[activeLog_].append(batch_.finish(uuid_, nextBatch_)));
            ++nextBatch_;
            transactionCount_.fetch_add(1, std::memory_order_relaxed);
            remember(news, outcomes);
        }
    }
    for (std::size_t i = 0; i < places.size(); ++i) sightings[places[i]].documentID = outcomes[i].documentID;
    return {};
}

/// Composes the batch. Looks again, because another thread may have recorded the same since.
Result<void> VolumeStore::Implementation::decide(std::span<const ObjectSighting* const> news,
                                                 std::vector<Outcome>& outcomes) {
    const auto fileIDAt = [&](std::size_t i) { return news[i]->fileID; };
    TRY(lookUp(news.size(), fileIDAt, [&](std::size_t i, const PackedRecord* record) {
        outcomes[i].isNewObject = record == nullptr;
        outcomes[i].isRecorded = record == nullptr || !isSame(*record, *news[i]);
        const bool isSameObject = record != nullptr && record->birthTime == news[i]->birthTime;
        outcomes[i].documentID = isSameObject ? record->documentID : DocumentID{};
    }));

    const auto earlier = earlierOnes(news);
    const std::uint32_t first = numbers_->nextDocument();
    std::uint32_t given = 0;
    batch_.begin();
    for (std::size_t i = 0; i < news.size(); ++i) {
        const ObjectSighting& sighting = *news[i];
        Outcome& outcome = outcomes[i];
        if (earlier[i] != kNone) {
            const PackedRecord before = recordOf(*news[earlier[i]], outcomes[earlier[i]].documentID);
            outcome.isNewObject = false;
            outcome.isRecorded = !isSame(before, sighting);
            outcome.documentID = before.birthTime == sighting.birthTime ? before.documentID : DocumentID{};
        }
        if (sighting.wantsDocumentID && outcome.documentID == DocumentID{}) {
            outcome.documentID = DocumentID{first + given++};
            outcome.givesDocument = true;
        }
        if (outcome.isRecorded)
            batch_.add(sighting.fileID, outcome.givesDocument, recordOf(sighting, outcome.documentID));
    }
    // Reserved before they leave; taken only once the batch is in the log.
    if (given > 0) TRY(numbers_->reserveDocuments(given));
    return {};
}

/// Puts what is in the log now where readers find it.
void VolumeStore::Implementation::remember(std::span<const ObjectSighting* const> news,
                                           const std::vector<Outcome>& outcomes) {
    std::size_t given = 0;
    {
        const MutexLock lock(mutex_);
        for (std::size_t i = 0; i < news.size(); ++i) {
            const ObjectSighting& sighting = *news[i];
            const Outcome& outcome = outcomes[i];
            if (!outcome.isRecorded) continue;
            active_->put(sighting.fileID, recordOf(sighting, outcome.documentID));
            counts_.objects += outcome.isNewObject ? 1 : 0;
            if (!outcome.givesDocument) continue;
            active_->addDocument(outcome.documentID, {sighting.fileID, sighting.birthTime});
            ++given;
        }
        counts_.documents += given;
        if (!due_) {
            due_ = std::chrono::steady_clock::now() + kCheckpointDelay;
            dueChanged_.notifyAll();
        }
    }
    numbers_->takeDocuments(given);
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
    Result<void> written = tables_->write(*overlay, headFor(*overlay, lastBatch, numbers_->reserved()),
                                          options_.checkpointPagesMax, options_.onCheckpointStep);
    if (written.ok()) {
        checkpointSucceeded(lastBatch);
    } else {
        checkpointFailed(written.error());
    }
    return written;
}

void VolumeStore::Implementation::checkpointSucceeded(std::uint64_t lastBatch) {
    const MutexLock writerLock(writerMutex_);
    // Should it fail, the batches' numbers tell that they are in the tables.
    (void)logs_[activeLog_ ^ 1].clear();
    {
        const MutexLock lock(mutex_);
        frozen_.reset();
        savedBatch_ = lastBatch;
        ++frozenCountSaved_;
        lastFailure_.reset();
    }
    roomChanged_.notifyAll();
}

void VolumeStore::Implementation::checkpointFailed(const KsError& error) {
    if (error.isPosix(kDamageCode)) isSuspect_ = true;
    const MutexLock writerLock(writerMutex_);
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
    // A failure was logged, and is tried again later.
    while (waitUntilDue()) (void)writeCheckpoint();
}

VolumeStore::Counts VolumeStore::Implementation::counts() const {
    const MutexLock lock(mutex_);
    return counts_;
}

}  // namespace cindral
