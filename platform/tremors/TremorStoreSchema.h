#pragma once

#include <cstdint>
#include <string>

#include "platform/tremors/SqliteDatabase.h"
#include "support/Result.h"

namespace tamber {

// The tables of one volume's journal database: how a new one is laid out, how an older one is
// brought up to date in place, and the connection settings every use of it needs.
class TremorStoreSchema {
public:
    // 2: the index keeps each entry's birth time, size and modification time.
    // 3: it keeps each entry's change time and a copy of each document's metadata attributes.
    static constexpr int kVersion = 3;

    // Configures the connection, then creates the tables in an empty database (with a new
    // UUID, logged) or upgrades an older schema in place. A database that is not ours, of an
    // unknown version or failing its quick check is reported as corrupt.
    static Status prepare(SqliteDatabase& db, const std::string& directory);
    // The error for a database whose content is unusable.
    static Error corrupt(const std::string& what);

private:
    static Status configure(SqliteDatabase& db);
    static Status create(SqliteDatabase& db, const std::string& directory);
    static Status upgrade(SqliteDatabase& db, const std::string& directory, int64_t from);
};

}  // namespace tamber
