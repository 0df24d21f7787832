// Forwarder: moves events from the spool to a collector, oldest first, each at least once.
//
// It works in rounds. A round goes through all rows that wait, and ends early when the collector or
// the spool fails. Between two rounds the caller waits for pause(). What must not be forgotten
// between two rounds stands in the forwarder:
//
//  - The rows that the collector has taken and that the spool still holds, because its disk was
//    full or somebody had locked it. Nothing else is sent before they are acknowledged.
//  - Failures and held rounds in a row, and the size of a batch that the collector can take.
//  - In how many rounds a row was refused.
//
// Threads: one at a time. Signalling the stop semaphore ends every wait early.

#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
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
  std::chrono::milliseconds firstRetry{5000};
  std::chrono::milliseconds longestRetry{300'000};
  std::chrono::seconds interval{30};  // between two looks for new events
  std::chrono::seconds hold{300};     // after an answer that holds everything
  uint64_t recordsPerSecond = 100;    // 0: no limit
  std::string destination;            // stands with the delivered rows; see ForwarderSettings
};

// How a round ended.
enum class ForwarderOutcome {
  delivered,    // nothing waits any more
  stopped,      // somebody asked it to stop
  unreachable,  // the collector does not answer, or cannot take anything now
  held,         // the collector refuses everything or some rows, and a short wait would not help
  spoolFailed,  // the spool cannot be read or changed
  lockedOut,    // another forwarder works on the spool
};

class Forwarder {
 public:
  // What it works with. All of it outlives the forwarder. `chance` draws from [0, 1).
  struct World {
    ForwarderState& state;
    const Encoder& encoder;
    Collector& collector;
    Clock& clock;
    Threads& threads;
    ServiceStatus& status;
    Semaphore& stop;
    std::function<double()> chance;
  };

  Forwarder(World world, const ForwarderOptions& options);

  // One round. Opens the spool if it is not open, and does nothing if there is none.
  ForwarderOutcome deliverAll();
  // How long to wait after the last round.
  std::chrono::nanoseconds pause() const { return pause_; }
  // Notes in the spool that the forwarder waits so long by its own settings. `tesselctl status`
  // does not take such a wait for a forwarder that hangs. Does nothing if there is no spool.
  void noteRest(std::chrono::nanoseconds time);
  // Why the last outcome was not `delivered`, in words. Empty after `delivered` and `stopped`.
  const std::string& reason() const { return reason_; }
  // Whether the spool still holds rows that the collector has taken.
  bool owesAcknowledgement() const { return !taken_.empty(); }
  // Tries to acknowledge those. True if it owes nothing any more.
  bool acknowledgeTaken();

 private:
  using Records = std::span<const OutgoingRecord>;
  enum class Sent { accepted, refused, failed };
  // Records that still have to be sent, and the number of accepted requests when one with these
  // records was refused first.
  struct Part {
    Records records;
    uint64_t acceptedBefore;
  };
  // A record that was refused alone. Once another one was accepted, it is asked about again.
  struct Suspect {
    OutgoingRecord record;
    uint64_t acceptedBefore;
  };

  bool open();
  bool deliverRows();
  bool deliverBatch(const Batch& batch);
  bool setMalformedAside(const Batch& batch);
  // After `failed`, `outcome_` and `reason_` say what has failed. Otherwise `answer_` and
  // `verdict_` are those of the request.
  Sent send(Records part);
  bool acknowledge(Records part, uint64_t rejected);
  bool mayGoOn(std::vector<Part>& parts, int64_t lastId);
  bool isAnotherAccepted(std::vector<Part>& parts, int64_t lastId);
  bool askAboutSuspects();
  bool askAgain(const Suspect& suspect);
  bool setAside(const SpooledEvent& event, int64_t status, const std::string& words);
  bool leaveBehind(const std::string& words);
  bool takeBreak(std::chrono::nanoseconds time);
  bool fail(ForwarderOutcome outcome, std::string reason);
  bool failBySpool(const SqliteStatus& status);
  bool failByAnswer();
  void endRound();
  uint64_t settled() const;
  void sayProgress();
  std::chrono::nanoseconds ticks();

  World world_;
  const ForwarderOptions options_;
  const Backoff backoff_;
  Pace pace_;
  BatchSize size_;
  std::chrono::nanoseconds pause_{0};

  // What is remembered from round to round.
  std::vector<SpooledEvent> taken_;  // accepted by the collector, and still in the spool
  uint64_t takenRejected_ = 0;       // how many of them the collector threw away
  uint64_t generation_ = 0;          // of the spool, see ForwarderState::generation()
  bool provedWritable_ = false;      // by as much as an acknowledgement writes
  uint32_t failures_ = 0;            // rounds in a row that ended as `unreachable`
  uint32_t heldRounds_ = 0;          // rounds since everything was delivered that ended as `held`
  uint32_t spoolFailures_ = 0;       // rounds in a row that ended as `spoolFailed`
  std::map<int64_t, uint32_t> refusedRounds_;  // by row: in how many rounds it alone was refused
  uint64_t accepted_ = 0;                      // requests

  // What belongs to the present round.
  ForwarderOutcome outcome_ = ForwarderOutcome::delivered;
  std::string reason_;
  bool probing_ = false;  // whether each answer may be about a record; see mayGoOn()
  CollectorAnswer answer_;
  Verdict verdict_ = Verdict::accepted;
  uint64_t acceptedBeforeRound_ = 0;
  uint32_t refusedInARow_ = 0;  // records refused alone since one was accepted
  uint64_t scouted_ = 0;        // rows sent out of order
  std::vector<Suspect> suspects_;
  size_t leftBehind_ = 0;  // rows that were refused and still wait
  std::string leftBehindWords_;
};

}  // namespace tessel
