#include "platform/revisions/ObjectTables.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "platform/foundation/Fatal.h"
#include "platform/revisions/Checksum.h"

namespace cindral {

namespace {

constexpr std::size_t kMapBytesMin = std::size_t{16} << 20;
constexpr unsigned kTablesMax = 8;
// NOTLS: a snapshot belongs to its object, not to its thread. NORDAHEAD: look-ups go all over the file. NOMETASYNC:
// pages
// are on the disk before the head page that names them is written, but that head page waits for the next sync; what is
// on the disk is whole at any moment.
constexpr unsigned kEnvironmentFlags = MDB_NOSUBDIR | MDB_NOTLS | MDB_NORDAHEAD | MDB_NOMETASYNC;

// Written to disk: never change one.
constexpr std::uint32_t kFormatVersion = 1;
constexpr std::string_view kHeadKey = "head";
constexpr std::size_t kHeadBytes = 4 + 16 + 8 + 8 + 8 + 4 + 4;
constexpr std::size_t kDocumentBytes = 16;

MDB_val valueOf(ByteView bytes) {
    return {bytes.size(),
            const_cast<std::byte*>(bytes.data())};  // NOLINT: the library takes no const, and does not write.
}

ByteView viewOf(const MDB_val& value) {
    return {static_cast<const std::byte*>(value.mv_data), value.mv_size};
}

/// A number as the library's integer keys want it: in the machine's own order.
template <typename Number>
class IntegerKey {
public:
    explicit IntegerKey(Number number) : number_(number) {}
    MDB_val* value() { return &value_; }

private:
    Number number_;
    MDB_val value_{sizeof number_, &number_};
};

bool isDamage(int code) {
    return code == MDB_INVALID || code == MDB_CORRUPTED || code == MDB_PAGE_NOTFOUND || code == MDB_VERSION_MISMATCH ||
           code == MDB_INCOMPATIBLE || code == MDB_NOTFOUND || code == MDB_CURSOR_FULL || code == MDB_PAGE_FULL;
}

KsError errorOf(int code) {
    if (code > 0) return KsError::posix(code);
    if (code == MDB_MAP_FULL) return KsError::posix(ENOSPC);
    return KsError::posix(isDamage(code) ? kDamageCode : EIO).with("message", mdb_strerror(code));
}

KsError damage(std::string message) {
    return KsError::posix(kDamageCode).with("message", std::move(message));
}

std::array<std::byte, kHeadBytes> encodeHead(const TablesHead& head) {
    std::array<std::byte, kHeadBytes> bytes{};
    storeInteger(bytes.data(), kFormatVersion);
    std::memcpy(bytes.data() + 4, head.uuid.bytes.data(), 16);
    storeInteger(bytes.data() + 20, head.marks.document);
    storeInteger(bytes.data() + 28, head.marks.event);
    storeInteger(bytes.data() + 36, head.appliedBatch);
    storeInteger(bytes.data() + 44, static_cast<std::uint32_t>(head.settledDocument));
    storeInteger(bytes.data() + 48, crc32c(ByteView(bytes).first(48)));
    return bytes;
}

Result<TablesHead> decodeHead(ByteView bytes) {
    if (bytes.size() < 4) return damage("the head is too short");
    const auto version = loadInteger<std::uint32_t>(bytes.data());
    if (version != kFormatVersion) return damage(fmt::format("format {} is not known here", version));
    if (bytes.size() != kHeadBytes || loadInteger<std::uint32_t>(bytes.data() + 48) != crc32c(bytes.first(48))) {
        return damage("the head's checksum is wrong");
    }
    TablesHead head;
    std::memcpy(head.uuid.bytes.data(), bytes.data() + 4, 16);
    head.marks = {loadInteger<std::uint64_t>(bytes.data() + 20), loadInteger<std::uint64_t>(bytes.data() + 28)};
    head.appliedBatch = loadInteger<std::uint64_t>(bytes.data() + 36);
    head.settledDocument = DocumentID{loadInteger<std::uint32_t>(bytes.data() + 44)};
    return head;
}

std::optional<DocumentRecord> decodeDocument(ByteView bytes) {
    if (bytes.size() != kDocumentBytes) return std::nullopt;
    return DocumentRecord{FileID{loadInteger<std::uint64_t>(bytes.data())},
                          loadInteger<std::int64_t>(bytes.data() + 8)};
}

}  // namespace

// MARK: Opening

Result<void> ObjectTables::create(const std::string& path, const TablesHead& head) {
    // Under another name until it is whole, so that no crash leaves a file that looks damaged.
    const std::string unfinished = path + ".new";
    ::unlink(unfinished.c_str());
    {
        ObjectTables tables;
        TRY(tables.openEnvironment(unfinished, kMapBytesMin));
        TRY(tables.openTables(true));
        TRY(tables.inTransaction([&](MDB_txn* transaction) { return putHead(transaction, tables.meta_, head); }));
        TRY(tables.sync());
    }
    ::unlink((unfinished + "-lock").c_str());
    if (::rename(unfinished.c_str(), path.c_str()) != 0) return KsError::posix(errno, path);
    return syncFolderOf(path);
}

Result<std::unique_ptr<ObjectTables>> ObjectTables::open(const std::string& path, std::size_t mapBytes) {
    struct stat status {};
    if (::stat(path.c_str(), &status) != 0) return KsError::posix(errno, path);
    // The library would make a new file of an empty one.
    if (status.st_size == 0) return damage("the file is empty");
    auto tables = std::unique_ptr<ObjectTables>(new ObjectTables);
    TRY(tables->openEnvironment(path, mapBytes));
    TRY(tables->openTables(false));
    TRY(tables->loadHead());
    return tables;
}

Result<void> ObjectTables::openEnvironment(const std::string& path, std::size_t mapBytes) {
    // Only the holder of the store's lock comes here: readers that a crash left in the library's own lock file are
    // nobody.
    ::unlink((path + "-lock").c_str());
    while (true) {
        if (const int code = mdb_env_create(&environment_); code != 0) return errorOf(code);
        mdb_env_set_maxdbs(environment_, kTablesMax);
        mdb_env_set_mapsize(environment_, mapBytes);
        const int code = mdb_env_open(environment_, path.c_str(), kEnvironmentFlags, 0600);
        if (code == 0) break;
        mdb_env_close(environment_);
        environment_ = nullptr;
        if (code != ENOMEM || mapBytes <= kMapBytesMin) return errorOf(code);
        mapBytes /= 2;
    }
    // The library keeps its other descriptors from programs that are started, but not this one.
    int file = -1;
    if (mdb_env_get_fd(environment_, &file) == 0) (void)::fcntl(file, F_SETFD, FD_CLOEXEC);
    MDB_stat stat{};
    mdb_env_stat(environment_, &stat);
    pageBytes_ = stat.ms_psize;
    // A map begins where a page of the system's begins; only then does an address tell where a page of ours begins.
    pagesAreKnown_ = tablepages::kKnown && pageBytes_ <= static_cast<std::size_t>(::sysconf(_SC_PAGESIZE));
    return {};
}

Result<void> ObjectTables::openTables(bool create) {
    const unsigned flag = create ? MDB_CREATE : 0;
    MDB_txn* transaction = nullptr;
    if (const int code = mdb_txn_begin(environment_, nullptr, create ? 0 : MDB_RDONLY, &transaction); code != 0) {
        return errorOf(code);
    }
    int code = mdb_dbi_open(transaction, nullptr, 0, &tableOfTables_);
    if (code == 0) code = mdb_dbi_open(transaction, "meta", flag, &meta_);
    if (code == 0) code = mdb_dbi_open(transaction, "objects", flag | MDB_INTEGERKEY, &objects_);
    if (code == 0) code = mdb_dbi_open(transaction, "documents", flag | MDB_INTEGERKEY, &documents_);
    if (code != 0) {
        mdb_txn_abort(transaction);
        return errorOf(code);
    }
    // Also a read transaction is committed: only then do its table handles outlive it.
    code = mdb_txn_commit(transaction);
    if (code != 0) return errorOf(code);
    return {};
}

Result<void> ObjectTables::loadHead() {
    MDB_txn* transaction = TRY(takeReader());
    MDB_val key{kHeadKey.size(), const_cast<char*>(kHeadKey.data())};  // NOLINT: not written.
    MDB_val value{};
    const int code = mdb_get(transaction, meta_, &key, &value);
    Result<TablesHead> head = code == 0 ? decodeHead(viewOf(value)) : Result<TablesHead>(errorOf(code));
    giveBackReader(transaction);
    head_ = TRY(std::move(head));
    return {};
}

ObjectTables::~ObjectTables() {
    {
        const MutexLock lock(readersMutex_);
        for (MDB_txn* reader : idleReaders_) mdb_txn_abort(reader);
        idleReaders_.clear();
    }
    if (environment_ != nullptr) mdb_env_close(environment_);
}

// MARK: Reading

Result<MDB_txn*> ObjectTables::takeReader() const {
    MDB_txn* reader = nullptr;
    const MutexLock lock(readersMutex_);
    while (true) {
        while (mapMoves_) readersChanged_.wait(readersMutex_);
        int code = 0;
        if (!idleReaders_.empty()) {
            reader = idleReaders_.back();
            code = mdb_txn_renew(reader);
            if (code == 0) idleReaders_.pop_back();
        } else {
            code = mdb_txn_begin(environment_, nullptr, MDB_RDONLY, &reader);
        }
        if (code == 0) break;
        // As many threads are reading as the library has places for.
        if (code != MDB_READERS_FULL || busyReaders_ == 0) return errorOf(code);
        readersChanged_.wait(readersMutex_);
    }
    ++busyReaders_;
    return reader;
}

void ObjectTables::giveBackReader(MDB_txn* transaction) const {
    mdb_txn_reset(transaction);
    const MutexLock lock(readersMutex_);
    idleReaders_.push_back(transaction);
    --busyReaders_;
    readersChanged_.notifyAll();
}

ObjectTables::Snapshot::Snapshot(const ObjectTables& tables) : tables_(tables) {
    Result<MDB_txn*> reader = tables_.takeReader();
    if (reader.ok()) {
        transaction_ = *reader;
    } else {
        status_ = reader.error();
    }
}

ObjectTables::Snapshot::~Snapshot() {
    if (transaction_ != nullptr) tables_.giveBackReader(transaction_);
}

std::optional<PackedRecord> ObjectTables::Snapshot::object(FileID fileID) const {
    IntegerKey<std::uint64_t> key(static_cast<std::uint64_t>(fileID));
    MDB_val value{};
    if (transaction_ == nullptr || mdb_get(transaction_, tables_.objects_, key.value(), &value) != 0)
        return std::nullopt;
    return PackedRecord::decode(viewOf(value));
}

std::optional<DocumentRecord> ObjectTables::Snapshot::document(DocumentID documentID) const {
    IntegerKey<std::uint32_t> key(static_cast<std::uint32_t>(documentID));
    MDB_val value{};
    if (transaction_ == nullptr || mdb_get(transaction_, tables_.documents_, key.value(), &value) != 0)
        return std::nullopt;
    return decodeDocument(viewOf(value));
}

/// Root of the object table at this moment, and where the file is mapped: the value that tells the one lies on a page
/// that knows its number.
std::optional<tablepages::Tree> ObjectTables::Snapshot::objectTree(const std::byte** map) const {
    if (!tables_.pagesAreKnown_) return std::nullopt;
    constexpr std::string_view kName = "objects";
    MDB_val key{kName.size(), const_cast<char*>(kName.data())};  // NOLINT: not written.
    MDB_val value{};
    if (mdb_get(transaction_, tables_.tableOfTables_, &key, &value) != 0) return std::nullopt;
    if (value.mv_size != sizeof(tablepages::Tree)) return std::nullopt;
    tablepages::Tree tree{};
    std::memcpy(&tree, value.mv_data, sizeof tree);
    const auto address = reinterpret_cast<std::uintptr_t>(value.mv_data);
    const auto* page = static_cast<const std::byte*>(value.mv_data) - (address & (tables_.pageBytes_ - 1));
    *map = page - loadInteger<std::uint64_t>(page) * tables_.pageBytes_;
    return tree;
}

Result<void> ObjectTables::Snapshot::objects(std::span<tablepages::Lookup> lookups) const {
    TRY(Result<void>(status_));
    const std::byte* map = nullptr;
    if (const auto tree = objectTree(&map)) {
        MDB_envinfo info{};
        mdb_env_info(tables_.environment_, &info);
        if (!tablepages::lookUp(map, tables_.pageBytes_, info.me_last_pgno + 1, *tree, lookups)) {
            return damage("a page of the objects is not what it should be");
        }
        return {};
    }
    for (auto& lookup : lookups) {
        IntegerKey<std::uint64_t> key(lookup.key);
        MDB_val value{};
        const int code = mdb_get(transaction_, tables_.objects_, key.value(), &value);
        if (code != 0 && code != MDB_NOTFOUND) return errorOf(code);
        lookup.found = code == 0;
        if (lookup.found) lookup.value = viewOf(value);
    }
    return {};
}

std::uint64_t ObjectTables::lastTransaction() const {
    MDB_envinfo info{};
    mdb_env_info(environment_, &info);
    return info.me_last_txnid;
}

std::uint64_t ObjectTables::entriesOf(MDB_dbi table) const {
    Result<MDB_txn*> reader = takeReader();
    if (!reader.ok()) return 0;
    MDB_stat stat{};
    const int code = mdb_stat(*reader, table, &stat);
    giveBackReader(*reader);
    return code == 0 ? stat.ms_entries : 0;
}

std::uint64_t ObjectTables::objectCount() const {
    return entriesOf(objects_);
}

std::uint64_t ObjectTables::documentCount() const {
    return entriesOf(documents_);
}

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

int ObjectTables::putHead(MDB_txn* transaction, MDB_dbi table, const TablesHead& head) {
    const auto bytes = encodeHead(head);
    MDB_val key{kHeadKey.size(), const_cast<char*>(kHeadKey.data())};  // NOLINT: not written.
    MDB_val value = valueOf(bytes);
    return mdb_put(transaction, table, &key, &value, 0);
}

/// Puts records, and counts the pages that come to be changed by them.
class ObjectTables::Putter {
public:
    Putter(MDB_txn* transaction, std::size_t pageBytes, std::size_t pagesMax)
        : transaction_(transaction), pageBytes_(pageBytes), pagesMax_(pagesMax) {}

