#include "host/search/SearchStore.h"

#include <fmt/format.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <limits>
#include <unordered_set>
#include <utility>

#include "host/search/NameFolding.h"
#include "host/search/SearchFunctions.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/SetAside.h"
#include "platform/foundation/Sys.h"
#include "platform/tessel/TesselErrors.h"

namespace cindral {
namespace {

// Written into the file: another number for another form.
constexpr std::int64_t kApplicationID = 0x43645378;
constexpr std::int64_t kVersion = 2;

// Milliseconds from 1900 to 1970, so that dates before 1970 have places too.
constexpr std::int64_t kPlaceOfEpoch = 2'208'988'800'000;
constexpr std::int64_t kPlaceMin = std::int64_t{1} << 20;
// Six bytes hold it, which is the year 6300.
constexpr std::int64_t kPlaceMax = (std::int64_t{1} << 47) - 1;

constexpr std::size_t kViewsMax = 8;
// Matches that are read all together, and put in order then.
constexpr std::uint64_t kFoundAtOnceMax = 4'000;
constexpr std::uint64_t kChangesOfSampleMax = 10'000;
constexpr std::size_t kItemsAtOnceMin = 10'000;
// Some 30 MB of memory.
constexpr std::size_t kItemsAtOnceMax = 100'000;
// Small files are looked at in whole when they are opened; of others, damage shows where it is come upon.
constexpr std::int64_t kCheckedPagesMax = 1'024;

// What a gather writes to lies all over the file.
constexpr const char* kManyPages = "PRAGMA cache_size = -98304";
constexpr const char* kFewPages = "PRAGMA cache_size = -16384; PRAGMA shrink_memory";

constexpr const char* kSchema = R"(
    CREATE TABLE facts(name TEXT PRIMARY KEY, value) WITHOUT ROWID;
    CREATE TABLE words(id INTEGER PRIMARY KEY, word TEXT NOT NULL UNIQUE);
    CREATE TABLE items(
        place INTEGER PRIMARY KEY, identifier TEXT NOT NULL, parent TEXT NOT NULL, name BLOB NOT NULL, type INTEGER NOT NULL,
        flags INTEGER NOT NULL, gather INTEGER NOT NULL, domain INTEGER, size INTEGER, modified INTEGER, used INTEGER,
        rank INTEGER);
    CREATE UNIQUE INDEX items_identifier ON items(identifier);
    CREATE INDEX items_parent ON items(parent, name_key(name), modified, size, type, flags);
    CREATE INDEX items_trashed ON items(place) WHERE flags & 2;
    CREATE INDEX items_temporary ON items(identifier) WHERE flags & 8;
    CREATE INDEX items_rank ON items(rank, place) WHERE rank IS NOT NULL;
    CREATE TABLE tags(tag TEXT NOT NULL, place INTEGER NOT NULL, PRIMARY KEY(tag, place)) WITHOUT ROWID;
    CREATE INDEX tags_place ON tags(place);
    CREATE TABLE unlisted(container TEXT PRIMARY KEY) WITHOUT ROWID;
    CREATE TABLE forgotten(domain TEXT PRIMARY KEY) WITHOUT ROWID;
    CREATE VIRTUAL TABLE names USING fts5(name, content='', columnsize=0, detail=none, tokenize='cindral_grams');
)";

std::string versionOf(const NameCollation& collation) {
    return name_folding::version() + " " + collation.version();
}

std::int64_t placeWanted(const IndexedItem& item) {
    const auto recency = item.recency();
    if (!recency) return kPlaceMin;
    // Rounded down also before 1970.
    const std::int64_t milliseconds = *recency / 1'000'000 - (*recency % 1'000'000 < 0 ? 1 : 0);
    return std::clamp(milliseconds + kPlaceOfEpoch, kPlaceMin, kPlaceMax);
}

/// What is asked of the table of names: all of the grams.
std::string matchOf(const std::vector<std::string>& grams) {
    std::string wanted;
    for (const std::string& gram : grams) {
        if (!wanted.empty()) wanted += " AND ";
        wanted += '"';
        for (const char c : gram) {
            wanted += c;
            if (c == '"') wanted += '"';
        }
        wanted += '"';
    }
    return wanted;
}

Result<void> configure(SqliteDatabase& database) {
    // A transaction that is lost with the power takes its anchor with it, so that nothing is missed.
    TRY(
        database.run("PRAGMA journal_mode = WAL; PRAGMA synchronous = NORMAL; PRAGMA cache_size = -16384;"
                     "PRAGMA wal_autocheckpoint = 4000; PRAGMA temp_store = MEMORY;"));
    return {};
}

KsError refusal(std::string why) {
    return KsError::posix(EBADMSG).with("message", std::move(why));
}

/// Fails as a damaged database does where the file is none that can be gone on with. `isOutdated`: nothing is wrong with
/// it, it is of before.
Result<void> checkIsOurs(SqliteDatabase& database, const NameCollation& collation, bool& isOutdated) {
    const std::int64_t application = TRY(database.integer("PRAGMA application_id")).value_or(0);
    const std::int64_t version = TRY(database.integer("PRAGMA user_version")).value_or(0);
    const std::int64_t tables = TRY(database.integer("SELECT count(*) FROM sqlite_schema")).value_or(0);
    if (application == 0 && version == 0 && tables == 0) return {};
    if (application != kApplicationID) return refusal("it is no search index");
    isOutdated = version != kVersion;
    if (isOutdated) return refusal(fmt::format("it is of version {}", version));
    SqliteStatement order = TRY(database.prepare("SELECT value FROM facts WHERE name = 'names'"));
    if (!TRY(order.step())) return refusal("it is not whole");
    isOutdated = order.text(0) != versionOf(collation);
    if (isOutdated) return refusal("names are folded or ordered otherwise now");
    order.reset();
    if (TRY(database.integer("PRAGMA page_count")).value_or(0) <= kCheckedPagesMax) {
        SqliteStatement check = TRY(database.prepare("PRAGMA quick_check(1)"));
        if (!TRY(check.step()) || check.text(0) != "ok") return refusal("it is damaged");
    }
    return {};
}

Result<void> createTables(SqliteDatabase& database, const NameCollation& collation) {
    SqliteTransaction transaction = TRY(SqliteTransaction::begin(database));
    TRY(database.run(kSchema));
    TRY(database.run(fmt::format("PRAGMA application_id = {}; PRAGMA user_version = {};", kApplicationID, kVersion)));
    std::int64_t index = 0;
    while (index == 0) {
        if (::getrandom(&index, sizeof index, 0) != sizeof index) return KsError::errorWithPOSIXCode();
    }
    SqliteStatement put = TRY(database.prepare("INSERT INTO facts VALUES(?, ?)"));
    TRY(put.run(std::string_view("index"), index));
    TRY(put.run(std::string_view("names"), std::string_view(versionOf(collation))));
    TRY(put.run(std::string_view("gather"), std::int64_t{0}));
    return transaction.commit();
}

/// A connection that writes, with a file that can be gone on with. `isReplacement`: another had to go for it.
Result<SqliteDatabase> openOurs(const std::string& path, const NameCollation& collation, bool& isReplacement) {
    bool isOutdated = false;
    const auto attempt = [&]() -> Result<SqliteDatabase> {
        struct stat there {};
        if (::lstat(path.c_str(), &there) == 0 && !S_ISREG(there.st_mode)) return refusal("it is no file");
        SqliteDatabase database = TRY(SqliteDatabase::open(path, SqliteDatabase::Mode::readWrite));
        TRY(search_functions::install(database, collation));
        TRY(checkIsOurs(database, collation, isOutdated));
        TRY(configure(database));
        if (TRY(database.integer("PRAGMA user_version")).value_or(0) == 0) TRY(createTables(database, collation));
        return database;
    };
    Result<SqliteDatabase> opened = attempt();
    if (opened.ok() || !isDamagedDatabase(opened.error())) return opened;
    const auto found = opened.error().userInfo().find("message");
    const std::string why = found != opened.error().userInfo().end() ? found->second : "it is damaged";
    if (isOutdated) {
        logInfo("making the search index anew; {}", why);
    } else {
        logError("making the search index anew; {}", why);
    }
    TRY(SearchStore::remove(path));
    isReplacement = true;
    return attempt();
}

}  // namespace

