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

#include "os/UniqueFd.h"
#include "platform/System.h"
#include "statora/ForwarderCounters.h"
#include "statora/SpoolRows.h"
#include "statora/Sqlite.h"

namespace tessel {

class ForwarderState {
 public:
  static constexpr uint64_t kDefaultMaxSetAside = 10'000;

  explicit ForwarderState(std::string stateDirectory, uint64_t maxSetAside = kDefaultMaxSetAside);

  // Whether there is a spool.
  bool exists() const;
  // Opens the spool. Does nothing if it is open and its file still stands at its path. A missing
  // spool is a failure: only the service makes one. Another forwarder on the same spool is one, too
  // (kHeldByAnotherForwarder). The lock stays until this object goes.
  SqliteStatus open();
  // Counts the files that were opened. The ids of rows mean the same events as long as it stays.
  uint64_t generation() const { return generation_; }
  // Opens the spool for oldest() and spoolId() alone; nothing in it can be changed.
  SqliteStatus openReadOnly();
  // The following REQUIRE an open spool.
  const std::string& spoolId() const { return spoolId_; }

  // See readEvents(). After an error status() says why.
  std::vector<SpooledEvent> oldest(size_t maxRows, size_t maxBytes, int64_t after = 0);
  SqliteStatus status() const { return database_.status(); }
  // Makes the rows that oldest() has answered survive a power cut. REQUIRES: oldest() was called.
  SqliteStatus flushLog() { return database_.flushLog(); }
  // One row with an id above `after`, or none. `chance`, at least 0 and below 1, says where.
  std::vector<SpooledEvent> someEvent(int64_t after, double chance);
  // About how many rows wait. It is the span of their ids, because counting would read the table.
  uint64_t waiting();
  // For the ledger of health records. Valid until the next open().
  SqliteDatabase& database() { return database_; }

  // The counters. The next acknowledgement or setting aside stores them.
  ForwarderCounters& counters() { return counters_; }
  using Rows = std::span<const SpooledEvent* const>;
  // Writes to the spool, so that a disk without room, another client's lock, or a reader that makes
  // the log grow shows before rows are sent. `asMuchAsABatch` writes as many bytes as the
  // acknowledgement of a batch; otherwise a few.
  SqliteStatus proveWritable(bool asMuchAsABatch);
  // Counts the rows as delivered to `destination` and moves them to the delivered ones, in
  // transactions of a few rows each. `rejected` of them were thrown away by the collector, which
  // does not say which. If it fails, `rows` and `rejected` are what is still to be done: the rows
  // of the finished transactions are moved and counted. The ids of `rows` ascend.
  SqliteStatus acknowledge(Rows& rows, uint64_t& rejected, std::string_view destination, Date now);
  // Removes delivered rows that are past their days, or more than the limits allow.
  void shortenDelivered(Date now);
  // Whether the table of refused rows may take one more. Its limit keeps a collector that refuses
  // much from filling the disk.
  bool hasRoomToSetAside();
  // Moves a row to that table, with the collector's answer.
  SqliteStatus setAside(const SpooledEvent& event, int64_t collectorStatus, std::string_view words,
                        Date now);
  // Stores the counters alone.
  SqliteStatus storeCounters();
  // Puts all rows that were set aside back among those that wait, and answers their number. A row
  // keeps its id, unless another row has it by now. If that fails, the answer is absent and nothing
  // has changed.
  std::optional<int64_t> requeue();
  // Gives up to `pages` pages of free space back to the file system. False if there was none.
  bool shrink(int pages);

 private:
  SqliteStatus lock();
  SqliteStatus openFresh(SqliteDatabase::Mode mode);
  SqliteStatus openAndPrepare();
  SqliteStatus prepareStatements();
  bool isStillThere() const;
  // What happens to rows that are delivered.
  enum class Delivered { kept, dropped };

  Rows firstStep(Rows rows) const;
  SqliteStatus move(Rows rows, uint64_t rejected, std::string_view destination, Date now);
  SqliteStatus moveOnce(Rows rows, uint64_t rejected, std::string_view destination, Date now,
                        Delivered fate);
  bool keep(Rows rows, std::string_view destination, Date now);
  bool shortenBy(uint64_t added);
  bool logIsHeld(int64_t pages);
  void readLimits();
  static int afterCommit(void* self, sqlite3* handle, const char* schema, int logPages);
  SqliteStatus finish(bool good);

  const std::string directory_;
  const std::string path_;
  const uint64_t maxSetAside_;
  SqliteDatabase database_;
  UniqueFd lock_;
  uint64_t generation_ = 0;
  uint64_t device_ = 0;
  uint64_t inode_ = 0;
  std::string spoolId_;
  ForwarderCounters counters_;
  SqliteStatement select_, remove_, keep_, count_, pageCount_, freePages_;
  DeliveredRows delivered_{database_};
  SpoolLimits limits_;
  int64_t checkpointPages_ = 0;
  int64_t logPages_ = 0;  // after the last commit of this program
};

}  // namespace tessel
