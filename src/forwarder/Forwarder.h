// Forwarder: moves events from the spool to a collector, oldest first, each at least once.
//
//  - A batch that the collector takes is acknowledged in the spool.
//  - A batch that it cannot take now is sent again after a while, for ever or a few times.
//  - A batch that it refuses is split until the record at fault stands alone. That record is set
//    aside with the collector's words, and the others are delivered.
//  - An answer about the address or the credentials stops the delivery and sets nothing aside.
//  - Many refused records in a row, with none taken between them, stop the delivery too.
//
// Threads: one at a time. Signalling the stop semaphore ends every wait early.

#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "forwarder/Collector.h"
#include "forwarder/DeliveryPolicy.h"
#include "forwarder/Encoder.h"
#include "platform/Log.h"
#include "platform/Queues.h"
#include "platform/System.h"
#include "statora/ForwarderState.h"

namespace tessel {

// The log of this program. Its category is the program's name, by which `journalctl -t` finds it.
inline constexpr LogHandle kForwarderLog("com.vantor.TesselSupport", "statora_forwarder");

struct ForwarderOptions {
  size_t maxRecords = 512;            // in a batch
  size_t maxBytes = size_t{1} << 20;  // of a batch's records, unless one record alone has more
  uint32_t maxAttempts = 0;           // to send one batch; 0: no limit
  std::chrono::milliseconds firstRetry{5000};
  std::chrono::milliseconds longestRetry{300'000};
  uint32_t refusalsInARow = 16;     // so many mean that the collector itself is at fault
  uint64_t recordsPerSecond = 100;  // 0: no limit
  std::string destination;          // stands with the delivered rows; see ForwarderSettings
};

// How an attempt to deliver everything ended.
enum class ForwarderOutcome {
  delivered,    // nothing waits any more
  stopped,      // somebody asked it to stop
  unreachable,  // gave up for now
  held,         // the collector takes nothing, and a short wait would not help
  spoolFailed,  // the spool cannot be read or changed
};

class Forwarder {
 public:
  // What it works with. All of it outlives the forwarder. `chance` draws from [0, 1).
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
  // After `failed`, `outcome_` and `reason_` say what has failed.
  Sent send(Records part);
  void noteFailure(const CollectorAnswer& answer);
  bool waitToRetry(const CollectorAnswer& answer, uint32_t failures);
  Sent settle(Records part, const CollectorAnswer& answer);
  bool setAside(const SpooledEvent& event, int64_t status, const std::string& words);
  bool takeBreak(std::chrono::nanoseconds time);
  Sent fail(ForwarderOutcome outcome, std::string reason);
  uint64_t settled() const;
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
