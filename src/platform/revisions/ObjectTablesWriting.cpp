#include <sys/mman.h>

#include <algorithm>

#include "platform/foundation/Fatal.h"
#include "platform/revisions/ObjectTables.h"
#include "platform/revisions/ObjectTablesKeys.h"

// What changes the tables.

namespace cindral {

using namespace tablekeys;

namespace {

// Looked up at once, as a listing's page is.
constexpr std::size_t kChangesAtOnceMax = 128;
// Entries that one transaction removes when many go.
constexpr std::size_t kForgottenAtOnce = 20'000;
// Children that are sorted in memory when their list is made anew.
constexpr std::size_t kChildrenAtOnce = 1'000'000;
constexpr std::size_t kPagesOfOneRebuildStep = 512;
// What a transaction leaves free is used again by the next but one, and the file is larger by both. So a small file gets
// small transactions: these, or a part of its pages, if that is more.
constexpr std::size_t kPagesOfATransactionMin = 128;
constexpr std::size_t kPartOfATransaction = 16;

}  // namespace

// MARK: Writing

int ObjectTables::inTransactionOnce(const Body& body) {
    MDB_txn* transaction = nullptr;
    if (const int code = mdb_txn_begin(environment_, nullptr, 0, &transaction); code != 0) return code;
    if (const int code = body(transaction); code != 0) {
        mdb_txn_abort(transaction);
        return code;
    }
    return mdb_txn_commit(transaction);
}

/// The body is run again, in a larger map, when the map is full.
Result<void> ObjectTables::inTransaction(const Body& body) {
    while (true) {
        const int code = inTransactionOnce(body);
        if (code == 0) return {};
        if (code != MDB_MAP_FULL) return errorOf(code);
        TRY(growMap());
    }
}

/// Puts the last commit's head page on the disk; everything else is there already.
Result<void> ObjectTables::sync() {
    if (const int code = mdb_env_sync(environment_, 1); code != 0) return errorOf(code);
    return {};
}

Result<void> ObjectTables::growMap() {
    const MutexLock lock(readersMutex_);
    mapMoves_ = true;
    while (busyReaders_ > 0) readersChanged_.wait(readersMutex_);
    for (MDB_txn* reader : idleReaders_) mdb_txn_abort(reader);
    idleReaders_.clear();
    MDB_envinfo info{};
    mdb_env_info(environment_, &info);
    const std::size_t wanted = info.me_mapsize * 2;
    // The library lets go of the old map before it asks for the new one, so ask first whether there is room.
    void* room = ::mmap(nullptr, wanted, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE, -1, 0);
    int code = room == MAP_FAILED ? ENOMEM : 0;
    if (code == 0) {
        ::munmap(room, wanted);
        code = mdb_env_set_mapsize(environment_, wanted);
        if (code != 0) fatal("the volume store's map is lost");
    }
    mapMoves_ = false;
    readersChanged_.notifyAll();
    if (code != 0) return errorOf(code);
    return {};
}

/// A name in a folder that is there from now on, or is not.
struct ObjectTables::Child {
    FileID parent{};
    std::uint32_t hash = 0;
    FileID fileID{};
    bool isThere = false;

    std::tuple<FileID, std::uint32_t, FileID> place() const { return {parent, hash, fileID}; }
};

/// Puts records within one transaction, and counts the pages that come to be changed by them.
class ObjectTables::Writer {
public:
    Writer(const ObjectTables& tables, MDB_txn* transaction, std::size_t pagesMax)
        : tables_(tables),
          pagesMax_(pagesMax),
          transaction_(transaction),
          objects_(transaction, tables.objects_),
          children_(transaction, tables.children_),
          events_(transaction, tables.events_) {}

    /// Whether the transaction has about as many pages in memory as it shall.
    bool isFull() const { return pages_ >= pagesMax_; }

