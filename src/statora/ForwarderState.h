// The spool as the forwarder sees it, and what the forwarder keeps in it.
//
// A row stays in `events` until a collector has taken it. The forwarder adds three tables:
//
//   forwarder            name and value of each counter, and the words of the last failure
//   forwarder_delivered  the rows that a collector has taken lately, see SpoolRows.h
//   forwarder_set_aside  the rows that cannot be delivered, each with the time of the refusal and
//                        the collector's status and words (status 0: no collector was asked)
//
// Threads: one at a time.

#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/System.h"
#include "statora/SpoolRows.h"
#include "statora/Sqlite.h"

namespace tessel {

// What the forwarder has done with this spool since the spool was made.
struct ForwarderCounters {
  uint64_t delivered = 0;        // records that a collector took, including rejected ones
  uint64_t rejected = 0;         // of the delivered ones: those that the collector threw away
  uint64_t setAside = 0;         // records that were refused and set aside
  uint64_t setAsideDropped = 0;  // of the set aside ones: the oldest, deleted to keep the limit
  uint64_t requests = 0;
  uint64_t retries = 0;
  uint64_t bytesSent = 0;    // of request bodies, as sent
  uint64_t position = 0;     // id of the last row that was delivered
  uint64_t lastSuccess = 0;  // microseconds since 1970; 0: never
  // Why the collector took nothing when it was last asked in vain. A later success leaves it as it
  // is. The words are one line that is fit for a terminal.
  std::string lastError;
  uint64_t lastErrorAt = 0;   // microseconds since 1970; 0: never
  uint64_t orderedUntil = 0;  // until when the collector then asked us to wait; 0: it did not

  bool operator==(const ForwarderCounters&) const = default;
};

// Absent if no forwarder ever worked on this spool.
std::optional<ForwarderCounters> readForwarderCounters(SqliteDatabase& database);

class ForwarderState {
 public:
  static constexpr uint64_t kDefaultMaxSetAside = 10'000;

  explicit ForwarderState(std::string stateDirectory, uint64_t maxSetAside = kDefaultMaxSetAside);

  // Whether there is a spool.
  bool exists() const;
  // Opens the spool. Does nothing if it is open and its file still stands at its path. A missing
  // spool is a failure: only the service makes one.
  SqliteStatus open();
  // Opens the spool for oldest() and spoolId() alone; nothing in it can be changed.
  SqliteStatus openReadOnly();
  // The following REQUIRE an open spool.
  const std::string& spoolId() const { return spoolId_; }

  // See readEvents(). After an error status() says why.
  std::vector<SpooledEvent> oldest(size_t maxRows, size_t maxBytes, int64_t after = 0);
  SqliteStatus status() const { return database_.status(); }
  // Makes the rows that oldest() has answered survive a power cut. REQUIRES: oldest() was called.
  SqliteStatus flushLog() { return database_.flushLog(); }
  // About how many rows wait. It is the span of their ids, because counting would read the table.
  uint64_t waiting();
  // For the ledger of health records. Valid until the next open().
  SqliteDatabase& database() { return database_; }

  // The counters. The next acknowledgement or setting aside stores them.
  ForwarderCounters& counters() { return counters_; }
  // Counts the rows as delivered to `destination` and moves them to the delivered ones, in
  // transactions of a few rows each. `rejected` of them were thrown away by the collector, which
  // does not say which. If it fails, the rows of the finished transactions are moved and counted,
  // and the others wait. The ids of `rows` ascend.
  SqliteStatus acknowledge(std::span<const SpooledEvent* const> rows, uint64_t rejected,
                           std::string_view destination, Date now);
  // Removes delivered rows that are past their days, or more than the limits allow.
  void shortenDelivered(Date now);
  // Moves a row to the table of refused rows, with the collector's answer. If the table then has
  // more rows than the limit, its oldest row is deleted.
  SqliteStatus setAside(const SpooledEvent& event, int64_t collectorStatus, std::string_view words,
                        Date now);
  // Stores the counters alone.
  SqliteStatus storeCounters();
  // Puts all rows that were set aside back among those that wait, and answers their number. If that
  // fails, the answer is absent and nothing has changed.
  std::optional<int64_t> requeue();
  // Gives up to `pages` pages of free space back to the file system. False if there was none.
  bool shrink(int pages);

 private:
  SqliteStatus openFresh(SqliteDatabase::Mode mode);
  SqliteStatus openAndPrepare();
  SqliteStatus prepareStatements();
  bool isStillThere() const;
  // What happens to rows that are delivered.
  enum class Delivered { kept, dropped };
  using Rows = std::span<const SpooledEvent* const>;

  Rows firstStep(Rows rows) const;
  SqliteStatus move(Rows rows, uint64_t rejected, std::string_view destination, Date now);
  SqliteStatus moveOnce(Rows rows, uint64_t rejected, std::string_view destination, Date now,
                        Delivered fate);
  bool keep(Rows rows, std::string_view destination, Date now);
  bool shortenBy(uint64_t added);
  bool logIsHeld();
  void readLimits();
  static int afterCommit(void* self, sqlite3* handle, const char* schema, int logPages);
  bool writeCounters();
  SqliteStatus finish(bool good);

  const std::string path_;
  const uint64_t maxSetAside_;
  SqliteDatabase database_;
  uint64_t device_ = 0;
  uint64_t inode_ = 0;
  std::string spoolId_;
  ForwarderCounters counters_;
  SqliteStatement select_, remove_, keep_, trim_, count_, pageCount_, freePages_;
  DeliveredRows delivered_{database_};
  SpoolLimits limits_;
  int64_t checkpointPages_ = 0;
  int64_t logPages_ = 0;  // after the last commit of this program
};

}  // namespace tessel