// MARK: Writing

/// The statements of the connection that writes, and what they are put together to.
struct SearchStore::Writer {
    explicit Writer(SqliteDatabase opened) : database(std::move(opened)) {}

    Result<void> prepare();
    Result<void> put(const IndexedItem& item);
    Result<void> remove(const TesselItemIdentifier& identifier);
    Result<void> setAnchor(ByteView anchor) { return setFact.run(std::string_view("anchor"), anchor); }

    struct Row {
        std::int64_t place = 0;
        std::int64_t gather = 0;
        IndexedItem item;
    };
    Result<std::optional<Row>> row(std::string_view identifier);
    Result<void> insert(const IndexedItem& item, std::int64_t place);
    Result<void> erase(const Row& row);
    Result<std::int64_t> freePlace(const IndexedItem& item);
    Result<std::int64_t> wordID(const std::string& word);
    Result<std::string> word(std::int64_t id);
    Result<std::vector<TesselItemIdentifier>> below(const TesselItemIdentifier& identifier);
    Result<void> passOn(const IndexedItem& folder);
    Result<void> writeNames();
    void noteTemporary(const IndexedItem& item);
    Result<void> readTemporary();
    void see(const IndexedItem& item) const {
        if (witness) witness(item);
    }

    SqliteDatabase database;
    Witness witness;
    std::int64_t count = 0;   ///< of items
    std::int64_t gather = 0;  ///< number of the gather that is under way, or was the last
    bool isGathering = false;
    GatherCounts gatherCounts;
    std::unordered_map<std::string, std::int64_t> wordIDs;
    std::unordered_map<std::int64_t, std::string> words;
    /// Folders in the table that are temporary.
    std::unordered_set<std::string> temporary;
    /// What is still to be said to the table of names in the transaction.
    struct NameChange {
        std::int64_t place;
        bool isIn;
        std::string folded;
    };
    std::vector<NameChange> nameChanges;

    SqliteStatement setFact, selectFact, selectItem, selectTags, isTaken, insertItem, updateItem, deleteItem,
        insertName, deleteName, insertTag, deleteTags, selectWord, selectWordID, insertWord, selectBelow,
        insertUnlisted, deleteUnlisted, selectUnlisted, selectStale, selectDomain;
};

