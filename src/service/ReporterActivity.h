// handleActivity: what the service does when its background activity changes state.

#pragma once

#include <memory>

#include "platform/System.h"
#include "service/ReportingRun.h"

namespace tessel {

inline constexpr char kActivityName[] = "com.vantor.tessel.tessel_reporter_activity";

class ReporterActivity {
 public:
  ReporterActivity(Runtime& runtime, ReportingRun& run) : runtime_(runtime), run_(run) {}

  // Called by the scheduler on a thread of its own, never twice at a time. Blocks for a whole run.
  void handleActivity(const std::shared_ptr<Activity>& changed);

 private:
  void runOrDefer(const std::shared_ptr<Activity>& activity);

  Runtime& runtime_;
  ReportingRun& run_;
};

}  // namespace tessel
