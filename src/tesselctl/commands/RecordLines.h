// record --stdin: trace points as lines of JSON, one object each.
//
// One thread at a time.

#pragma once

#include <functional>
#include <optional>
#include <string>

#include "tesselctl/commands/Command.h"
#include "tesselctl/commands/RecordedPoint.h"

namespace tessel::ctl {

// Why a point was not recorded, and the exit status that goes with it.
struct Failure {
  ExitStatus status;
  std::string message;
};
using RecordPoint = std::function<std::optional<Failure>(const RecordedPoint&)>;

// Reads lines from `fd` until its end and calls `record` for each point. What a line does not say
// is taken from `defaults`. A line that makes no sense, or whose point is refused, is named on
// stderr by its number, and the next one is read. The exit status tells whether all were recorded:
// kUsage if a line was refused, else the status of the failures.
ExitStatus recordLines(int fd, const RecordedPoint& defaults, const RecordPoint& record);

}  // namespace tessel::ctl
