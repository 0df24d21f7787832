// Tasking: whether this machine reports, and what says so.
//
// The service's own rules decide, from the same files. Stateless.

#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "linux/LaunchConfiguration.h"
#include "tasking/TaskingGate.h"
#include "tesselctl/judging/Rollout.h"

namespace tessel::ctl {

struct Tasking {
  TaskingDecision decision;
  std::string failure;             // why the file could not be looked at; empty if it could
  std::string file;                // of the configuration, there or not
  std::optional<Rollout> rollout;  // the last that decided; absent if none did
  std::optional<uint32_t> place;   // of this machine in it; absent if it has no machine id

  bool unreadable = false;  // this user may not read the file; the service perhaps may

  // Whether it is known that the machine reports nothing.
  bool isOff() const {
    return !decision.on() && decision.source() != TaskingSource::unknown && !unreadable;
  }
  bool inShare() const { return rollout && place && *place < rollout->share; }
};

std::string taskingFile(const LaunchConfiguration& launch);
Tasking askTasking(const LaunchConfiguration& launch);

// "internal_build", "configuration", "absent", "unusable", "unknown".
std::string_view taskingSourceName(TaskingSource source);
// Where the answer comes from, in words.
std::string taskingWords(const Tasking& tasking, const LaunchConfiguration& launch);

}  // namespace tessel::ctl
