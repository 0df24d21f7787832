// The spool's database: its name, its schema, and the one place where it is opened and upgraded.
//
//   events  one row per event, in send order
//   meta    facts about this spool; `spool_id` is 32 hexadecimal digits drawn when it was made
//
// The forwarder keeps tables of its own in the same file; see ForwarderState.h among the tools.

#pragma once

#include <string>

#include "statora/Sqlite.h"

namespace tessel {

inline constexpr char kSpoolFileName[] = "statora.db";
inline constexpr int kSpoolSchemaVersion = 1;

// Opens the spool at `path`, makes it where there is none, and brings it up to this schema version.
// Fails with SQLITE_SCHEMA where it was made by a newer version; nothing in it is changed then.
SqliteStatus openSpoolDatabase(SqliteDatabase& database, const std::string& path,
                               int busyTimeoutMilliseconds);

}  // namespace tessel
