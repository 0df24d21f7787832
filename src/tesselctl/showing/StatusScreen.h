// The status of this machine as one screen for people, and as metrics. Stateless; any thread.

#pragma once

#include <string>

#include "tesselctl/judging/ReporterStatus.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

// Facts first, then notes, and problems last. Fit for a terminal.
std::string statusScreen(const ReporterStatus& status, const Terminal& terminal);

// Gauges and counters in the text format of Prometheus.
std::string statusMetrics(const ReporterStatus& status);

}  // namespace tessel::ctl
