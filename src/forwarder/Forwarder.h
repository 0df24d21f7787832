// Forwarder: moves events from the spool to a collector, oldest first, each at least once.
//
// A batch that the collector takes is acknowledged in the spool. One that cannot be delivered now
// is tried again after a while, for ever or for a few times. One that is refused is split until the
// record at fault stands alone; that one is set aside with the collector's words, and the others go
// on. An answer that speaks of address or credentials holds everything up, and sets nothing aside;
// so does a row of records that are each refused, with none taken in between.
//
// Threads: one at a time. Waiting ends early when the stop semaphore is signalled.

#pragma once

#include <functional>
#include <span>
#include <string>
#include <vector>

#include "forwarder/Collector.h"
#include "forwarder/Encoder.h"
#include "forwarder/Policy.h"
#include "platform/Log.h"
#include "platform/Queues.h"
#include "platform/System.h"
#include "statora/ForwarderState.h"

namespace tessel {

// The log of this program. Its category is the program's name, by which `journalctl -t` finds it.
inline constexpr LogHandle kForwarderLog("com.vantor.TesselSupport", "statora_forwarder");

struct ForwarderOptions {
  size_t maxRecords = 512;            // in a batch
  size_t maxBytes = size_t{1} << 20;  // of a batch's body, unless one record alone has more
  uint32_t maxAttempts = 0;           // at one batch before giving up; 0: for ever
  std::chrono::milliseconds firstRetry{5000};
  std::chrono::milliseconds longestRetry{300'000};
  uint32_t refusalsInARow = 16;     // records set aside until it is taken for no fault of theirs
  uint64_t recordsPerSecond = 100;  // 0: no limit
};

// How an attempt at everything that waits ended.
enum class ForwarderOutcome {
  delivered,    // nothing waits any more
  stopped,      // asked to
  unreachable,  // gave up for now
  held,         // the collector takes nothing, and waiting a little would not help
  spoolFailed,  // the spool cannot be read or changed
};

class Forwarder {
 public:
  // The outside that it works with; everything outlives it. `chance` draws from [0, 1).
  struct World {
    ForwarderState& state;
    const Encoder& encoder;
    Collector& collector;
    Clock& clock;
    ServiceStatus& status;
    Semaphore& stop;
    std::function<double()> chance;
  };

  Forwarder(World world, const ForwarderOptions& options);

  // Delivers until nothing waits. REQUIRES: the state is open.
  ForwarderOutcome deliverAll();
  // Why the last outcome was not `delivered`, in words.
  const std::string& reason() const { return reason_; }

 private:
  using Records = std::span<const OutgoingRecord>;
  enum class Sent { accepted, refused, failed };

  ForwarderOutcome deliverBatch(const Batch& batch);
  // For `failed`, `outcome_` tells how.
  Sent send(Records part);
  bool waitToRetry(const CollectorAnswer& answer, uint32_t failures);
  Sent settle(Records part, const CollectorAnswer& answer);
  bool setAside(const SpooledEvent& event, int64_t status, const std::string& words);
  bool takeBreak(std::chrono::nanoseconds time);
  Sent fail(ForwarderOutcome outcome, std::string reason);
  void sayProgress();
  std::chrono::nanoseconds ticks();

  World world_;
  const ForwarderOptions options_;
  const Backoff backoff_;
  Pace pace_;
  uint32_t refusals_ = 0;  // records set aside since one was accepted
  ForwarderOutcome outcome_ = ForwarderOutcome::delivered;
  std::string reason_;
};

}  // namespace tessel
