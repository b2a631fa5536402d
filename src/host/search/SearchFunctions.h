#pragma once

#include "host/search/NameCollation.h"
#include "host/search/Sqlite.h"

namespace cindral::search_functions {

/// Makes known to a connection what the index's tables are defined with: the tokenizer "cindral_grams", which cuts
/// folded names into their grams (name_grams), and the function name_key(name), the collation's key of a name.
///
/// `collation` lives as long as the connection.
Result<void> install(SqliteDatabase& database, const NameCollation& collation);

}  // namespace cindral::search_functions