Result<void> SearchStore::Writer::prepare() {
    const auto make = [&](SqliteStatement& statement, const char* sql) -> Result<void> {
        statement = TRY(database.prepare(sql));
        return {};
    };
    TRY(make(setFact, "INSERT INTO facts VALUES(?1, ?2) ON CONFLICT(name) DO UPDATE SET value = excluded.value"));
    TRY(make(selectFact, "SELECT value FROM facts WHERE name = ?"));
    TRY(make(selectItem,
             "SELECT place, gather, parent, name, type, flags, domain, size, modified, used, rank FROM items "
             "WHERE identifier = ?"));
    TRY(make(selectTags, "SELECT tag FROM tags WHERE place = ? ORDER BY tag"));
    TRY(make(isTaken, "SELECT 1 FROM items WHERE place = ?"));
    TRY(make(insertItem,
             "INSERT INTO items(place, identifier, parent, name, type, flags, gather, domain, size, modified, used, "
             "rank) VALUES(?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?)"));
    TRY(make(updateItem,
             "UPDATE items SET parent = ?2, type = ?3, flags = ?4, gather = ?5, domain = ?6, size = ?7, modified = ?8, "
             "used = ?9, rank = ?10 WHERE place = ?1"));
    TRY(make(deleteItem, "DELETE FROM items WHERE place = ?"));
    TRY(make(insertName, "INSERT INTO names(rowid, name) VALUES(?, ?)"));
    TRY(make(deleteName, "INSERT INTO names(names, rowid, name) VALUES('delete', ?, ?)"));
    TRY(make(insertTag, "INSERT INTO tags VALUES(?, ?)"));
    TRY(make(deleteTags, "DELETE FROM tags WHERE place = ?"));
    TRY(make(selectWord, "SELECT word FROM words WHERE id = ?"));
    TRY(make(selectWordID, "SELECT id FROM words WHERE word = ?"));
    TRY(make(insertWord, "INSERT INTO words(word) VALUES(?) RETURNING id"));
    TRY(make(
        selectBelow,
        "WITH RECURSIVE below(identifier) AS (VALUES(?1) UNION SELECT items.identifier FROM below CROSS JOIN items "
        "INDEXED BY items_parent ON items.parent = below.identifier) SELECT identifier FROM below"));
    TRY(make(insertUnlisted, "INSERT OR IGNORE INTO unlisted VALUES(?)"));
    TRY(make(deleteUnlisted, "DELETE FROM unlisted WHERE container = ?"));
    TRY(make(selectUnlisted, "SELECT container FROM unlisted LIMIT ?"));
    TRY(make(selectStale, "SELECT identifier FROM items WHERE gather != ?"));
    TRY(make(selectDomain, "SELECT identifier FROM items WHERE domain = ?"));

    count = TRY(database.integer("SELECT value FROM facts WHERE name = 'items'")).value_or(0);
    gather = TRY(database.integer("SELECT value FROM facts WHERE name = 'gather'")).value_or(0);
    isGathering = TRY(database.integer("SELECT value FROM facts WHERE name = 'isGathering'")).value_or(0) != 0;
    TRY(readTemporary());
    return isGathering ? database.run(kManyPages) : Result<void>();
}

Result<void> SearchStore::Writer::readTemporary() {
    temporary.clear();
    SqliteStatement select =
        TRY(database.prepare("SELECT identifier FROM items INDEXED BY items_temporary WHERE flags & 8 AND flags & 4"));
    while (TRY(select.step())) temporary.emplace(select.text(0));
    return {};
}

Result<std::int64_t> SearchStore::Writer::wordID(const std::string& word) {
    if (const auto known = wordIDs.find(word); known != wordIDs.end()) return known->second;
    std::optional<std::int64_t> id;
    if (TRY(selectWordID.bind(std::string_view(word)).step())) id = selectWordID.integer(0);
    selectWordID.reset();
    if (!id) {
        if (!TRY(insertWord.bind(std::string_view(word)).step())) return KsError::posix(EBADMSG);
        id = insertWord.integer(0);
        TRY(insertWord.run());
    }
    wordIDs.emplace(word, *id);
    words.emplace(*id, word);
    return *id;
}

Result<std::string> SearchStore::Writer::word(std::int64_t id) {
    if (const auto known = words.find(id); known != words.end()) return known->second;
    if (!TRY(selectWord.bind(id).step())) return KsError::posix(EBADMSG).with("message", "a word is missing");
    std::string word(selectWord.text(0));
    selectWord.reset();
    words.emplace(id, word);
    return word;
}

Result<std::optional<SearchStore::Writer::Row>> SearchStore::Writer::row(std::string_view identifier) {
    if (!TRY(selectItem.bind(identifier).step())) {
        selectItem.reset();
        return std::optional<Row>();
    }
    Row row;
    row.place = selectItem.integer(0);
    row.gather = selectItem.integer(1);
    row.item.identifier = identifier;
    row.item.parent = selectItem.text(2);
    row.item.name = selectItem.text(3);
    const std::int64_t type = selectItem.integer(4);
    row.item.flags = selectItem.integer(5);
    const std::optional<std::int64_t> domain = selectItem.optionalInteger(6);
    row.item.size = selectItem.optionalInteger(7);
    row.item.modified = selectItem.optionalInteger(8);
    row.item.used = selectItem.optionalInteger(9);
    row.item.rank = selectItem.optionalInteger(10);
    selectItem.reset();
    row.item.type = TRY(word(type));
    if (domain) row.item.domain = TRY(word(*domain));
    selectTags.bind(row.place);
    while (TRY(selectTags.step())) row.item.tags.emplace_back(selectTags.text(0));
    selectTags.reset();
    return std::optional<Row>(std::move(row));
}

/// Places are in the order of dates. Where one is taken, the next ones below are tried further and further away, so that
/// many items of one date find theirs quickly.
Result<std::int64_t> SearchStore::Writer::freePlace(const IndexedItem& item) {
    const std::int64_t wanted = placeWanted(item);
    std::uint64_t state = std::hash<std::string>{}(item.identifier) | 1;
    for (int attempt = 0;; ++attempt) {
        const std::uint64_t reach = (std::uint64_t{1} << std::min(attempt, 19)) - 1;
        // Whatever is below the lowest place goes above instead: it has no date worth an order.
        state = state * 6'364'136'223'846'793'005 + 1'442'695'040'888'963'407;
        const auto step = static_cast<std::int64_t>((state >> 20) & (attempt < 200 ? reach : (1ULL << 40) - 1));
        const std::int64_t place = wanted - step >= 1 ? wanted - step : wanted + step;
        const bool taken = TRY(isTaken.bind(place).step());
        isTaken.reset();
        if (!taken) return place;
    }
}

