// The spool: a durable queue of events in an SQLite database. The service fills it, the forwarder
// (ForwarderState.h) empties it.
//
//   events  one row per event, in the order of sending
//   meta    facts about this spool; `spool_id` is 32 hexadecimal digits, drawn when it was made.
//           `compatible_from`, if it is there, is the oldest schema version whose forwarder may
//           still deliver the rows. An upgrade that only adds writes it.
//
// The forwarder keeps tables of its own in the same file.

#pragma once

#include <array>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/Analytics.h"
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

// Why a send failed.
enum class SpoolFailure {
  limit,     // the spool holds as much as it may
  diskFull,  // no space or no quota is left
  readOnly,  // the file cannot be opened or written
  locked,    // another client keeps it locked
  damaged,   // it is damaged, and renaming it failed or was already done once in this run
  version,   // another version of the schema made it
  other,
};
inline constexpr size_t kSpoolFailureKinds = 7;

// "limit", "disk_full", "read_only", "locked", "damaged", "version", "other".
const char* spoolFailureName(SpoolFailure failure);

// The results of the sends since the run began. Each send was stored or failed for one reason.
struct SpoolFigures {
  uint64_t sent = 0;
  uint64_t stored = 0;
  std::array<uint64_t, kSpoolFailureKinds> failed{};  // by SpoolFailure
  std::vector<std::string> setAside;                  // file names of damaged spools
};

// The event sender of the analytics service.
//
// Once sendEvent() has returned true, its row survives a power cut. The first send opens the
// database, so a run that sends nothing makes no file. endRun() closes the database. The next run
// opens it by its path, so it does not write to a file that somebody has moved or removed.
//
// A send that fails is counted under its reason, and the run goes on. The log says each reason once
// a run. A damaged spool is renamed to `statora.db.damaged-<UTC date>`, at most once a run, and a
// new one is begun. The service never changes a stored row.
//
// Threads: one at a time (the reporting queue).
class Spool final : public EventSender {
 public:
  static constexpr uint64_t kDefaultMaxBytes = uint64_t{1} << 30;

  // The database lies in `stateDirectory`, which the first send makes if it is missing. `maxBytes`
  // bounds the database and its write-ahead log together. The log may take a sixteenth of it.
  Spool(std::string stateDirectory, Clock& clock, uint64_t maxBytes = kDefaultMaxBytes);

  bool sendEvent(std::string_view name, const Payload& payload) override;

  // Sets the figures to zero. The log may then say each reason again.
  void beginRun();
  const SpoolFigures& figures() const { return figures_; }
  // Closes the database, which moves the write-ahead log into it.
  void endRun();

 private:
  SqliteStatus store(std::string_view name, std::string_view payload, int64_t time);
  SqliteStatus ensureOpen();
  SqliteStatus open();
  void close();
  bool setAside();
  bool logIsTooLong();
  SpoolFailure classify(const SqliteStatus& status, size_t rowBytes);
  void recordFailure(const SqliteStatus& status, size_t rowBytes);
  static int afterCommit(void* spool, sqlite3* handle, const char* schema, int logPages);

  const std::string directory_;
  const std::string path_;
  Clock& clock_;
  const uint64_t maxBytes_;

  SqliteDatabase database_;
  SqliteStatement insert_;
  int64_t maxPages_ = 0;  // of the database; 0 until it was opened once
  int64_t maxLogPages_ = 0;
  int64_t logPages_ = 0;    // in the write-ahead log, after the last commit
  bool impatient_ = false;  // the last wait for a lock failed, so the next send does not wait
  SpoolFigures figures_;
};

}  // namespace tessel