    /// Whether the transaction has about as many pages in memory as it shall.
    bool isFull() const { return pages_ >= pagesMax_; }

    int put(MDB_dbi table, const Overlay::Document& document) {
        IntegerKey<std::uint32_t> key(static_cast<std::uint32_t>(document.first));
        MDB_val place{kDocumentBytes, nullptr};
        const int code = mdb_put(transaction_, table, key.value(), &place, MDB_RESERVE);
        if (code != 0) return code;
        auto* to = count(place);
        storeInteger(to, static_cast<std::uint64_t>(document.second.fileID));
        storeInteger(to + 8, document.second.birthTime);
        return 0;
    }

    int put(MDB_dbi table, const Overlay::Object& object) {
        IntegerKey<std::uint64_t> key(static_cast<std::uint64_t>(object.first));
        MDB_val place{object.second.size(), nullptr};
        const int code = mdb_put(transaction_, table, key.value(), &place, MDB_RESERVE);
        if (code != 0) return code;
        std::memcpy(count(place), object.second.data(), object.second.size());
        return 0;
    }

private:
    // Records come in key order, so a page is changed by several in a row. Where one goes tells whether it is the
    // page of the one
    // before; that may be wrong by a few.
    std::byte* count(const MDB_val& place) {
        const auto address = reinterpret_cast<std::uintptr_t>(place.mv_data);
        const std::uintptr_t distance = address > last_ ? address - last_ : last_ - address;
        if (distance >= pageBytes_) ++pages_;
        last_ = address;
        return static_cast<std::byte*>(place.mv_data);
    }

