#include "host/search/Sqlite.h"

#include <fcntl.h>
#include <sqlite3.h>

#include <cerrno>
#include <utility>

#include "platform/foundation/Sys.h"

namespace cindral {
namespace {

int errnoOf(int code) {
    switch (code & 0xff) {
        case SQLITE_FULL: return ENOSPC;
        case SQLITE_READONLY: return EROFS;
        case SQLITE_CANTOPEN:
        case SQLITE_PERM:
        case SQLITE_AUTH: return EACCES;
        case SQLITE_NOMEM: return ENOMEM;
        case SQLITE_BUSY:
        case SQLITE_LOCKED: return EBUSY;
        case SQLITE_INTERRUPT: return ECANCELED;
        case SQLITE_CORRUPT:
        case SQLITE_NOTADB:
        case SQLITE_SCHEMA:
        // Of statements that are written here, to tables that are made here: they are not what they were.
        case SQLITE_ERROR:
        case SQLITE_CONSTRAINT:
        case SQLITE_MISMATCH: return EBADMSG;
        default: return EIO;
    }
}

KsError errorOf(sqlite3* database, int code) {
    // What the system said of the file is more exact than what it was taken for.
    const int system =
        (code & 0xff) == SQLITE_IOERR || (code & 0xff) == SQLITE_CANTOPEN ? sqlite3_system_errno(database) : 0;
    KsError error = KsError::posix(system != 0 ? system : errnoOf(code)).with("message", sqlite3_errmsg(database));
    const char* path = sqlite3_db_filename(database, "main");
    return path != nullptr ? error.with("path", path) : error;
}

}  // namespace

bool isDamagedDatabase(const KsError& error) {
    return error.isPosix(EBADMSG);
}

SqliteStatement::SqliteStatement(SqliteStatement&& other) noexcept
    : database_(other.database_), statement_(std::exchange(other.statement_, nullptr)) {}

SqliteStatement& SqliteStatement::operator=(SqliteStatement&& other) noexcept {
    std::swap(database_, other.database_);
    std::swap(statement_, other.statement_);
    return *this;
}

SqliteStatement::~SqliteStatement() {
    sqlite3_finalize(statement_);
}

void SqliteStatement::reset() {
    sqlite3_reset(statement_);
    sqlite3_clear_bindings(statement_);
}

void SqliteStatement::bindAt(int index, std::int64_t value) {
    sqlite3_bind_int64(statement_, index, value);
}

void SqliteStatement::bindAt(int index, const std::optional<std::int64_t>& value) {
    if (value) bindAt(index, *value);
}

void SqliteStatement::bindAt(int index, std::string_view value) {
    // An empty text has an address, or it would be taken for none.
    sqlite3_bind_text64(statement_, index, value.empty() ? "" : value.data(), value.size(), SQLITE_STATIC, SQLITE_UTF8);
}

void SqliteStatement::bindAt(int index, ByteView value) {
    sqlite3_bind_blob64(statement_, index, value.empty() ? reinterpret_cast<const std::byte*>("") : value.data(),
                        value.size(), SQLITE_STATIC);
}

Result<bool> SqliteStatement::step() {
    const int code = sqlite3_step(statement_);
    if (code == SQLITE_ROW) return true;
    if (code == SQLITE_DONE) return false;
    return errorOf(database_, code);
}

Result<void> SqliteStatement::run() {
    Result<bool> stepped = step();
    while (stepped.ok() && *stepped) stepped = step();
    // At once, so that nothing bound is kept beyond the call, and no read is left open.
    reset();
    return stepped.ok() ? Result<void>() : Result<void>(stepped.error());
}

std::int64_t SqliteStatement::integer(int column) const {
    return sqlite3_column_int64(statement_, column);
}

std::optional<std::int64_t> SqliteStatement::optionalInteger(int column) const {
    return isNull(column) ? std::nullopt : std::optional(integer(column));
}

std::string_view SqliteStatement::text(int column) const {
    return textOf(bytes(column));
}

ByteView SqliteStatement::bytes(int column) const {
    const void* data = sqlite3_column_blob(statement_, column);
    const auto size = static_cast<std::size_t>(sqlite3_column_bytes(statement_, column));
    return {static_cast<const std::byte*>(data), data != nullptr ? size : 0};
}

bool SqliteStatement::isNull(int column) const {
    return sqlite3_column_type(statement_, column) == SQLITE_NULL;
}

Result<SqliteDatabase> SqliteDatabase::open(const std::string& path, Mode mode) {
    // The library would let others read what it makes; what it puts beside a file is as the file is.
    if (mode == Mode::readWrite) TRY(sys::open(path.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK, 0600));
    sqlite3* opened = nullptr;
    const int flags = (mode == Mode::readWrite ? SQLITE_OPEN_READWRITE : SQLITE_OPEN_READONLY) | SQLITE_OPEN_NOMUTEX;
    const int code = sqlite3_open_v2(path.c_str(), &opened, flags, nullptr);
    SqliteDatabase database(opened);
    if (opened == nullptr) return KsError::posix(ENOMEM);
    if (code != SQLITE_OK) return errorOf(opened, code).with("path", path);
    sqlite3_extended_result_codes(opened, 1);
    // Only the checkpoints of another connection of this process are ever in the way.
    sqlite3_busy_timeout(opened, 10'000);
    // A damaged file is not to make the library trust its own tables.
    sqlite3_db_config(opened, SQLITE_DBCONFIG_DEFENSIVE, 1, nullptr);
    sqlite3_db_config(opened, SQLITE_DBCONFIG_ENABLE_TRIGGER, 0, nullptr);
    sqlite3_db_config(opened, SQLITE_DBCONFIG_ENABLE_VIEW, 0, nullptr);
    return database;
}

SqliteDatabase::SqliteDatabase(SqliteDatabase&& other) noexcept : database_(std::exchange(other.database_, nullptr)) {}

SqliteDatabase::~SqliteDatabase() {
    sqlite3_close_v2(database_);
}

Result<void> SqliteDatabase::run(const std::string& sql) {
    const int code = sqlite3_exec(database_, sql.c_str(), nullptr, nullptr, nullptr);
    return code == SQLITE_OK ? Result<void>() : Result<void>(errorOf(database_, code));
}

Result<SqliteStatement> SqliteDatabase::prepare(std::string_view sql) {
    sqlite3_stmt* statement = nullptr;
    const int code = sqlite3_prepare_v3(database_, sql.data(), static_cast<int>(sql.size()), SQLITE_PREPARE_PERSISTENT,
                                        &statement, nullptr);
    if (code != SQLITE_OK) return errorOf(database_, code);
    return SqliteStatement(database_, statement);
}

Result<std::optional<std::int64_t>> SqliteDatabase::integer(std::string_view sql) {
    SqliteStatement statement = TRY(prepare(sql));
    if (!TRY(statement.step())) return std::optional<std::int64_t>();
    return statement.optionalInteger(0);
}

bool SqliteDatabase::isInTransaction() const {
    return sqlite3_get_autocommit(database_) == 0;
}

Result<SqliteTransaction> SqliteTransaction::begin(SqliteDatabase& database) {
    TRY(database.run("BEGIN"));
    return SqliteTransaction(database);
}

SqliteTransaction::SqliteTransaction(SqliteTransaction&& other) noexcept
    : database_(std::exchange(other.database_, nullptr)) {}

SqliteTransaction::~SqliteTransaction() {
    // A full disk may have rolled it back already.
    if (database_ != nullptr && database_->isInTransaction()) (void)database_->run("ROLLBACK");
}

Result<void> SqliteTransaction::commit() {
    TRY(database_->run("COMMIT"));
    database_ = nullptr;
    return {};
}

}  // namespace cindral