    int put(const Overlay::Document& document) {
        IntegerKey<std::uint32_t> key(static_cast<std::uint32_t>(document.first));
        MDB_val place{kDocumentBytes, nullptr};
        const int code = mdb_put(transaction_, tables_.documents_, key.value(), &place, MDB_RESERVE);
        if (code == 0) encodeDocument(document.second, count(place));
        return code;
    }

    int put(const Overlay::Object& object, const std::map<DocumentID, DocumentRecord>& handedOver) {
        IntegerKey<std::uint64_t> key(static_cast<std::uint64_t>(object.fileID));
        const auto record = PackedRecord::decode(object.packed);
        std::uint64_t eventBefore = 0;
        if (const int code = record ? putRecord(key, object.packed, &eventBefore) : removeRecord(key, &eventBefore);
            code != 0) {
            return code;
        }
        if (eventBefore != 0 && (!record || record->eventID != eventBefore)) {
            if (const int code = removeEvent(eventBefore); code != 0) return code;
        }
        if (!record || handedOver.empty()) return 0;
        const auto found = handedOver.find(record->documentID);
        return found != handedOver.end() && found->second.fileID == object.fileID ? put(*found) : 0;
    }

    int put(const Child& child) {
        IntegerKey<std::uint64_t> key(static_cast<std::uint64_t>(child.parent));
        const auto bytes = encodeChild(child.hash, child.fileID);
        MDB_val value = valueOf(bytes);
        if (child.isThere) {
            const int code = children_.put(key.value(), &value, MDB_NODUPDATA);
            if (code != 0) return code == MDB_KEYEXIST ? 0 : code;
            if (children_.get(key.value(), &value, MDB_GET_CURRENT) == 0) count(value);
            return 0;
        }
        const int code = children_.get(key.value(), &value, MDB_GET_BOTH);
        if (code != 0) return code == MDB_NOTFOUND ? 0 : code;
        count(value);
        return children_.remove();
    }

    int putName(const NameKey& nameKey, const std::optional<std::string>& name) {
        const auto byObject = encodeNameKey(nameKey), byPlace = encodeNamePlace(nameKey);
        MDB_val objectKey = valueOf(byObject), placeKey = valueOf(byPlace), nothing{0, nullptr};
        pages_ += 2;
        if (name) {
            MDB_val value{name->size(), const_cast<char*>(name->data())};  // NOLINT: not written.
            const int code = mdb_put(transaction_, tables_.names_, &objectKey, &value, 0);
            return code != 0 ? code : mdb_put(transaction_, tables_.names_, &placeKey, &nothing, 0);
        }
        const int code = mdb_del(transaction_, tables_.names_, &objectKey, nullptr);
        if (code != 0 && code != MDB_NOTFOUND) return code;
        const int other = mdb_del(transaction_, tables_.names_, &placeKey, nullptr);
        return other == MDB_NOTFOUND ? 0 : other;
    }

    int putAttributes(DocumentID documentID, ByteView attributes) {
        IntegerKey<std::uint32_t> key(static_cast<std::uint32_t>(documentID));
        pages_ += 1 + attributes.size() / tables_.pageBytes_;
        if (attributes.empty()) {
            const int code = mdb_del(transaction_, tables_.attributes_, key.value(), nullptr);
            return code == MDB_NOTFOUND ? 0 : code;
        }
        MDB_val value = valueOf(attributes);
        return mdb_put(transaction_, tables_.attributes_, key.value(), &value, 0);
    }

    int putEvent(std::uint64_t eventID, ByteView packed) {
        IntegerKey<std::uint64_t> key(eventID);
        MDB_val place{packed.size(), nullptr};
        const int code = events_.put(key.value(), &place, MDB_RESERVE);
        if (code == 0) std::memcpy(count(place), packed.data(), packed.size());
        return code;
    }

    int putPresence(const std::pair<std::uint64_t, FileID>& presence) {
        std::array<std::byte, Presence::kBytes> packed{};
        Presence{presence.second}.encode(packed.data());
        return putEvent(presence.first, packed);
    }