Result<void> SearchStore::Writer::insert(const IndexedItem& item, std::int64_t place) {
    const std::int64_t type = TRY(wordID(item.type));
    std::optional<std::int64_t> domain;
    if (!item.domain.empty()) domain = TRY(wordID(item.domain));
    ++count;
    noteTemporary(item);
    TRY(insertItem.run(place, std::string_view(item.identifier), std::string_view(item.parent), bytesOf(item.name),
                       type, item.flags, gather, domain, item.size, item.modified, item.used, item.rank));
    if (item.isOrdinary()) nameChanges.push_back({place, true, name_folding::fold(item.name)});
    for (const std::string& tag : item.tags) TRY(insertTag.run(std::string_view(tag), place));
    return {};
}

Result<void> SearchStore::Writer::erase(const Row& row) {
    --count;
    temporary.erase(row.item.identifier);
    TRY(deleteItem.run(row.place));
    if (row.item.isOrdinary()) nameChanges.push_back({row.place, false, name_folding::fold(row.item.name)});
    if (!row.item.tags.empty()) TRY(deleteTags.run(row.place));
    return {};
}

/// In the order of places: the table of names writes what it holds to the disk whenever a place comes before the last.
Result<void> SearchStore::Writer::writeNames() {
    std::ranges::stable_sort(nameChanges, {}, &NameChange::place);
    for (const NameChange& change : nameChanges)
        TRY((change.isIn ? insertName : deleteName).run(change.place, std::string_view(change.folded)));
    nameChanges.clear();
    return {};
}

Result<void> SearchStore::Writer::put(const IndexedItem& listed) {
    IndexedItem item = listed;
    if (temporary.contains(item.parent)) item.flags |= IndexedItem::kTemporary;
    const std::optional<Row> before = TRY(row(item.identifier));
    // What is in a folder that comes along while others are listed may have been missed on both sides.
    if (isGathering && item.isFolder() && (!before || before->gather != gather))
        TRY(insertUnlisted.run(std::string_view(item.identifier)));
    see(item);
    if (!before) {
        ++gatherCounts.put;
        TRY(insert(item, TRY(freePlace(item))));
        // What is in it may have come along before it.
        return item.isTemporary() && item.isFolder() ? passOn(item) : Result<void>();
    }
    see(before->item);
    if (!(before->item == item)) ++gatherCounts.changed;

    const bool isSamePlace = before->item.recency() == item.recency();
    const bool isSameName = before->item.name == item.name && before->item.isOrdinary() == item.isOrdinary();
    if (isSamePlace && isSameName && before->item.tags == item.tags) {
        const std::int64_t type = TRY(wordID(item.type));
        std::optional<std::int64_t> domain;
        if (!item.domain.empty()) domain = TRY(wordID(item.domain));
        noteTemporary(item);
        TRY(updateItem.run(before->place, std::string_view(item.parent), type, item.flags, gather, domain, item.size,
                           item.modified, item.used, item.rank));
    } else {
        TRY(erase(*before));
        TRY(insert(item, isSamePlace ? before->place : TRY(freePlace(item))));
    }
    const bool isPassedOn = (before->item.flags & IndexedItem::kPassedOn) != (item.flags & IndexedItem::kPassedOn) ||
                            before->item.domain != item.domain;
    return isPassedOn ? passOn(item) : Result<void>();
}

void SearchStore::Writer::noteTemporary(const IndexedItem& item) {
    if (item.isTemporary() && item.isFolder()) {
        temporary.insert(item.identifier);
    } else {
        temporary.erase(item.identifier);
    }
}

/// What is below a folder is in the trash with it, and belongs to whom it belongs, without being told of.
Result<void> SearchStore::Writer::passOn(const IndexedItem& folder) {
    for (const TesselItemIdentifier& identifier : TRY(below(folder.identifier))) {
        if (identifier == folder.identifier) continue;
        const std::optional<Row> there = TRY(row(identifier));
        if (!there) continue;
        IndexedItem item = there->item;
        item.flags = (item.flags & ~IndexedItem::kPassedOn) | (folder.flags & IndexedItem::kPassedOn);
        item.domain = folder.domain;
        see(there->item);
        see(item);
        TRY(erase(*there));
        TRY(insert(item, there->place));
    }
    return {};
}

Result<std::vector<TesselItemIdentifier>> SearchStore::Writer::below(const TesselItemIdentifier& identifier) {
    std::vector<TesselItemIdentifier> all;
    selectBelow.bind(std::string_view(identifier));
    while (TRY(selectBelow.step())) all.emplace_back(selectBelow.text(0));
    selectBelow.reset();
    return all;
}

Result<void> SearchStore::Writer::remove(const TesselItemIdentifier& identifier) {
    for (const TesselItemIdentifier& each : TRY(below(identifier))) {
        const std::optional<Row> there = TRY(row(each));
        if (!there) continue;
        see(there->item);
        TRY(erase(*there));
    }
    return {};
}

// MARK: Reading

struct SearchStore::Reader {
    explicit Reader(SqliteDatabase opened) : database(std::move(opened)) {}

