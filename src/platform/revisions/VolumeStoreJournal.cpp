#include <algorithm>
#include <limits>
#include <map>

#include "platform/revisions/VolumeIndex.h"
#include "platform/revisions/VolumeStoreReading.h"

// The event journal: how it is read, begun and trimmed.

namespace cindral {

namespace {

// How far apart the moments are that the journal remembers.
constexpr std::chrono::minutes kTimeMarkInterval{10};

std::int64_t nanoseconds(std::chrono::system_clock::time_point time) {
    return std::chrono::duration_cast<std::chrono::nanoseconds>(time.time_since_epoch()).count();
}

JournalEvent eventOf(std::uint64_t id, const Departure& departure) {
    return {.id = id,
            .kind = JournalEvent::Kind::departed,
            .fileID = departure.fileID,
            .documentID = departure.documentID,
            .parent = departure.parent,
            .name = std::string(departure.name),
            .objectKind = departure.objectKind,
            .path = std::string(departure.path),
            .root = departure.root,
            .goesOn = departure.goesOn};
}

JournalEvent eventOf(std::uint64_t id, FileID fileID) {
    return {.id = id, .kind = JournalEvent::Kind::present, .fileID = fileID};
}

JournalEvent eventOf(std::uint64_t id, const DocumentChange& change) {
    return {.id = id,
            .kind = JournalEvent::Kind::document,
            .fileID = change.source,
            .documentID = change.documentID,
            .target = change.target};
}

/// None for what no store has written.
std::optional<JournalEvent> decodeEvent(std::uint64_t id, ByteView bytes) {
    if (const auto presence = Presence::decode(bytes)) return eventOf(id, presence->fileID);
    if (const auto departure = Departure::decode(bytes)) return eventOf(id, *departure);
    return std::nullopt;
}

/// The first events of an overlay after an ID, in their order, without those that are not good any more.
template <typename IsCurrent>
void collect(const Overlay& overlay, std::uint64_t after, std::size_t max, IsCurrent isCurrent,
             std::vector<JournalEvent>& found) {
    const auto idOf = [](const auto& entry) { return entry.first; };
    auto presence = std::ranges::upper_bound(overlay.presences(), after, {}, idOf);
    auto departure = std::ranges::upper_bound(overlay.departures(), after, {}, idOf);
    const auto presencesEnd = overlay.presences().end();
    const auto departuresEnd = overlay.departures().end();
    while (found.size() < max && (presence != presencesEnd || departure != departuresEnd)) {
        if (departure == departuresEnd || (presence != presencesEnd && presence->first < departure->first)) {
            if (isCurrent(*presence)) found.push_back(eventOf(presence->first, presence->second));
            ++presence;
        } else {
            found.push_back(eventOf(departure->first, *Departure::decode(departure->second)));
            ++departure;
        }
    }
}

void collectDocumentChanges(const Overlay& overlay, std::uint64_t after, std::size_t max,
                            std::vector<JournalEvent>& found) {
    const auto& changes = overlay.documentChanges();
    auto change = std::ranges::upper_bound(changes, after, {}, [](const auto& entry) { return entry.first; });
    for (; change != changes.end() && found.size() < max; ++change) {
        found.push_back(eventOf(change->first, change->second));
    }
}

}  // namespace

// MARK: Reading

/// Fills in what the records say today, and takes those over that are good: an object has but one event, and one that
/// is gone has none. Answers the newest event that has replaced another; 0 for none.
Result<std::uint64_t> VolumeStore::Implementation::resolve(std::vector<JournalEvent>& candidates,
                                                           std::vector<JournalEvent>& found) const {
    std::uint64_t newest = 0;
    std::vector<std::size_t> presences;
    for (std::size_t i = 0; i < candidates.size(); ++i) {
        if (candidates[i].kind == JournalEvent::Kind::present) presences.push_back(i);
    }
    TRY(lookUp(
        presences.size(), [&](std::size_t i) { return candidates[presences[i]].fileID; },
        [&](std::size_t i, const PackedRecord* record) {
            JournalEvent& event = candidates[presences[i]];
            if (record == nullptr || record->eventID != event.id) {
                event.id = 0;
                if (record != nullptr) newest = std::max(newest, record->eventID);
                return;
            }
            event.parent = record->parent;
            event.name = record->name;
            event.objectKind = record->kind;
            event.documentID = record->documentID;
            event.birthTime = record->birthTime;
            event.changeTime = record->changeTime;
            event.size = record->size;
        }));
    for (JournalEvent& event : candidates) {
        if (event.id != 0) found.push_back(std::move(event));
    }
    candidates.clear();
    return newest;
}

Result<std::vector<JournalEvent>> VolumeStore::Implementation::events(std::uint64_t after, std::size_t max) const {
    std::vector<JournalEvent> found;
    bool isEnd = false;
    // A second time only where events were replaced between one look and the next.
    while (!isEnd && found.size() < max) isEnd = TRY(noticed(readEvents(after, max, found)));
    return found;
}

/// Goes on with the events after an ID, which is moved on, until there are `max`. Answers whether there is none beyond.
Result<bool> VolumeStore::Implementation::readEvents(std::uint64_t& after, std::size_t max,
                                                     std::vector<JournalEvent>& found) const {
    const std::size_t wanted = max - found.size();
    std::vector<JournalEvent> candidates, unsaved;
    std::uint64_t unsavedBegin = std::numeric_limits<std::uint64_t>::max();
    {
        const MutexLock lock(mutex_);
        const Overlay& active = *active_;
        if (frozen_) {
            const Overlay& frozen = *frozen_;
            unsavedBegin = frozen.firstEvent();
            const auto isCurrent = [&](const auto& presence) {
                return !active.find(presence.second).isKnown ? frozen.isCurrent(presence) : active.isCurrent(presence);
            };
            collect(frozen, after, wanted, isCurrent, unsaved);
        }
        unsavedBegin = std::min(unsavedBegin, active.firstEvent());
        collect(
            active, after, wanted, [&](const auto& presence) { return active.isCurrent(presence); }, unsaved);
    }
    Result<std::uint64_t> resolved = std::uint64_t{0};
    std::uint64_t newest = 0;
    {
        const ObjectTables::Snapshot snapshot(*tables_);
        TRY(snapshot.events(after, [&](std::uint64_t id, ByteView bytes) {
            if (id >= unsavedBegin || found.size() == max) return false;
            if (auto event = decodeEvent(id, bytes)) candidates.push_back(std::move(*event));
            after = id;
            if (candidates.size() < std::min(kLookupsAtOnceMax, max - found.size())) return true;
            resolved = resolve(candidates, found);
            if (resolved.ok()) newest = std::max(newest, *resolved);
            return resolved.ok();
        }));
    }
    TRY(Result<std::uint64_t>(resolved));
    newest = std::max(newest, TRY(resolve(candidates, found)));
    if (found.size() == max) return false;
    const bool isAll = unsaved.size() <= max - found.size() && unsaved.size() < wanted;
    unsaved.resize(std::min(unsaved.size(), max - found.size()));
    if (!unsaved.empty()) after = unsaved.back().id;
    newest = std::max(newest, TRY(resolve(unsaved, found)));
    // What has replaced an event since is beyond what was looked at.
    return isAll && newest <= after;
}

Result<std::vector<JournalEvent>> VolumeStore::Implementation::documentEvents(std::uint64_t after,
                                                                              std::size_t max) const {
    std::vector<JournalEvent> found, unsaved;
    std::uint64_t unsavedBegin = std::numeric_limits<std::uint64_t>::max();
    {
        const MutexLock lock(mutex_);
        if (frozen_) {
            unsavedBegin = frozen_->firstEvent();
            collectDocumentChanges(*frozen_, after, max, unsaved);
        }
        unsavedBegin = std::min(unsavedBegin, active_->firstEvent());
        collectDocumentChanges(*active_, after, max, unsaved);
    }
    TRY(ObjectTables::Snapshot(*tables_).documentChanges(after, [&](std::uint64_t id, ByteView bytes) {
        if (id >= unsavedBegin || found.size() >= max) return false;
        if (const auto change = DocumentChange::decode(bytes)) found.push_back(eventOf(id, *change));
        return true;
    }));
    for (auto event = unsaved.begin(); event != unsaved.end() && found.size() < max; ++event) {
        found.push_back(std::move(*event));
    }
    return found;
}

// MARK: Beginning and forgetting

std::optional<std::uint64_t> VolumeStore::Implementation::historyBegin() const {
    const MutexLock lock(mutex_);
    return hasHistory_ ? std::optional(forgottenEvent_) : std::nullopt;
}

std::optional<std::chrono::system_clock::time_point> VolumeStore::Implementation::oldestEventTime() const {
    std::map<std::uint64_t, std::int64_t> marks;
    std::uint64_t first = 0;
    {
        const MutexLock lock(mutex_);
        if (counts_.events == 0) return std::nullopt;
        first = forgottenEvent_ + 1;
        for (const Overlay* overlay : {frozen_.get(), static_cast<const Overlay*>(active_.get())}) {
            if (overlay != nullptr) marks.insert(overlay->timeMarks().begin(), overlay->timeMarks().end());
        }
    }
    if (const auto saved = ObjectTables::Snapshot(*tables_).timeMarks(); saved.ok())
        marks.insert(saved->begin(), saved->end());
    if (marks.empty()) return std::nullopt;
    // The newest mark before the first event that is kept is that event's.
    auto mark = marks.upper_bound(first);
    if (mark != marks.begin()) --mark;
    return std::chrono::system_clock::time_point(
        std::chrono::duration_cast<std::chrono::system_clock::duration>(std::chrono::nanoseconds(mark->second)));
}

/// Whether there is anything that a history that begins now must not tell.
Result<bool> VolumeStore::Implementation::hasEvents() const {
    {
        const MutexLock lock(mutex_);
        for (const Overlay* overlay : {frozen_.get(), static_cast<const Overlay*>(active_.get())}) {
            if (overlay != nullptr && (overlay->lastEvent() != 0 || !overlay->timeMarks().empty())) return true;
        }
    }
    return tables_->eventCount() > 0 || !TRY(ObjectTables::Snapshot(*tables_).timeMarks()).empty();
}

/// With nothing to forget, a record says it: whoever waits for a first reading doesn't wait for the disk.
Result<std::uint64_t> VolumeStore::Implementation::beginFirstHistory() {
    const std::uint64_t begin = TRY(numbers_->reserveEvents(1));
    batch_.begin();
    batch_.add(LogRecordType::historyBegin, begin, ByteView());
    TRY(appendBatch());
    {
        const MutexLock lock(mutex_);
        active_->beginHistory(begin);
        hasHistory_ = true;
        forgottenEvent_ = begin;
        counts_.events = 0;
        saveSoon();
    }
    numbers_->takeEvents(1);
    return begin;
}

Result<std::uint64_t> VolumeStore::Implementation::beginHistory() {
    {
        const MutexLock writerLock(writerMutex_);
        TRY(waitForRoom());
        if (!TRY(hasEvents())) return beginFirstHistory();
    }
    TRY(checkpoint());
    const MutexLock checkpointLock(checkpointMutex_);
    const MutexLock writerLock(writerMutex_);
    TRY(saveEverything());
    const std::uint64_t begin = TRY(numbers_->reserveEvents(1));
    TablesHead head = tables_->head();
    head.hasHistory = true;
    head.forgottenEvent = begin;
    head.marks = numbers_->reserved();
    TRY(tables_->forgetEvents(head));
    lastTimeMark_.reset();
    {
        const MutexLock lock(mutex_);
        hasHistory_ = true;
        forgottenEvent_ = begin;
        counts_.events = 0;
    }
    numbers_->takeEvents(1);
    return begin;
}

Result<void> VolumeStore::Implementation::renewUUID() {
    TRY(checkpoint());
    const MutexLock checkpointLock(checkpointMutex_);
    const MutexLock writerLock(writerMutex_);
    TRY(saveEverything());
    // Under the new UUID what is in the logs would be nothing; it is in the tables.
    for (LogFile& log : logs_) TRY(log.clearDurably());
    TablesHead head = tables_->head();
    head.uuid = KsUUID::random();
    head.forgottenEvent = numbers_->currentEvent();
    TRY(tables_->forgetEvents(head));
    lastTimeMark_.reset();
    const MutexLock lock(mutex_);
    uuid_ = head.uuid;
    forgottenEvent_ = head.forgottenEvent;
    counts_.events = 0;
    return {};
}

std::int64_t VolumeStore::Implementation::now() const {
    return nanoseconds(options_.now ? options_.now() : std::chrono::system_clock::now());
}

/// Whether the time is to be remembered with the next event.
bool VolumeStore::Implementation::isTimeMarkDue(std::int64_t time) const {
    // A clock that was set back begins anew: the newer marks count.
    return !lastTimeMark_ || time < lastTimeMark_->time ||
           time - lastTimeMark_->time >= std::chrono::nanoseconds(kTimeMarkInterval).count();
}

/// The last event that was journalled longer ago, for certain; 0 for none.
Result<std::uint64_t> VolumeStore::Implementation::lastEventOlderThan(std::chrono::seconds age,
                                                                      std::uint64_t current) const {
    const auto marks = TRY(ObjectTables::Snapshot(*tables_).timeMarks());
    // Events from a mark on, up to the next, are of the interval that begins with it.
    const std::int64_t interval = std::chrono::nanoseconds(kTimeMarkInterval).count();
    const std::int64_t time = now();
    std::uint64_t last = 0;
    for (std::size_t i = 0; i < marks.size(); ++i) {
        if (time - marks[i].second < interval) continue;
        const auto seconds = (time - marks[i].second - interval) / 1'000'000'000;
        if (seconds < age.count()) continue;
        last = i + 1 < marks.size() ? marks[i + 1].first - 1 : current;
    }
    return last;
}

Result<void> VolumeStore::Implementation::trimJournal(std::uint64_t eventsMax, std::chrono::seconds ageMax) {
    const std::uint64_t current = currentEventID();
    // What is trimmed is in the tables.
    TRY(checkpoint());
    const MutexLock checkpointLock(checkpointMutex_);
    TablesHead head = tables_->head();
    const std::uint64_t upTo =
        std::min(current, std::max(TRY(tables_->lastEventBeyond(eventsMax)), TRY(lastEventOlderThan(ageMax, current))));
    if (upTo <= head.forgottenEvent) return {};
    head.forgottenEvent = upTo;
    {
        // Before the first goes: who finds its own still covered has them all.
        const MutexLock lock(mutex_);
        forgottenEvent_ = upTo;
    }
    const std::uint64_t forgotten = TRY(tables_->forgetEventsAsSaid(head));
    const MutexLock lock(mutex_);
    counts_.events -= std::min(counts_.events, forgotten);
    return {};
}

}  // namespace cindral