    MDB_txn* transaction_;
    std::size_t pageBytes_;
    std::size_t pagesMax_;
    std::size_t pages_ = 0;
    std::uintptr_t last_ = 0;
};

Result<void> ObjectTables::write(const Overlay& overlay, const TablesHead& head, std::size_t pagesMax,
                                 const StepObserver& observer) {
    const auto objects = overlay.objectsInKeyOrder();
    const auto& documents = overlay.documents();
    std::size_t document = 0, object = 0;
    for (bool isLast = false; !isLast;) {
        std::size_t documentEnd = 0, objectEnd = 0;
        TRY(inTransaction([&](MDB_txn* transaction) {
            Putter putter(transaction, pageBytes_, pagesMax);
            int code = 0;
            for (documentEnd = document; code == 0 && documentEnd < documents.size() && !putter.isFull();
                 ++documentEnd) {
                code = putter.put(documents_, documents[documentEnd]);
            }
            for (objectEnd = object; code == 0 && objectEnd < objects.size() && !putter.isFull(); ++objectEnd) {
                code = putter.put(objects_, objects[objectEnd]);
            }
            isLast = documentEnd == documents.size() && objectEnd == objects.size();
            if (code == 0 && isLast) code = putHead(transaction, meta_, head);
            return code;
        }));
        if (observer) observer();
        document = documentEnd;
        object = objectEnd;
    }
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

}  // namespace cindral