    Result<void> prepare() {
        const auto make = [&](SqliteStatement& statement, const char* sql) -> Result<void> {
            statement = TRY(database.prepare(sql));
            return {};
        };
        TRY(make(names,
                 "SELECT items.place, items.identifier, items.name FROM names CROSS JOIN items ON items.place = "
                 "names.rowid WHERE names MATCH ?1 AND names.rowid < ?2 ORDER BY names.rowid DESC"));
        TRY(make(
            allNames,
            "SELECT place, identifier, name FROM items WHERE ?1 = '' AND place < ?2 AND NOT flags & 10 ORDER BY place "
            "DESC"));
        TRY(make(someNames, "SELECT name FROM items WHERE place >= ? ORDER BY place LIMIT ?"));
        TRY(make(itemCount, "SELECT value FROM facts WHERE name = 'items'"));
        TRY(make(recents,
                 "SELECT place, identifier, 0 FROM items WHERE place < ?1 AND flags & 11 = 1 ORDER BY place DESC"));
        TRY(make(tagged,
                 "SELECT tags.place, items.identifier, 0 FROM tags CROSS JOIN items ON items.place = tags.place WHERE "
                 "tags.tag = ?2 AND tags.place < ?1 AND NOT items.flags & 10 ORDER BY tags.place DESC"));
        TRY(make(favorites,
                 "SELECT place, identifier, rank FROM items INDEXED BY items_rank WHERE rank IS NOT NULL AND NOT flags "
                 "& 10 AND (rank > ?2 OR (rank = ?2 AND place < ?1)) ORDER BY rank, place DESC"));
        TRY(make(trashed,
                 "SELECT place, identifier, 0 FROM items INDEXED BY items_trashed WHERE flags & 2 AND NOT flags & 8 "
                 "AND place < ?1 AND NOT "
                 "EXISTS (SELECT 1 FROM items AS holder WHERE holder.identifier = items.parent) ORDER BY place DESC"));
        // In the order of the index, which is that of names. To ask for the order would be to ask for the names, too,
        // and for every row of the table.
        TRY(make(children, "SELECT place FROM items INDEXED BY items_parent WHERE parent = ?1 AND NOT flags & 8"));
        TRY(make(values,
                 "SELECT place, CASE ?2 WHEN 1 THEN modified WHEN 2 THEN size WHEN 3 THEN type END, flags FROM items "
                 "INDEXED BY items_parent WHERE parent = ?1 AND NOT flags & 8"));
        TRY(make(identifier, "SELECT identifier FROM items WHERE place = ?"));
        TRY(make(
            tags,
            "SELECT tag, count(*) FROM tags CROSS JOIN items ON items.place = tags.place WHERE NOT items.flags & 10 "
            "GROUP BY tag"));
        return {};
    }

    SqliteDatabase database;
    SqliteStatement names, allNames, someNames, itemCount, recents, tagged, favorites, trashed, children, values,
        identifier, tags;
};

// MARK: The store

SearchStore::SearchStore(std::string path, const NameCollation& collation)
    : path_(std::move(path)), collation_(collation) {}

SearchStore::~SearchStore() = default;

Result<std::unique_ptr<SearchStore>> SearchStore::open(std::string path, const NameCollation& collation) {
    std::unique_ptr<SearchStore> store(new SearchStore(std::move(path), collation));
    Result<void> opened = store->openBoth();
    if (!opened.ok() && isDamagedDatabase(opened.error())) {
        logError("making the search index anew; {}", opened.error().description());
        store = std::unique_ptr<SearchStore>(new SearchStore(store->path_, collation));
        TRY(remove(store->path_));
        store->isReplacement_ = true;
        opened = store->openBoth();
    }
    if (!opened.ok()) return opened.error();
    return store;
}

Result<void> SearchStore::openBoth() {
    const MutexLock writing(writerMutex_);
    const MutexLock reading(readerMutex_);
    writer_ = std::make_unique<Writer>(TRY(openOurs(path_, collation_, isReplacement_)));
    TRY(writer_->prepare());
    isGathering_ = writer_->isGathering;
    const auto index = TRY(writer_->database.integer("SELECT value FROM facts WHERE name = 'index'"));
    if (!index) return KsError::posix(EBADMSG).with("message", "it has no number");
    index_ = static_cast<std::uint64_t>(*index);
    reader_ = std::make_unique<Reader>(TRY(SqliteDatabase::open(path_, SqliteDatabase::Mode::readOnly)));
    TRY(search_functions::install(reader_->database, collation_));
    TRY(reader_->database.run("PRAGMA cache_size = -16384; PRAGMA temp_store = MEMORY;"));
    return reader_->prepare();
}

Result<void> SearchStore::remove(const std::string& path) {
    for (const char* suffix : {"-wal", "-shm", "-journal", ""}) {
        // A folder may hold something that somebody wants to have.
        TRY(setAsideUnless(path + suffix, ExpectedKind::file));
        if (::unlink((path + suffix).c_str()) != 0 && errno != ENOENT)
            return KsError::errorWithPOSIXCode().with("path", path + suffix);
    }
    return {};
}

void SearchStore::setWitness(Witness witness) {
    const MutexLock lock(writerMutex_);
    writer_->witness = std::move(witness);
}

template <typename Work>
Result<void> SearchStore::write(const Work& work) {
    Writer& writer = *writer_;
    const std::int64_t count = writer.count;
    const std::int64_t gather = writer.gather;
    const bool isGathering = writer.isGathering;
    const auto done = [&]() -> Result<void> {
        SqliteTransaction transaction = TRY(SqliteTransaction::begin(writer.database));
        TRY(work(writer));
        TRY(writer.writeNames());
        if (writer.count != count) TRY(writer.setFact.run(std::string_view("items"), writer.count));
        return transaction.commit();
    }();
    if (!done.ok()) {
        // What was taken back is not remembered as done.
        writer.count = count;
        writer.gather = gather;
        writer.isGathering = isGathering;
        writer.wordIDs.clear();
        writer.words.clear();
        writer.nameChanges.clear();
        // Where that can't be read, nothing can be put in either.
        (void)writer.readTemporary();
    }
    isGathering_ = writer.isGathering;
    ++changes_;
    return done;
}

Result<SearchStore::Position> SearchStore::position() {
    const MutexLock lock(writerMutex_);
    Position position;
    position.isGathering = writer_->isGathering;
    SqliteStatement& fact = writer_->selectFact;
    if (TRY(fact.bind(std::string_view("anchor")).step())) {
        const ByteView bytes = fact.bytes(0);
        position.anchor.emplace(bytes.begin(), bytes.end());
    }
    fact.reset();
    return position;
}

