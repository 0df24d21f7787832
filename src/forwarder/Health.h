// Health: tells the collector how this machine fares, if the operator wants that.
//
// A health record is an event of its own, tessel.health. It has codes and counts: what `tesselctl
// status` finds, the runs, and what became of the rows. It has no text of the journal. A record is
// made once a day, and when something has changed, but at most once an hour; in an outage, too.
//
// Threads: one at a time.

#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/System.h"
#include "statora/ForwarderState.h"
#include "statora/HealthLedger.h"

namespace tessel {

class Health {
 public:
  static constexpr std::chrono::hours kLongest{24};  // between two records
  static constexpr std::chrono::hours kShortest{1};

  // Reads the files that the service and `tesselctl status --save` keep in `stateDirectory`.
  // `state` outlives this.
  Health(std::string stateDirectory, ForwarderState& state)
      : stateDirectory_(std::move(stateDirectory)), state_(state) {}

  // Lets a record wait for delivery if one is due at `now`. False if none is, or if the spool
  // refuses it; it is tried again at the next look. REQUIRES: the state is open.
  bool look(Date now);
  // Removes what waits. For a forwarder that is to send none. REQUIRES: the state is open.
  void withdraw();

 private:
  const std::string stateDirectory_;
  ForwarderState& state_;
};

}  // namespace tessel
