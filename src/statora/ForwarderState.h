// ForwarderState: the spool as the forwarder sees it, and what the forwarder keeps in it.
//
// A row of `events` is there until a collector has taken it. Acknowledging removes rows, oldest
// first, and moves the counters in one transaction, so that a forwarder that dies before it sends
// them again under the same identifiers, and nothing is lost. Beside `events` stand
//
//   forwarder            name and value of each counter
//   forwarder_set_aside  rows that the collector refused, with when, its status and its words
//
// Rows are removed in small steps, each a transaction of its own, and none flushes the disk (a lost
// acknowledgement only repeats a delivery), so that the service's sends hardly ever wait for it.
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
#include "statora/Sqlite.h"

namespace tessel {

struct SpooledEvent {
  int64_t id = 0;
  int64_t time = 0;  // microseconds since 1970
  std::string name;
  std::string payload;  // a JSON object, unless the spool was tampered with
};

// What the forwarder did with this spool, ever.
struct ForwarderCounters {
  uint64_t delivered = 0;        // records that a collector took, those it then rejected included
  uint64_t rejected = 0;         // of these: told to be rejected in a partial success
  uint64_t setAside = 0;         // records that were refused and set aside
  uint64_t setAsideDropped = 0;  // of these: the oldest, given up to stay within the limit
  uint64_t requests = 0;
  uint64_t retries = 0;
  uint64_t bytesSent = 0;    // of request bodies, as sent
  uint64_t position = 0;     // id of the last row that was delivered
  uint64_t lastSuccess = 0;  // microseconds since 1970; 0: never

  bool operator==(const ForwarderCounters&) const = default;
};

// Nothing where no forwarder ever worked on this spool.
std::optional<ForwarderCounters> readForwarderCounters(SqliteDatabase& database);

class ForwarderState {
 public:
  static constexpr uint64_t kDefaultMaxSetAside = 10'000;

  explicit ForwarderState(std::string stateDirectory, uint64_t maxSetAside = kDefaultMaxSetAside);

  // Whether there is a spool.
  bool exists() const;
  // Opens the spool, with which nothing happens where it is open already and still the one that
  // stands there. Never makes one: that there is none is a failure like others.
  SqliteStatus open();
  // The same without leave to change anything.
  SqliteStatus openReadOnly();
  // The following REQUIRE an open spool.
  const std::string& spoolId() const { return spoolId_; }

  // The oldest rows with an id above `after`: up to `maxRows`, and no more once they hold
  // `maxBytes`. None where that fails; see status().
  std::vector<SpooledEvent> oldest(size_t maxRows, size_t maxBytes, int64_t after = 0);
  SqliteStatus status() const { return database_.status(); }
  // How many rows wait, judged by their ids.
  uint64_t waiting();

  // The counters to be stored with the next acknowledgement or setting aside.
  ForwarderCounters& counters() { return counters_; }
  // Counts the rows as delivered and removes them.
  SqliteStatus acknowledge(std::span<const int64_t> ids, Date now);
  SqliteStatus setAside(const SpooledEvent& event, int64_t collectorStatus, std::string_view words,
                        Date now);
  // Stores the counters alone.
  SqliteStatus storeCounters();
  // Puts what was set aside back among what waits; how many rows, or nothing where it fails.
  std::optional<int64_t> requeue();
  // Gives up to `pages` pages of free space back to the file system; false when there is none.
  bool shrink(int pages);

 private:
  SqliteStatus openFresh(SqliteDatabase::Mode mode);
  SqliteStatus prepareStatements();
  bool isStillThere() const;
  SqliteStatus remove(std::span<const int64_t> ids);
  bool writeCounters();
  SqliteStatus finish(bool good);

  const std::string path_;
  const uint64_t maxSetAside_;
  SqliteDatabase database_;
  uint64_t device_ = 0;
  uint64_t inode_ = 0;
  std::string spoolId_;
  ForwarderCounters counters_;
  SqliteStatement select_, remove_, keep_, trim_, count_;
};

}  // namespace tessel