Result<void> SearchStore::beginGather(const TesselSyncAnchor& anchor,
                                      std::span<const TesselItemIdentifier> firstContainers) {
    const MutexLock lock(writerMutex_);
    TRY(writer_->database.run(kManyPages));
    return write([&](Writer& writer) -> Result<void> {
        ++writer.gather;
        writer.isGathering = true;
        writer.gatherCounts = {};
        TRY(writer.setFact.run(std::string_view("gather"), writer.gather));
        TRY(writer.setFact.run(std::string_view("isGathering"), std::int64_t{1}));
        TRY(writer.setAnchor(anchor));
        TRY(writer.database.run("DELETE FROM unlisted; DELETE FROM forgotten;"));
        for (const auto& container : firstContainers) TRY(writer.insertUnlisted.run(std::string_view(container)));
        return {};
    });
}

Result<std::vector<TesselItemIdentifier>> SearchStore::unlisted(std::size_t max) {
    const MutexLock lock(writerMutex_);
    std::vector<TesselItemIdentifier> containers;
    writer_->selectUnlisted.bind(static_cast<std::int64_t>(max));
    while (TRY(writer_->selectUnlisted.step())) containers.emplace_back(writer_->selectUnlisted.text(0));
    writer_->selectUnlisted.reset();
    return containers;
}

std::size_t SearchStore::itemsAtOnce() {
    const MutexLock lock(writerMutex_);
    return std::clamp(static_cast<std::size_t>(writer_->count) / 8, kItemsAtOnceMin, kItemsAtOnceMax);
}

Result<void> SearchStore::putListed(std::span<const IndexedItem> items, std::span<const TesselItemIdentifier> listed,
                                    std::span<const TesselItemIdentifier> more) {
    const MutexLock lock(writerMutex_);
    return write([&](Writer& writer) -> Result<void> {
        for (const IndexedItem& item : items) TRY(writer.put(item));
        for (const auto& container : more) TRY(writer.insertUnlisted.run(std::string_view(container)));
        for (const auto& container : listed) TRY(writer.deleteUnlisted.run(std::string_view(container)));
        return {};
    });
}

Result<void> SearchStore::apply(const ChangesBatch& batch) {
    const MutexLock lock(writerMutex_);
    return write([&](Writer& writer) -> Result<void> {
        for (const auto& entry : batch.log) {
            if (entry.item) {
                TRY(writer.put(IndexedItem::of(*entry.item)));
            } else {
                TRY(writer.remove(entry.identifier));
            }
        }
        return writer.setAnchor(batch.anchor);
    });
}

Result<void> SearchStore::endGather() {
    const MutexLock lock(writerMutex_);
    TRY(write([&](Writer& writer) -> Result<void> {
        std::vector<TesselItemIdentifier> stale;
        writer.selectStale.bind(writer.gather);
        while (TRY(writer.selectStale.step())) stale.emplace_back(writer.selectStale.text(0));
        writer.selectStale.reset();
        for (const auto& identifier : stale) {
            // One by one: what is below was found elsewhere, or is stale itself.
            if (const auto there = TRY(writer.row(identifier))) TRY(writer.erase(*there));
        }
        writer.isGathering = false;
        writer.gatherCounts.removed = stale.size();
        return writer.setFact.run(std::string_view("isGathering"), std::int64_t{0});
    }));
    return writer_->database.run(kFewPages);
}

SearchStore::GatherCounts SearchStore::gatherCounts() {
    const MutexLock lock(writerMutex_);
    GatherCounts counts = writer_->gatherCounts;
    counts.gather = static_cast<std::uint64_t>(writer_->gather);
    return counts;
}

Result<void> SearchStore::setNote(const std::string& note) {
    const MutexLock lock(writerMutex_);
    return writer_->setFact.run(std::string_view("note"), std::string_view(note));
}

Result<std::string> SearchStore::note() {
    const MutexLock lock(writerMutex_);
    SqliteStatement& fact = writer_->selectFact;
    std::string note = TRY(fact.bind(std::string_view("note")).step()) ? std::string(fact.text(0)) : std::string();
    fact.reset();
    return note;
}

Result<void> SearchStore::forgetDomains(const std::vector<std::string>& domains) {
    const MutexLock lock(writerMutex_);
    return write([&](Writer& writer) -> Result<void> {
        SqliteStatement remember = TRY(writer.database.prepare("INSERT OR IGNORE INTO forgotten VALUES(?)"));
        for (const std::string& domain : domains) {
            TRY(remember.run(std::string_view(domain)));
            std::vector<TesselItemIdentifier> gone;
            writer.selectDomain.bind(TRY(writer.wordID(domain)));
            while (TRY(writer.selectDomain.step())) gone.emplace_back(writer.selectDomain.text(0));
            writer.selectDomain.reset();
            for (const auto& identifier : gone) {
                const auto there = TRY(writer.row(identifier));
                if (!there) continue;
                writer.see(there->item);
                TRY(writer.erase(*there));
            }
        }
        return {};
    });
}

Result<std::vector<std::string>> SearchStore::forgottenDomains() {
    const MutexLock lock(writerMutex_);
    SqliteStatement select = TRY(writer_->database.prepare("SELECT domain FROM forgotten"));
    std::vector<std::string> domains;
    while (TRY(select.step())) domains.emplace_back(select.text(0));
    return domains;
}

Result<void> SearchStore::confirmDomains() {
    const MutexLock lock(writerMutex_);
    return write([](Writer& writer) { return writer.database.run("DELETE FROM forgotten"); });
}

// MARK: Asking

