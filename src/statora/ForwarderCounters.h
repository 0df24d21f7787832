// The counters of the forwarder, which stand in the spool: how they are read and written.

#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/System.h"
#include "statora/Sqlite.h"

namespace tessel {

// What the forwarder has done with this spool since the spool was made.
struct ForwarderCounters {
  uint64_t delivered = 0;  // records that a collector took, including rejected ones
  uint64_t rejected = 0;   // of the delivered ones: those that the collector threw away
  uint64_t setAside = 0;   // records that were refused and set aside
  uint64_t requests = 0;
  uint64_t refusedRequests = 0;  // of the requests: those with an answer that was no success
  uint64_t failedRequests = 0;   // of the requests: those without a whole answer
  uint64_t retries = 0;          // times that it waited because nothing could be sent
  uint64_t bytesSent = 0;        // of request bodies, as sent
  uint64_t position = 0;         // id of the last row that was delivered
  uint64_t lastSuccess = 0;      // microseconds since 1970; 0: never
  // Why the collector took nothing when it was last asked in vain. A later success leaves it as it
  // is. The words are one line that is fit for a terminal.
  std::string lastError;
  uint64_t lastErrorAt = 0;   // microseconds since 1970; 0: never
  uint64_t orderedUntil = 0;  // until when the collector then asked us to wait; 0: it did not
  // The last long wait that nobody ordered: for the next look, or for the turn at a start. Without
  // it a forwarder that waits by its settings looks like one that hangs.
  uint64_t restsSince = 0;   // microseconds since 1970; 0: there was none
  uint64_t nextAttempt = 0;  // its end

  // `tesselctl status` allows a silence of two hours. Shorter waits need no note, and a note every
  // 30 seconds would keep an idle disk awake.
  static constexpr std::chrono::minutes kLongRest{10};
  // Takes note of a wait that begins now. False if it is too short to be worth storing.
  bool rest(Date now, std::chrono::nanoseconds time);

  bool operator==(const ForwarderCounters&) const = default;
};

// Absent if no forwarder ever worked on this spool. A number that makes no sense comes back as the
// nearest one that does, so that sums of these numbers cannot overflow.
std::optional<ForwarderCounters> readForwarderCounters(SqliteDatabase& database);
// Stores the counters in a transaction of the caller. `insert` is a prepared kInsertCounter.
bool writeForwarderCounters(SqliteStatement& insert, const ForwarderCounters& counters);
inline constexpr char kInsertCounter[] = "INSERT OR REPLACE INTO forwarder VALUES(?1, ?2)";

// A time as the counters keep it. A clock before 1970 is wrong, and counts as 1970.
uint64_t microsecondsSince1970(Date date);

}  // namespace tessel
