// SpoolDatabase: the spool's database as the service writes it. Rows, flushes, checkpoints, the
// limit on its size, and the rows that have stood there too long.
//
// Threads: one at a time.

#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>

#include "platform/Analytics.h"
#include "platform/System.h"
#include "statora/SpoolFile.h"
#include "statora/SpoolRows.h"
#include "statora/Sqlite.h"

namespace tessel {

// A row on its way into the spool. The two events of an object share one payload.
struct PendingRow {
  int64_t time = 0;  // microseconds since 1970
  std::string name;
  std::shared_ptr<const std::string> payload;
  EventRank rank = EventRank::object;
  std::optional<SpoolFailure> refused;  // set by insert() if there was no room

  size_t textBytes() const { return name.size() + payload->size(); }
};

class SpoolDatabase {
 public:
  SpoolDatabase(std::string stateDirectory, SpoolLimits limits);

  const std::string& path() const { return path_; }
  bool isOpen() const { return insert_.prepared(); }
  // Whether there is a database at the path.
  bool exists() const;

  // Bytes that the objects of this run may take, by spaceOfRow(). The first call fixes what the run
  // may take, and opens the database if there is one.
  uint64_t bytesForObjects();

  // Inserts the rows in one transaction. A row for which there is no room is left out and gets its
  // `refused`. After a failure none of the rows is in the database. Opens it if necessary.
  SqliteStatus insert(std::span<PendingRow> rows);
  // How long a transaction may wait for another client's lock; a quarter of a second by default.
  void setPatience(std::chrono::milliseconds patience);
  // Whether a reader keeps the log from beginning anew. Each commit then makes it longer.
  bool logIsHeld() const { return logPages_ > 2 * checkpointPages_; }
  // If rows were refused because the log is held, tries to empty it.
  void retryHeldLog();

  // Makes all inserted rows survive a power cut. Cheap if nothing was inserted.
  SqliteStatus flush();
  // How many inserted rows a failed flush or checkpoint has put at risk since the last call.
  uint64_t takeRowsAtRisk();

  // Removes the rows of earlier runs that are older than the limit on `now`, and gives free space
  // back to the file system. Answers how many rows were removed. `progress` is called at each step.
  uint64_t expire(Date now, const std::function<void()>& progress);

  // Ends the books of a run. REQUIRES: the database is closed.
  void endRun();
  // Closes the database, which moves the log into it. Flush it before.
  void close();
  // Renames the database. Answers its new file name; absent if that failed.
  std::optional<std::string> setAside(Date now);

 private:
  struct Search {
    int64_t oldest = 0;  // microseconds since 1970; a row of an earlier time is removed
    int64_t from = 0;    // id of the next row to look at
    uint64_t removed = 0;
  };

  // Pages for one row.
  struct Room {
    int64_t row = 0;   // that it may need
    int64_t left = 0;  // that are left when it has taken them
    int64_t log = 0;   // that must be left, for the log
  };

  SqliteStatus ensureOpen();
  SqliteStatus open();
  void forgetStatements();
  SqliteStatus insertOnce(std::span<PendingRow> rows);
  SqliteStatus insertEach(std::span<PendingRow> rows);
  bool diskIsLow();
  bool clearPages(std::span<const PendingRow> rows);
  int64_t pagesOfRun();
  int64_t usedPages();
  int64_t deliveredPages();
  std::optional<SpoolFailure> overShare(const PendingRow& row);
  Room roomFor(const PendingRow& row);
  SqliteStatus makeRoom(const PendingRow& row);
  std::optional<SpoolFailure> overLimit(const PendingRow& row);
  void checkpoint();
  bool expireNext(Search& search);
  bool deliveredTooMuch();
  void giveSpaceBack(const std::function<void()>& progress);
  bool mayGrowLog();
  static int afterCommit(void* self, sqlite3* handle, const char* schema, int logPages);

  const std::string directory_;
  const std::string path_;
  const SpoolLimits limits_;
  const int64_t maxPages_;
  const int64_t checkpointPages_;

  SqliteDatabase database_;
  SqliteStatement insert_, pageCount_, freePages_;
  DeliveredRows delivered_{database_};
  std::chrono::milliseconds patience_;
  int64_t firstIdOfRun_ = 0;    // 0 until the run has opened the database
  int64_t pagesOfRun_ = 0;      // that the run may take; 0 until it is fixed
  uint64_t takenByRun_ = 0;     // bytes of pages
  int64_t pagesOfInsert_ = 0;   // of the transaction under way
  int64_t logPages_ = 0;        // after the last commit; 0 if the next one begins the log anew
  int64_t nextCheckpoint_ = 0;  // the length of the log at which it is due
  bool refusedForLog_ = false;
  uint64_t unflushedRows_ = 0;
  bool unflushed_ = false;
  uint64_t rowsAtRisk_ = 0;
};

}  // namespace tessel