Result<SearchStore::Hits> SearchStore::find(const SearchQuery& query, const std::optional<QueryPage>& after,
                                            std::size_t limit) {
    QueryPage from;
    from.index = index_;
    from.query = QueryPage::queryHash(query);
    from.place = std::numeric_limits<std::int64_t>::max();
    from.rank = std::numeric_limits<std::int64_t>::min();
    if (after) {
        if (after->index != from.index || after->query != from.query) return tesselErrorForExpiredPage();
        from = *after;
    }
    const MutexLock lock(readerMutex_);
    Hits hits;
    SqliteTransaction transaction = TRY(SqliteTransaction::begin(reader_->database));
    SqliteStatement* rows = nullptr;
    switch (query.kind) {
        case SearchQuery::Kind::names: TRY(findNames(name_folding::fold(query.text), from, limit, hits)); return hits;
        case SearchQuery::Kind::recents: rows = &reader_->recents.bind(from.place); break;
        case SearchQuery::Kind::tagged: rows = &reader_->tagged.bind(from.place, std::string_view(query.text)); break;
        case SearchQuery::Kind::favorites: rows = &reader_->favorites.bind(from.place, from.rank); break;
        case SearchQuery::Kind::trashed: rows = &reader_->trashed.bind(from.place); break;
        case SearchQuery::Kind::children:
        case SearchQuery::Kind::tags: return KsError::posix(EINVAL);
    }
    while (TRY(rows->step())) {
        hits.hasMore = hits.hits.size() == limit;
        if (hits.hasMore) break;
        QueryPage place = from;
        place.place = rows->integer(0);
        place.rank = rows->integer(2);
        hits.hits.push_back({TesselItemIdentifier(rows->text(1)), place});
    }
    rows->reset();
    return hits;
}

/// Many matches are read one kind after the other, each from the newest item to the oldest, until the page is full, so
/// that a text that nearly every name holds costs no more than a page. Few are read at once: each list is read to its
/// end then, but only one time.
Result<void> SearchStore::findNames(const std::string& text, const QueryPage& from, std::size_t limit, Hits& hits) {
    // No name holds a NUL, and what is asked of the table ends with one.
    if (text.empty() || text.find('\0') != std::string::npos) return {};
    TRY(refreshSample());
    const bool isFindable = !name_grams::required(text, NameMatch::substring).empty();
    if (isFindable && sample_.estimate(text) <= kFoundAtOnceMax && TRY(findAtOnce(text, from, limit, hits))) return {};
    return findOneByOne(text, from, limit, hits);
}

/// False where there turn out to be many.
Result<bool> SearchStore::findAtOnce(const std::string& text, const QueryPage& from, std::size_t limit, Hits& hits) {
    std::vector<Hit> all;
    SqliteStatement& rows = reader_->names;
    const std::string wanted = matchOf(sample_.bestGrams(text, NameMatch::substring));
    rows.bind(std::string_view(wanted), std::numeric_limits<std::int64_t>::max());
    while (TRY(rows.step())) {
        const auto match = nameMatchOf(name_folding::fold(rows.text(2)), text);
        if (!match) continue;
        QueryPage place = from;
        place.stage = static_cast<std::uint8_t>(*match);
        place.place = rows.integer(0);
        if (place.stage < from.stage || (place.stage == from.stage && place.place >= from.place)) continue;
        if (all.size() == kFoundAtOnceMax * 2) {
            rows.reset();
            return false;
        }
        all.push_back({TesselItemIdentifier(rows.text(1)), place});
    }
    rows.reset();
    const std::size_t count = std::min(all.size(), limit);
    std::ranges::partial_sort(all, all.begin() + static_cast<std::ptrdiff_t>(count), {},
                              [](const Hit& hit) { return std::pair(hit.place.stage, -hit.place.place); });
    hits.hasMore = all.size() > count;
    all.resize(count);
    hits.hits = std::move(all);
    return true;
}

Result<void> SearchStore::findOneByOne(const std::string& text, const QueryPage& from, std::size_t limit, Hits& hits) {
    constexpr auto kLast = static_cast<std::uint8_t>(NameMatch::substring);
    for (std::uint8_t stage = from.stage; stage <= kLast; ++stage) {
        const std::string wanted = matchOf(sample_.bestGrams(text, NameMatch{stage}));
        const std::int64_t below = stage == from.stage ? from.place : std::numeric_limits<std::int64_t>::max();
        // What is too short to be found by is looked for in every name.
        SqliteStatement& rows = wanted.empty() ? reader_->allNames : reader_->names;
        rows.bind(std::string_view(wanted), below);
        while (TRY(rows.step())) {
            if (nameMatchOf(name_folding::fold(rows.text(2)), text) != NameMatch{stage}) continue;
            if (hits.hits.size() == limit) {
                hits.hasMore = true;
                rows.reset();
                return {};
            }
            QueryPage place = from;
            place.stage = stage;
            place.place = rows.integer(0);
            hits.hits.push_back({TesselItemIdentifier(rows.text(1)), place});
        }
        rows.reset();
    }
    return {};
}

/// A sample is as good as another until the index is quite another.
Result<void> SearchStore::refreshSample() {
    const std::uint64_t change = changes_;
    SqliteStatement& count = reader_->itemCount;
    const std::uint64_t total = TRY(count.bind().step()) ? static_cast<std::uint64_t>(count.integer(0)) : 0;
    count.reset();
    const bool isAlike = total <= sample_.total() * 3 / 2 && sample_.total() <= total * 3 / 2;
    if (isAlike && change - sampledAt_ < kChangesOfSampleMax && sampledAt_ != 0) return {};
    std::vector<std::string> names;
    const auto take = [&names, &reader = *reader_](std::int64_t from, std::int64_t rows) -> Result<void> {
        SqliteStatement& some = reader.someNames.bind(from, rows);
        while (TRY(some.step())) names.push_back(name_folding::fold(some.text(0)));
        some.reset();
        return {};
    };
    if (total <= NameSample::kNamesMax) {
        TRY(take(std::numeric_limits<std::int64_t>::min(), NameSample::kNamesMax));
    } else {
        // From places all over the years; each a few, because to get to a place costs more than to go on from it.
        const std::int64_t first = TRY(reader_->database.integer("SELECT min(place) FROM items")).value_or(0);
        const std::int64_t last = TRY(reader_->database.integer("SELECT max(place) FROM items")).value_or(0);
        constexpr std::int64_t kStretches = 128;
        for (std::int64_t i = 0; i < kStretches; ++i)
            TRY(take(first + (last - first) / kStretches * i, NameSample::kNamesMax / kStretches));
    }
    sample_ = NameSample(std::move(names), total);
    sampledAt_ = std::max<std::uint64_t>(change, 1);
    return {};
}

