#include "host/search/SearchFunctions.h"

#include <sqlite3.h>

#include <cerrno>

#include "host/search/NameFolding.h"

namespace cindral {
namespace {

using Receive = int (*)(void*, int flags, const char* token, int size, int start, int end);

int createTokenizer(void* /*context*/, const char** /*arguments*/, int /*count*/, Fts5Tokenizer** out) {
    // It has no state; what it is must only not be null.
    static char stateless = 0;
    *out = reinterpret_cast<Fts5Tokenizer*>(&stateless);
    return SQLITE_OK;
}

void deleteTokenizer(Fts5Tokenizer* /*tokenizer*/) {}

int tokenize(Fts5Tokenizer* /*tokenizer*/, void* context, int flags, const char* text, int size, Receive receive) {
    const std::string_view folded(text, static_cast<std::size_t>(size));
    // A query names grams.
    if ((flags & FTS5_TOKENIZE_QUERY) != 0) return receive(context, 0, text, size, 0, size);
    int code = SQLITE_OK;
    name_grams::forEach(folded, [&](std::string_view gram) {
        code = receive(context, 0, gram.data(), static_cast<int>(gram.size()), 0, 0);
        return code == SQLITE_OK;
    });
    return code;
}

void nameKey(sqlite3_context* context, int /*count*/, sqlite3_value** arguments) {
    const auto* collation = static_cast<const NameCollation*>(sqlite3_user_data(context));
    const void* bytes = sqlite3_value_blob(arguments[0]);
    const auto size = static_cast<std::size_t>(sqlite3_value_bytes(arguments[0]));
    const std::string key = collation->key({static_cast<const char*>(bytes), bytes != nullptr ? size : 0});
    sqlite3_result_blob64(context, key.data(), key.size(), SQLITE_TRANSIENT);
}

Result<fts5_api*> tokenizers(SqliteDatabase& database) {
    sqlite3_stmt* statement = nullptr;
    fts5_api* api = nullptr;
    if (sqlite3_prepare_v2(database.handle(), "SELECT fts5(?1)", -1, &statement, nullptr) == SQLITE_OK) {
        sqlite3_bind_pointer(statement, 1, static_cast<void*>(&api), "fts5_api_ptr", nullptr);
        sqlite3_step(statement);
    }
    sqlite3_finalize(statement);
    if (api == nullptr) return KsError::posix(ENOTSUP).with("message", "the SQLite library has no FTS5");
    return api;
}

}  // namespace

Result<void> search_functions::install(SqliteDatabase& database, const NameCollation& collation) {
    fts5_api* api = TRY(tokenizers(database));
    fts5_tokenizer grams{createTokenizer, deleteTokenizer, tokenize};
    if (api->xCreateTokenizer(api, "cindral_grams", nullptr, &grams, nullptr) != SQLITE_OK)
        return KsError::posix(ENOMEM);
    // Its results are part of an index; the database is no place from which code could be called.
    constexpr int kFlags = SQLITE_UTF8 | SQLITE_DETERMINISTIC | SQLITE_INNOCUOUS;
    auto* user = const_cast<NameCollation*>(&collation);  // NOLINT(cppcoreguidelines-pro-type-const-cast): only read.
    const int made =
        sqlite3_create_function_v2(database.handle(), "name_key", 1, kFlags, user, nameKey, nullptr, nullptr, nullptr);
    return made == SQLITE_OK ? Result<void>() : Result<void>(KsError::posix(ENOMEM));
}

}  // namespace cindral