    int put(MDB_dbi table, std::uint64_t key, ByteView bytes) {
        IntegerKey<std::uint64_t> integerKey(key);
        MDB_val place{bytes.size(), nullptr};
        const int code = mdb_put(transaction_, table, integerKey.value(), &place, MDB_RESERVE);
        if (code == 0) std::memcpy(count(place), bytes.data(), bytes.size());
        return code;
    }

private:
    int putRecord(IntegerKey<std::uint64_t>& key, ByteView packed, std::uint64_t* eventBefore) {
        MDB_val place{packed.size(), nullptr};
        int code = objects_.put(key.value(), &place, MDB_NOOVERWRITE | MDB_RESERVE);
        if (code == MDB_KEYEXIST) {
            *eventBefore = eventOf(place);
            place = {packed.size(), nullptr};
            code = objects_.put(key.value(), &place, MDB_RESERVE);
        }
        if (code == 0) std::memcpy(count(place), packed.data(), packed.size());
        return code;
    }

    int removeRecord(IntegerKey<std::uint64_t>& key, std::uint64_t* eventBefore) {
        MDB_val value{};
        const int code = objects_.get(key.value(), &value, MDB_SET);
        if (code != 0) return code == MDB_NOTFOUND ? 0 : code;
        *eventBefore = eventOf(value);
        count(value);
        return objects_.remove();
    }

    int removeEvent(std::uint64_t eventID) {
        IntegerKey<std::uint64_t> key(eventID);
        MDB_val value{};
        const int code = events_.get(key.value(), &value, MDB_SET);
        if (code != 0) return code == MDB_NOTFOUND ? 0 : code;  // Trimmed.
        count(value);
        return events_.remove();
    }

    static std::uint64_t eventOf(const MDB_val& value) {
        const auto record = PackedRecord::decode(viewOf(value));
        return record ? record->eventID : 0;
    }

    // Records come in key order, so a page is changed by several in a row. Where one goes tells whether it is the page
    // of the one before; that may be wrong by a few.
    std::byte* count(const MDB_val& place) {
        const auto address = reinterpret_cast<std::uintptr_t>(place.mv_data);
        const std::uintptr_t distance = address > last_ ? address - last_ : last_ - address;
        if (distance >= tables_.pageBytes_) ++pages_;
        last_ = address;
        return static_cast<std::byte*>(place.mv_data);
    }

    const ObjectTables& tables_;
    std::size_t pagesMax_;
    MDB_txn* transaction_;
    Cursor objects_;
    Cursor children_;
    Cursor events_;
    std::size_t pages_ = 0;
    std::uintptr_t last_ = 0;
};

/// What a write has to do, each part in the order of its keys.
struct ObjectTables::Work {
    struct Part {
        std::size_t count = 0;
        std::function<int(Writer&, std::size_t)> put;
    };
    std::vector<Part> parts;

    /// Where it goes on.
    struct Position {
        std::size_t part = 0;
        std::size_t item = 0;
    };
    bool isAtEnd(const Position& position) const { return position.part == parts.size(); }

