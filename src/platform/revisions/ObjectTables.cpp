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
#include "platform/foundation/Sys.h"
#include "platform/revisions/Checksum.h"
#include "platform/revisions/ObjectTablesKeys.h"

namespace cindral {

using namespace tablekeys;

namespace {

constexpr std::size_t kMapBytesMin = std::size_t{16} << 20;
constexpr unsigned kTablesMax = 16;
// NOTLS: a snapshot belongs to its object, not to its thread. NORDAHEAD: look-ups go all over the file. NOMETASYNC:
// pages
// are on the disk before the head page that names them is written, but that head page waits for the next sync; what is
// on the disk is whole at any moment.
constexpr unsigned kEnvironmentFlags = MDB_NOSUBDIR | MDB_NOTLS | MDB_NORDAHEAD | MDB_NOMETASYNC;

// Written to disk: never change one.
constexpr std::uint32_t kFormatVersion = 2;
constexpr std::string_view kHeadKey = "head";
constexpr std::size_t kHeadBytes = 4 + 16 + 8 + 8 + 8 + 4 + 8 + 8 + 1 + 16 + 4;
constexpr std::size_t kHeadChecksumOffset = kHeadBytes - 4;

std::array<std::byte, kHeadBytes> encodeHead(const TablesHead& head) {
    std::array<std::byte, kHeadBytes> bytes{};
    storeInteger(bytes.data(), kFormatVersion);
    std::memcpy(bytes.data() + 4, head.uuid.bytes.data(), 16);
    storeInteger(bytes.data() + 20, head.marks.document);
    storeInteger(bytes.data() + 28, head.marks.event);
    storeInteger(bytes.data() + 36, head.appliedBatch);
    storeInteger(bytes.data() + 44, static_cast<std::uint32_t>(head.settledDocument));
    storeInteger(bytes.data() + 48, head.begunBatch);
    storeInteger(bytes.data() + 56, head.forgottenEvent);
    storeInteger(bytes.data() + 64, static_cast<std::uint8_t>(head.hasHistory ? 1 : 0));
    std::memcpy(bytes.data() + 65, head.nameHashKey.data(), 16);
    storeInteger(bytes.data() + kHeadChecksumOffset, crc32c(ByteView(bytes).first(kHeadChecksumOffset)));
    return bytes;
}

Result<TablesHead> decodeHead(ByteView bytes) {
    if (bytes.size() < 4) return damage("the head is too short");
    const auto version = loadInteger<std::uint32_t>(bytes.data());
    if (version != kFormatVersion) return damage(fmt::format("format {} is not known here", version));
    if (bytes.size() != kHeadBytes ||
        loadInteger<std::uint32_t>(bytes.data() + kHeadChecksumOffset) != crc32c(bytes.first(kHeadChecksumOffset))) {
        return damage("the head's checksum is wrong");
    }
    TablesHead head;
    std::memcpy(head.uuid.bytes.data(), bytes.data() + 4, 16);
    head.marks = {loadInteger<std::uint64_t>(bytes.data() + 20), loadInteger<std::uint64_t>(bytes.data() + 28)};
    head.appliedBatch = loadInteger<std::uint64_t>(bytes.data() + 36);
    head.settledDocument = DocumentID{loadInteger<std::uint32_t>(bytes.data() + 44)};
    head.begunBatch = loadInteger<std::uint64_t>(bytes.data() + 48);
    head.forgottenEvent = loadInteger<std::uint64_t>(bytes.data() + 56);
    head.hasHistory = bytes[64] != std::byte{};
    std::memcpy(head.nameHashKey.data(), bytes.data() + 65, 16);
    return head;
}

/// The library's own lock file, anew: only the holder of the store's lock comes here, and readers that a crash left in it
/// are nobody. With all its blocks: the library writes to it through a map, where a full disk would be a bus error.
Result<void> makeLockFile(const std::string& path) {
    constexpr off_t kLockBytes = 32'768;  // Of as many readers as there is room for; the library makes do with it.
    ::unlink(path.c_str());
    const UniqueFd file = TRY(sys::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW, 0600));
    const int code = ::posix_fallocate(file.get(), 0, kLockBytes);
    return code == 0 ? Result<void>() : Result<void>(KsError::posix(code, path));
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
        TRY(tables.openHead(true));
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
    TRY(tables->openHead(false));
    // First the head: tables of another format need not have what is asked for next.
    TRY(tables->loadHead());
    TRY(tables->openTables(false));
    return tables;
}

Result<void> ObjectTables::openEnvironment(const std::string& path, std::size_t mapBytes) {
    TRY(makeLockFile(path + "-lock"));
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

Result<void> ObjectTables::openTables(bool create, std::span<const TableToOpen> tables) {
    MDB_txn* transaction = nullptr;
    if (const int code = mdb_txn_begin(environment_, nullptr, create ? 0 : MDB_RDONLY, &transaction); code != 0) {
        return errorOf(code);
    }
    for (const auto& [name, flags, table] : tables) {
        const int code = mdb_dbi_open(transaction, name, flags | (create && name != nullptr ? MDB_CREATE : 0), table);
        if (code != 0) {
            mdb_txn_abort(transaction);
            return errorOf(code);
        }
    }
    // Also a read transaction is committed: only then do its table handles outlive it.
    if (const int code = mdb_txn_commit(transaction); code != 0) return errorOf(code);
    return {};
}

Result<void> ObjectTables::openHead(bool create) {
    return openTables(create, std::array<TableToOpen, 2>{{{nullptr, 0, &tableOfTables_}, {"meta", 0, &meta_}}});
}

Result<void> ObjectTables::openTables(bool create) {
    constexpr unsigned kNumber = MDB_INTEGERKEY;
    return openTables(create, std::array<TableToOpen, 8>{{
                                  {"objects", kNumber, &objects_},
                                  {"documents", kNumber, &documents_},
                                  {"children", kNumber | MDB_DUPSORT | MDB_DUPFIXED, &children_},
                                  {"names", 0, &names_},
                                  {"attributes", kNumber, &attributes_},
                                  {"events", kNumber, &events_},
                                  {"documentEvents", kNumber, &documentChanges_},
                                  {"timeMarks", kNumber, &timeMarks_},
                              }});
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

int ObjectTables::putHead(MDB_txn* transaction, MDB_dbi table, const TablesHead& head) {
    const auto bytes = encodeHead(head);
    MDB_val key{kHeadKey.size(), const_cast<char*>(kHeadKey.data())};  // NOLINT: not written.
    MDB_val value = valueOf(bytes);
    return mdb_put(transaction, table, &key, &value, 0);
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

Result<void> ObjectTables::Snapshot::allObjects(std::uint64_t from,
                                                const std::function<bool(FileID, const PackedRecord&)>& receive) const {
    TRY(Result<void>(status_));
    const Cursor cursor(transaction_, tables_.objects_);
    IntegerKey<std::uint64_t> first(from);
    MDB_val key = *first.value(), value{};
    int code = cursor.get(&key, &value, MDB_SET_RANGE);
    for (; code == 0; code = cursor.get(&key, &value, MDB_NEXT)) {
        std::uint64_t fileID = 0;
        std::memcpy(&fileID, key.mv_data, sizeof fileID);
        const auto record = PackedRecord::decode(viewOf(value));
        if (!record) return damage("an object has no record");
        if (!receive(FileID{fileID}, *record)) return {};
    }
    if (code != MDB_NOTFOUND) return errorOf(code);
    return {};
}

// MARK: Reading children, names and events

std::uint64_t ObjectTables::Snapshot::childCount(FileID parent) const {
    if (transaction_ == nullptr) return 0;
    const Cursor cursor(transaction_, tables_.children_);
    IntegerKey<std::uint64_t> key(static_cast<std::uint64_t>(parent));
    MDB_val value{};
    std::size_t count = 0;
    if (cursor.get(key.value(), &value, MDB_SET) != 0 || mdb_cursor_count(cursor.get(), &count) != 0) return 0;
    return count;
}

Result<std::vector<FileID>> ObjectTables::Snapshot::childrenWithHash(FileID parent, std::uint32_t hash) const {
    TRY(Result<void>(status_));
    const Cursor cursor(transaction_, tables_.children_);
    IntegerKey<std::uint64_t> key(static_cast<std::uint64_t>(parent));
    const auto first = encodeChild(hash, FileID{});
    MDB_val value = valueOf(first);
    std::vector<FileID> found;
    int code = cursor.get(key.value(), &value, MDB_GET_BOTH_RANGE);
    for (; code == 0; code = cursor.get(key.value(), &value, MDB_NEXT_DUP)) {
        if (value.mv_size != kChildBytes || hashOfChild(viewOf(value)) != hash) break;
        found.push_back(fileIDOfChild(viewOf(value)));
    }
    if (code != 0 && code != MDB_NOTFOUND) return errorOf(code);
    return found;
}

Result<void> ObjectTables::Snapshot::children(FileID parent,
                                              const std::function<void(std::span<const FileID>)>& receive) const {
    TRY(Result<void>(status_));
    const Cursor cursor(transaction_, tables_.children_);
    IntegerKey<std::uint64_t> key(static_cast<std::uint64_t>(parent));
    MDB_val value{};
    std::vector<FileID> some;
    int code = cursor.get(key.value(), &value, MDB_SET);
    if (code == 0) code = cursor.get(key.value(), &value, MDB_GET_MULTIPLE);
    for (; code == 0; code = cursor.get(key.value(), &value, MDB_NEXT_MULTIPLE)) {
        some.clear();
        for (ByteView rest = viewOf(value); rest.size() >= kChildBytes; rest = rest.subspan(kChildBytes)) {
            some.push_back(fileIDOfChild(rest));
        }
        receive(some);
    }
    if (code != MDB_NOTFOUND) return errorOf(code);
    return {};
}

bool ObjectTables::Snapshot::hasNames() const {
    MDB_stat stat{};
    return transaction_ != nullptr && mdb_stat(transaction_, tables_.names_, &stat) == 0 && stat.ms_entries > 0;
}

Result<std::vector<std::pair<NameKey, std::string>>> ObjectTables::Snapshot::names(FileID fileID) const {
    TRY(Result<void>(status_));
    const Cursor cursor(transaction_, tables_.names_);
    const auto first = encodeNameKey({.fileID = fileID});
    MDB_val key = valueOf(first), value{};
    std::vector<std::pair<NameKey, std::string>> found;
    int code = cursor.get(&key, &value, MDB_SET_RANGE);
    for (; code == 0; code = cursor.get(&key, &value, MDB_NEXT)) {
        const auto name = decodeNameKey(viewOf(key));
        if (!name || name->fileID != fileID) break;
        found.emplace_back(*name, textOf(viewOf(value)));
    }
    if (code != 0 && code != MDB_NOTFOUND) return errorOf(code);
    return found;
}

Result<std::vector<NameKey>> ObjectTables::Snapshot::namesWithHash(FileID parent, std::uint32_t hash) const {
    TRY(Result<void>(status_));
    const Cursor cursor(transaction_, tables_.names_);
    const auto first = encodeNamePlace({.parent = parent, .hash = hash});
    MDB_val key = valueOf(first), value{};
    std::vector<NameKey> found;
    int code = cursor.get(&key, &value, MDB_SET_RANGE);
    for (; code == 0; code = cursor.get(&key, &value, MDB_NEXT)) {
        const auto place = decodeNamePlace(viewOf(key));
        if (!place || place->parent != parent || place->hash != hash) break;
        found.push_back(*place);
    }
    if (code != 0 && code != MDB_NOTFOUND) return errorOf(code);
    return found;
}

std::optional<std::string_view> ObjectTables::Snapshot::name(const NameKey& nameKey) const {
    const auto bytes = encodeNameKey(nameKey);
    MDB_val key = valueOf(bytes), value{};
    if (transaction_ == nullptr || mdb_get(transaction_, tables_.names_, &key, &value) != 0) return std::nullopt;
    return textOf(viewOf(value));
}

std::optional<ByteView> ObjectTables::Snapshot::attributes(DocumentID documentID) const {
    IntegerKey<std::uint32_t> key(static_cast<std::uint32_t>(documentID));
    MDB_val value{};
    if (transaction_ == nullptr || mdb_get(transaction_, tables_.attributes_, key.value(), &value) != 0)
        return std::nullopt;
    return viewOf(value);
}

Result<void> ObjectTables::Snapshot::readEvents(MDB_dbi table, std::uint64_t after,
                                                const EventReceiver& receive) const {
    TRY(Result<void>(status_));
    if (after == ~std::uint64_t{0}) return {};
    const Cursor cursor(transaction_, table);
    IntegerKey<std::uint64_t> from(after + 1);
    MDB_val key = *from.value(), value{};
    int code = cursor.get(&key, &value, MDB_SET_RANGE);
    for (; code == 0; code = cursor.get(&key, &value, MDB_NEXT)) {
        std::uint64_t id = 0;
        std::memcpy(&id, key.mv_data, sizeof id);
        if (!receive(id, viewOf(value))) return {};
    }
    if (code != MDB_NOTFOUND) return errorOf(code);
    return {};
}

Result<void> ObjectTables::Snapshot::events(std::uint64_t after, const EventReceiver& receive) const {
    return readEvents(tables_.events_, after, receive);
}

Result<void> ObjectTables::Snapshot::documentChanges(std::uint64_t after, const EventReceiver& receive) const {
    return readEvents(tables_.documentChanges_, after, receive);
}

Result<std::vector<std::pair<std::uint64_t, std::int64_t>>> ObjectTables::Snapshot::timeMarks() const {
    std::vector<std::pair<std::uint64_t, std::int64_t>> marks;
    TRY(readEvents(tables_.timeMarks_, 0, [&](std::uint64_t id, ByteView value) {
        if (value.size() == sizeof(std::int64_t)) marks.emplace_back(id, loadInteger<std::int64_t>(value.data()));
        return true;
    }));
    return marks;
}

// MARK: Counting

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

std::uint64_t ObjectTables::eventCount() const {
    return entriesOf(events_) + entriesOf(documentChanges_);
}

}  // namespace cindral
