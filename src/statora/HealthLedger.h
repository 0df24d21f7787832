// HealthLedger: the forwarder's own event, tessel.health, among the rows of the spool.
//
// A health record is a row of `events`, so the forwarder delivers it like every other row: under
// the same identifier each time, with the same waits, and with a copy in `forwarder_delivered`. A
// newer record takes the place of one that still waits, because only the latest state of a machine
// counts and a collector that was away for a week wants no week of them. One that alone knows of a
// run waits on.
//
// What the ledger remembers stands in the table `forwarder`, in the transaction that inserts the
// row. So after a kill the next forwarder neither repeats a record nor leaves one out.
//
// Threads: one at a time.

#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/System.h"
#include "statora/Sqlite.h"

namespace tessel {

inline constexpr char kHealthEvent[] = "tessel.health";

// What became of the rows that this spool ever had:
// stored = waiting + setAside + withdrawn + those that were delivered + those that expired.
struct SpoolBooks {
  uint64_t stored = 0;     // ids that were ever given
  uint64_t waiting = 0;    // rows of `events`
  uint64_t setAside = 0;   // rows of `forwarder_set_aside`
  uint64_t withdrawn = 0;  // health records that a newer one replaced
};

// The numbers of the runs that a record tells: none if `last` is below `first`.
struct RunRange {
  uint64_t first = 1;
  uint64_t last = 0;
};

// The last health record of this spool.
struct LastHealth {
  Date made{};        // 1970 if there was none
  std::string facts;  // see HealthLedger::put()
  // The number of the newest run that was told by a record which a collector has taken, or by one
  // that waits and keeps its place.
  uint64_t runTaken = 0;
  std::optional<RunRange> waiting;  // of the last record. Absent if it does not wait
};

class HealthLedger {
 public:
  // REQUIRES: the spool is open for writing, with the tables of the forwarder, for as long as this
  // is used.
  explicit HealthLedger(SqliteDatabase& database) : database_(database) {}

  LastHealth last();
  // Absent if the spool cannot be read.
  std::optional<SpoolBooks> books();
  // What becomes of the last record if it still waits.
  enum class Before { replaced, kept };
  // Lets a record wait for delivery. The ledger remembers `facts`, by which the caller sees later
  // whether anything has changed, and the runs that the record tells.
  SqliteStatus put(std::string_view payload, std::string_view facts, RunRange runs, Before before,
                   Date now);
  // Removes what waits, and forgets that there were records. Does nothing if there were none.
  SqliteStatus withdrawAll();

 private:
  int64_t number(std::string_view name);
  bool remember(std::string_view name, int64_t value);
  SqliteStatus finish(bool good);

  SqliteDatabase& database_;
};

}  // namespace tessel