    /// Goes on until the transaction is full, or to the end.
    int carryOn(Writer& writer, Position& position) const {
        for (; !isAtEnd(position); position = {position.part + 1, 0}) {
            const Part& part = parts[position.part];
            for (; position.item < part.count; ++position.item) {
                if (writer.isFull()) return 0;
                if (const int code = part.put(writer, position.item); code != 0) return code;
            }
        }
        return 0;
    }
};

/// What the objects change in the list of children, by what the tables say of them now.
Result<std::vector<ObjectTables::Child>> ObjectTables::changedChildren(
    const std::vector<Overlay::Object>& objects) const {
    std::vector<Child> changes;
    const std::span all(objects);
    for (std::size_t begin = 0; begin < all.size(); begin += kChangesAtOnceMax) {
        TRY(addChanges(all.subspan(begin, std::min(kChangesAtOnceMax, all.size() - begin)), changes));
    }
    std::ranges::sort(changes, {}, &Child::place);
    return changes;
}

Result<void> ObjectTables::addChanges(std::span<const Overlay::Object> objects, std::vector<Child>& changes) const {
    std::array<tablepages::Lookup, kChangesAtOnceMax> lookups;
    for (std::size_t i = 0; i < objects.size(); ++i) {
        lookups[i] = {.key = static_cast<std::uint64_t>(objects[i].fileID)};
    }
    const Snapshot snapshot(*this);
    TRY(snapshot.objects(std::span(lookups).first(objects.size())));
    for (std::size_t i = 0; i < objects.size(); ++i) {
        const auto& [fileID, hash, packed] = objects[i];
        const auto before = lookups[i].found ? PackedRecord::decode(lookups[i].value) : std::nullopt;
        const auto now = PackedRecord::decode(packed);
        if (before && now && before->isAt(now->parent, now->name)) continue;
        const std::uint32_t hashBefore = before ? nameHash(head_.nameHashKey, before->name) : 0;
        if (before && now && before->parent == now->parent && hashBefore == hash) continue;
        if (before) changes.push_back({before->parent, hashBefore, fileID, false});
        if (now) changes.push_back({now->parent, hash, fileID, true});
    }
    return {};
}

Result<void> ObjectTables::write(const Overlay& overlay, const TablesHead& head, std::size_t pagesMax,
                                 const StepObserver& observer) {
    const auto objects = overlay.objectsInKeyOrder();
    const auto children = TRY(changedChildren(objects));
    auto presences = overlay.presences();
    std::erase_if(presences, [&](const auto& presence) { return !overlay.isCurrent(presence); });
    std::ranges::sort(presences);
    std::vector<decltype(&*overlay.names().begin())> names;
    for (const auto& name : overlay.names()) names.push_back(&name);
    std::vector<decltype(&*overlay.attributes().begin())> attributes;
    for (const auto& entry : overlay.attributes()) attributes.push_back(&entry);
    const std::vector<Overlay::Document> handedOver(overlay.handedOver().begin(), overlay.handedOver().end());

    const auto& documents = overlay.documents();
    const auto& changes = overlay.documentChanges();
    const auto& departures = overlay.departures();
    const auto& marks = overlay.timeMarks();
    const Work work{{
        {documents.size(), [&](Writer& to, std::size_t i) { return to.put(documents[i]); }},
        {attributes.size(),
         [&](Writer& to, std::size_t i) { return to.putAttributes(attributes[i]->first, attributes[i]->second); }},
        {names.size(), [&](Writer& to, std::size_t i) { return to.putName(names[i]->first, names[i]->second); }},
        {changes.size(),
         [&](Writer& to, std::size_t i) {
             return to.put(documentChanges_, changes[i].first, changes[i].second.encode());
         }},
        {departures.size(),
         [&](Writer& to, std::size_t i) { return to.putEvent(departures[i].first, departures[i].second); }},
        {presences.size(), [&](Writer& to, std::size_t i) { return to.putPresence(presences[i]); }},
        {marks.size(),
         [&](Writer& to, std::size_t i) {
             std::array<std::byte, sizeof(std::int64_t)> time{};
             storeInteger(time.data(), marks[i].second);
             return to.put(timeMarks_, marks[i].first, time);
         }},
        {children.size(), [&](Writer& to, std::size_t i) { return to.put(children[i]); }},
        {objects.size(), [&](Writer& to, std::size_t i) { return to.put(objects[i], overlay.handedOver()); }},
        // Also where the object has lost the document again since.
        {handedOver.size(), [&](Writer& to, std::size_t i) { return to.put(handedOver[i]); }},
    }};

    MDB_envinfo info{};
    mdb_env_info(environment_, &info);
    pagesMax = std::min(pagesMax, std::max(kPagesOfATransactionMin, info.me_last_pgno / kPartOfATransaction));
    TablesHead finished = head;
    finished.begunBatch = head.appliedBatch;
    Work::Position position;
    for (bool isFirst = true; isFirst || !work.isAtEnd(position); isFirst = false) {
        TablesHead begun = head_;
        begun.begunBatch = std::max(begun.begunBatch, head.appliedBatch);
        Work::Position next;
        TRY(inTransaction([&](MDB_txn* transaction) {
            next = position;
            int code = 0;
            {
                Writer writer(*this, transaction, pagesMax);
                code = work.carryOn(writer, next);
            }
            if (code == 0 && work.isAtEnd(next)) return putHead(transaction, meta_, finished);
            return code == 0 && isFirst ? putHead(transaction, meta_, begun) : code;
        }));
        if (observer) observer();
        position = next;
        if (!work.isAtEnd(position)) head_ = begun;
    }
    TRY(sync());
    head_ = finished;
    return {};
}

Result<void> ObjectTables::writeHead(const TablesHead& head) {
    TRY(inTransaction([&](MDB_txn* transaction) { return putHead(transaction, meta_, head); }));
    TRY(sync());
    head_ = head;
    return {};
}

Result<void> ObjectTables::removeUnsettledDocuments() {
    return inTransaction([&](MDB_txn* transaction) {
        MDB_cursor* cursor = nullptr;
        if (const int code = mdb_cursor_open(transaction, documents_, &cursor); code != 0) return code;
        IntegerKey<std::uint32_t> from(static_cast<std::uint32_t>(head_.settledDocument) + 1);
        MDB_val key = *from.value(), value{};
        int code = mdb_cursor_get(cursor, &key, &value, MDB_SET_RANGE);
        for (; code == 0; code = mdb_cursor_get(cursor, &key, &value, MDB_NEXT)) {
            std::uint32_t documentID = 0;
            std::memcpy(&documentID, key.mv_data, sizeof documentID);
            const auto document = decodeDocument(viewOf(value));
            IntegerKey<std::uint64_t> objectKey(document ? static_cast<std::uint64_t>(document->fileID) : 0);
            MDB_val object{};
            const bool known = mdb_get(transaction, objects_, objectKey.value(), &object) == 0;
            const auto record = known ? PackedRecord::decode(viewOf(object)) : std::nullopt;
            if (record && record->documentID == DocumentID{documentID}) continue;
            code = mdb_cursor_del(cursor, 0);
            if (code != 0) break;
        }
        mdb_cursor_close(cursor);
        return code == MDB_NOTFOUND ? 0 : code;
    });
}

Result<void> ObjectTables::rebuildChildren() {
    TRY(inTransaction([&](MDB_txn* transaction) { return mdb_drop(transaction, children_, 0); }));
    std::optional<std::uint64_t> from = 0;
    while (from) {
        const std::vector<Child> children = TRY(childrenFrom(from));
        std::size_t done = 0;
        while (done < children.size()) {
            std::size_t next = done;
            TRY(inTransaction([&](MDB_txn* transaction) {
                Writer writer(*this, transaction, kPagesOfOneRebuildStep);
                int code = 0;
                for (next = done; code == 0 && next < children.size() && !writer.isFull(); ++next) {
                    code = writer.put(children[next]);
                }
                return code;
            }));
            done = next;
        }
    }
    TablesHead head = head_;
    head.begunBatch = head.appliedBatch;
    return writeHead(head);
}

/// The places of some objects from an ID on, in the order of the children's list. The ID is moved on behind them: none
/// at the end.
Result<std::vector<ObjectTables::Child>> ObjectTables::childrenFrom(std::optional<std::uint64_t>& from) const {
    const Snapshot snapshot(*this);
    TRY(Result<void>(snapshot.status()));
    std::vector<Child> children;
    std::optional<std::uint64_t> next;
    TRY(snapshot.allObjects(*from, [&](FileID fileID, const PackedRecord& record) {
        if (children.size() == kChildrenAtOnce) {
            next = static_cast<std::uint64_t>(fileID);
            return false;
        }
        children.push_back({record.parent, nameHash(head_.nameHashKey, record.name), fileID, true});
        return true;
    }));
    from = next;
    std::ranges::sort(children, {}, &Child::place);
    return children;
}

// MARK: Forgetting

Result<void> ObjectTables::forgetEvents(const TablesHead& head) {
    TRY(inTransaction([&](MDB_txn* transaction) {
        for (const MDB_dbi table : {events_, documentChanges_, timeMarks_}) {
            if (const int code = mdb_drop(transaction, table, 0); code != 0) return code;
        }
        return putHead(transaction, meta_, head);
    }));
    TRY(sync());
    head_ = head;
    return {};
}

Result<std::uint64_t> ObjectTables::lastEventBeyond(std::uint64_t eventsMax) const {
    const std::uint64_t count = eventCount();
    if (count <= eventsMax) return 0;
    const Snapshot snapshot(*this);
    std::uint64_t left = count - eventsMax, last = 0;
    // The two lists, one beside the other: a piece of one at a time, and of the other what lies before its end.
    std::vector<std::uint64_t> ids;
    while (left > 0) {
        ids.clear();
        const auto take = [&](std::uint64_t id, ByteView) {
            ids.push_back(id);
            return ids.size() % kForgottenAtOnce != 0;
        };
        TRY(snapshot.events(last, take));
        const bool isWhole = ids.size() < kForgottenAtOnce;
        const std::uint64_t end = isWhole ? ~std::uint64_t{0} : ids.back();
        TRY(snapshot.documentChanges(last, [&](std::uint64_t id, ByteView) {
            if (id > end) return false;
            ids.push_back(id);
            return true;
        }));
        if (ids.empty()) break;
        std::ranges::sort(ids);
        const std::size_t taken = std::min<std::uint64_t>(left, ids.size());
        last = ids[taken - 1];
        left -= taken;
    }
    return last;
}

/// Removes the first entries of the table up to the ID, not all at once; answers how many.
Result<std::uint64_t> ObjectTables::forgetSome(MDB_dbi table, std::uint64_t upTo) {
    std::uint64_t removed = 0;
    TRY(inTransaction([&](MDB_txn* transaction) {
        removed = 0;
        const Cursor cursor(transaction, table);
        MDB_val key{}, value{};
        int code = cursor.get(&key, &value, MDB_FIRST);
        for (; code == 0 && removed < kForgottenAtOnce; code = cursor.get(&key, &value, MDB_FIRST)) {
            std::uint64_t id = 0;
            std::memcpy(&id, key.mv_data, sizeof id);
            if (id > upTo) break;
            code = cursor.remove();
            if (code != 0) break;
            ++removed;
        }
        return code == MDB_NOTFOUND ? 0 : code;
    }));
    return removed;
}

Result<std::uint64_t> ObjectTables::forgetEventsAsSaid(const TablesHead& head) {
    TRY(writeHead(head));
    const std::uint64_t upTo = head.forgottenEvent;
    std::uint64_t forgotten = 0;
    for (const MDB_dbi table : {events_, documentChanges_}) {
        while (const std::uint64_t some = TRY(forgetSome(table, upTo))) forgotten += some;
    }
    // The newest mark before the first event that stays is that event's.
    const auto marks = TRY(Snapshot(*this).timeMarks());
    const auto kept = std::ranges::upper_bound(marks, upTo + 1, {}, [](const auto& mark) { return mark.first; });
    if (kept - marks.begin() >= 2) {
        const std::uint64_t last = std::prev(kept, 2)->first;
        while (TRY(forgetSome(timeMarks_, last)) > 0) {
        }
    }
    TRY(sync());
    return forgotten;
}

}  // namespace cindral
