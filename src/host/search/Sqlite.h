#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/foundation/Data.h"
#include "platform/foundation/Result.h"

struct sqlite3;
struct sqlite3_stmt;

namespace cindral {

/// A prepared statement: bound, stepped through, and ready to be bound again.
///
/// Texts and bytes that are bound live until the statement is reset; those of a column until the next step.
///
/// Thread safety: that of its database.
class SqliteStatement {
public:
    SqliteStatement() = default;
    SqliteStatement(SqliteStatement&& other) noexcept;
    SqliteStatement& operator=(SqliteStatement&& other) noexcept;
    ~SqliteStatement();

    /// Resets, and binds the values to the parameters, from the first.
    template <typename... Values>
    SqliteStatement& bind(const Values&... values) {
        reset();
        int index = 0;
        (bindAt(++index, values), ...);
        return *this;
    }
    void reset();

    /// False at the end.
    Result<bool> step();
    /// Steps to the end, and resets.
    Result<void> run();
    template <typename... Values>
    Result<void> run(const Values&... values) {
        return bind(values...).run();
    }

    std::int64_t integer(int column) const;
    std::optional<std::int64_t> optionalInteger(int column) const;
    std::string_view text(int column) const;
    ByteView bytes(int column) const;
    bool isNull(int column) const;

private:
    friend class SqliteDatabase;
    SqliteStatement(sqlite3* database, sqlite3_stmt* statement) : database_(database), statement_(statement) {}
    void bindAt(int index, std::int64_t value);
    void bindAt(int index, const std::optional<std::int64_t>& value);
    void bindAt(int index, std::string_view value);
    void bindAt(int index, ByteView value);

    sqlite3* database_ = nullptr;
    sqlite3_stmt* statement_ = nullptr;
};

/// A connection to a database file.
///
/// Errors are of the POSIX domain, for what went wrong with the file: ENOSPC, EROFS, EACCES, EIO; EBADMSG where the
/// database is damaged or none. They name the library's own words as "message" and the file as "path".
///
/// Thread safety: one thread at a time.
class SqliteDatabase {
public:
    enum class Mode { readWrite, readOnly };
    /// Makes the file where it is missing, for its owner alone.
    static Result<SqliteDatabase> open(const std::string& path, Mode mode);
    SqliteDatabase(SqliteDatabase&& other) noexcept;
    SqliteDatabase& operator=(SqliteDatabase&& other) = delete;
    ~SqliteDatabase();

    sqlite3* handle() const { return database_; }
    /// One statement or several, without parameters.
    Result<void> run(const std::string& sql);
    Result<SqliteStatement> prepare(std::string_view sql);
    /// The first column of the first row; none where there is no row.
    Result<std::optional<std::int64_t>> integer(std::string_view sql);
    bool isInTransaction() const;

private:
    explicit SqliteDatabase(sqlite3* database) : database_(database) {}
    sqlite3* database_;
};

/// A transaction, rolled back unless it is committed.
class SqliteTransaction {
public:
    /// `database` is borrowed for life.
    static Result<SqliteTransaction> begin(SqliteDatabase& database);
    SqliteTransaction(SqliteTransaction&& other) noexcept;
    SqliteTransaction& operator=(SqliteTransaction&& other) = delete;
    ~SqliteTransaction();
    Result<void> commit();

private:
    explicit SqliteTransaction(SqliteDatabase& database) : database_(&database) {}
    SqliteDatabase* database_;
};

/// Whether the error says that the database itself is no good, whatever may be done about the disk.
bool isDamagedDatabase(const KsError& error);

}  // namespace cindral
