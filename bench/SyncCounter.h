// Counts the syncs SQLite asks of the files it opens in this process (fsync or fdatasync, one per
// xSync), by putting a counting layer over the default VFS. Installed before a database is opened,
// it sees every connection opened after it.
#pragma once

#include <cstdint>

namespace axbench {

// Makes the counting layer the default VFS; idempotent. False when SQLite has no default VFS.
bool countSqliteSyncs();
// Syncs asked for since the layer was installed: of the database file, and of its write-ahead log.
struct SqliteSyncs {
    uint64_t database = 0, log = 0, other = 0;
    uint64_t total() const { return database + log + other; }
};
SqliteSyncs sqliteSyncs();

}  // namespace axbench
