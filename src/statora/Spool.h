// The spool: its database, and the event sender that fills it.

#pragma once

#include <array>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/Analytics.h"
#include "platform/System.h"
#include "statora/Sqlite.h"

namespace tessel {

// The spool's database: its name, its schema, and the one place where it is opened and upgraded.
//
//   events  one row per event, in send order
//   meta    facts about this spool; `spool_id` is 32 hexadecimal digits drawn when it was made
//
// The forwarder keeps tables of its own in the same file; see ForwarderState.h among the tools.

inline constexpr char kSpoolFileName[] = "statora.db";
inline constexpr int kSpoolSchemaVersion = 1;

// Opens the spool at `path`, makes it where there is none, and brings it up to this schema version.
// Fails with SQLITE_SCHEMA where it was made by a newer version; nothing in it is changed then.
SqliteStatus openSpoolDatabase(SqliteDatabase& database, const std::string& path,
                               int busyTimeoutMilliseconds);

// Spool: the analytics service's event sender, a durable queue in an SQLite database.
//
// Every send commits one row and flushes the write-ahead log (synchronous=FULL), so that a row is
// in the file, past a power cut, when its own send has returned. A flush for every second send
// would do for what is promised; it is not worth its bookkeeping. With its flush a send takes about
// 0.1 ms on flash, half of it processor time, and at the service's pace of 80 sends a second even a
// disk that needs 10 ms for each keeps up. And the last row of a run is as safe as every other.
//
// The database is opened by the first send, so a run that sends nothing leaves nothing behind. It
// is closed at the end of a run: a database that was moved or removed meanwhile is noticed then.
//
// A send that fails is counted under its reason and said once per run and reason in the log; the
// event is gone and the run goes on. A database that turns out damaged is set aside, with its
// write-ahead log, under `statora.db.damaged-<UTC date>`, once a run at most, and a new one is
// begun. What was stored is never rewritten.
//
// Threads: one at a time, the reporting queue's.

enum class SpoolFailure {
  limit,     // the spool holds as much as it may
  diskFull,  // no space, no quota
  readOnly,  // not to be written, or not to be opened
  locked,    // another client keeps it locked
  damaged,   // and could not be set aside, or was so already in this run
  version,   // made by another version of the schema
  other,
};
inline constexpr size_t kSpoolFailureKinds = 7;

// "limit", "disk_full", "read_only", "locked", "damaged", "version", "other".
const char* spoolFailureName(SpoolFailure failure);

// What became of the sends since the run began.
struct SpoolFigures {
  uint64_t stored = 0;
  std::array<uint64_t, kSpoolFailureKinds> failed{};  // by SpoolFailure
  std::vector<std::string> setAside;                  // names that damaged databases were given
};

class Spool final : public EventSender {
 public:
  static constexpr uint64_t kDefaultMaxBytes = uint64_t{1} << 30;

  // Keeps its database in `stateDirectory`, which is made when it is first needed. `maxBytes`
  // bounds database and write-ahead log together; a sixteenth of it is for the log.
  Spool(std::string stateDirectory, Clock& clock, uint64_t maxBytes = kDefaultMaxBytes);

  bool sendEvent(std::string_view name, const Payload& payload) override;

  // Sets the figures to zero and forgets what was said in the log.
  void beginRun();
  const SpoolFigures& figures() const { return figures_; }
  // Closes the database.
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
  int64_t maxPages_ = 0;
  int64_t maxLogPages_ = 0;
  int64_t logPages_ = 0;    // in the write-ahead log, after the last commit
  bool impatient_ = false;  // the last wait for a lock was in vain
  SpoolFigures figures_;
};

}  // namespace tessel
