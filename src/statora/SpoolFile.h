// The spool: a durable queue of events in an SQLite database. The service fills it (Spool.h), the
// forwarder (ForwarderState.h) empties it.
//
//   events  one row per event, in the order of sending
//   meta    facts about this spool: `spool_id`, 32 hexadecimal digits, drawn when it was made;
//           `compatible_from`, if it is there, is the oldest schema version whose forwarder may
//           still deliver the rows. An upgrade that only adds writes it.
//
// The forwarder keeps tables of its own in the same file.

#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include "platform/System.h"
#include "statora/Sqlite.h"

namespace tessel {

inline constexpr char kSpoolFileName[] = "statora.db";
inline constexpr int kSpoolSchemaVersion = 1;

// Opens the spool at `path`, makes it if there is none, and brings an older one up to this schema
// version. Fails with SQLITE_SCHEMA, and changes nothing, if a newer version made it. This is the
// one place where a spool is made or upgraded.
SqliteStatus openSpoolDatabase(SqliteDatabase& database, const std::string& path,
                               int busyTimeoutMilliseconds);

// Whether a forwarder of this version may deliver the rows of a spool of schema version `version`.
bool isUnderstoodSpool(SqliteDatabase& database, int64_t version);

// Renames a damaged spool, with its log, to `statora.db.damaged-<UTC date>`. Nobody of this process
// may have it open. Answers the new file name; absent if that failed.
std::optional<std::string> setSpoolAside(const std::string& stateDirectory, Date now);

// Why an event is not in the spool.
enum class SpoolFailure {
  limit,         // the spool holds as much as it may
  diskFull,      // no space or no quota is left
  readOnly,      // the file cannot be opened or written
  locked,        // another client kept it locked until the run ended
  damaged,       // it is damaged, and renaming it failed or was already done once in this run
  version,       // another version of the schema made it
  other,         // among them: rows whose flush failed. A later reader may find those.
  bufferFull,    // the disk was so slow that the buffer in memory was full
  runShare,      // the run has stored as much as one run may
  heldByReader,  // a reader that does not end its read has made the log grow to the limit
};
inline constexpr size_t kSpoolFailureKinds = 10;

// A number for each reason.
using SpoolFailures = std::array<uint64_t, kSpoolFailureKinds>;

// "limit", "disk_full", "read_only", "locked", "damaged", "version", "other", "buffer_full",
// "run_share", "held_by_reader".
const char* spoolFailureName(SpoolFailure failure);

}  // namespace tessel