/// In the order of a value; where it is the same, in that of names.
Result<void> SearchStore::appendByValue(const SortedQuery& query, std::vector<std::int64_t>& places) {
    constexpr std::int64_t kNone = std::numeric_limits<std::int64_t>::min();
    std::vector<std::pair<std::int64_t, std::int64_t>> entries;
    SqliteStatement& rows =
        reader_->values.bind(std::string_view(query.container), static_cast<std::int64_t>(query.order));
    const bool isByKind = query.order == SortedQuery::Order::kind;
    while (TRY(rows.step())) {
        // Folders are the first kind.
        const bool isFirst = isByKind && (rows.integer(2) & IndexedItem::kFolder) != 0;
        entries.emplace_back(isFirst ? kNone : rows.optionalInteger(1).value_or(kNone), rows.integer(0));
    }
    rows.reset();
    if (isByKind) {
        std::unordered_map<std::int64_t, std::int64_t> ranks{{kNone, -1}};
        SqliteStatement words = TRY(reader_->database.prepare("SELECT id FROM words ORDER BY word"));
        for (std::int64_t rank = 0; TRY(words.step()); ++rank) ranks.emplace(words.integer(0), rank);
        for (auto& [value, place] : entries) value = ranks[value];
    }
    std::ranges::stable_sort(entries, {}, &std::pair<std::int64_t, std::int64_t>::first);
    places.reserve(entries.size());
    for (const auto& [value, place] : entries) places.push_back(place);
    return {};
}

Result<const SearchStore::View*> SearchStore::view(const SortedQuery& query) {
    const std::uint64_t change = changes_;
    const auto known = std::ranges::find_if(views_, [&](const View& each) {
        return each.change == change && each.order == query.order && each.container == query.container;
    });
    if (known != views_.end()) {
        views_.splice(views_.begin(), views_, known);
        return &views_.front();
    }
    View view{query.container, query.order, change, {}};
    if (query.order == SortedQuery::Order::name) {
        SqliteStatement& rows = reader_->children.bind(std::string_view(query.container));
        while (TRY(rows.step())) view.places.push_back(rows.integer(0));
        rows.reset();
    } else {
        TRY(appendByValue(query, view.places));
    }
    views_.push_front(std::move(view));
    if (views_.size() > kViewsMax) views_.pop_back();
    return &views_.front();
}

Result<SearchStore::Sorted> SearchStore::sorted(const SortedQuery& query) {
    const MutexLock lock(readerMutex_);
    SqliteTransaction transaction = TRY(SqliteTransaction::begin(reader_->database));
    const View& found = *TRY(view(query));
    Sorted sorted;
    sorted.total = found.places.size();
    const std::size_t begin = std::min<std::uint64_t>(query.offset, found.places.size());
    const std::size_t end = std::min(begin + query.limit, found.places.size());
    for (std::size_t i = begin; i < end; ++i) {
        const std::int64_t place = found.places[query.isDescending ? found.places.size() - 1 - i : i];
        if (TRY(reader_->identifier.bind(place).step())) sorted.identifiers.emplace_back(reader_->identifier.text(0));
        reader_->identifier.reset();
    }
    return sorted;
}

Result<std::vector<TagCount>> SearchStore::tags() {
    const MutexLock lock(readerMutex_);
    std::vector<std::pair<std::string, TagCount>> found;
    SqliteStatement& rows = reader_->tags.bind();
    while (TRY(rows.step())) {
        std::string tag(rows.text(0));
        std::string key = collation_.key(tag);
        found.emplace_back(std::move(key), TagCount{std::move(tag), static_cast<std::uint64_t>(rows.integer(1))});
    }
    rows.reset();
    std::ranges::stable_sort(found, {}, &std::pair<std::string, TagCount>::first);
    std::vector<TagCount> tags;
    for (auto& [key, count] : found) tags.push_back(std::move(count));
    return tags;
}

Result<SearchStore::Counts> SearchStore::counts() {
    const MutexLock lock(readerMutex_);
    Counts counts;
    const auto items = TRY(reader_->database.integer("SELECT value FROM facts WHERE name = 'items'"));
    counts.items = static_cast<std::uint64_t>(items.value_or(0));
    const auto pages = TRY(reader_->database.integer("PRAGMA page_count")).value_or(0);
    const auto pageSize = TRY(reader_->database.integer("PRAGMA page_size")).value_or(0);
    counts.bytes = static_cast<std::uint64_t>(pages * pageSize);
    return counts;
}

Result<std::vector<TesselItemIdentifier>> SearchStore::identifiers() {
    const MutexLock lock(readerMutex_);
    SqliteStatement rows = TRY(reader_->database.prepare("SELECT identifier FROM items"));
    std::vector<TesselItemIdentifier> all;
    while (TRY(rows.step())) all.emplace_back(rows.text(0));
    return all;
}

Result<void> SearchStore::check() {
    {
        const MutexLock lock(writerMutex_);
        TRY(writer_->database.run("INSERT INTO names(names, rank) VALUES('integrity-check', 0)"));
    }
    const MutexLock lock(readerMutex_);
    SqliteStatement rows = TRY(reader_->database.prepare("PRAGMA integrity_check(1)"));
    if (TRY(rows.step()) && rows.text(0) == "ok") return {};
    return KsError::posix(EBADMSG).with("message", std::string(rows.text(0)));
}

}  // namespace cindral
