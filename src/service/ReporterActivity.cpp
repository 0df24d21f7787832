// Check-in, run and defer.

#include "service/ReporterActivity.h"

#include "platform/Log.h"

namespace tessel {

namespace {
constexpr char kTransactionName[] = "com.vantor.tessel.tessel_reporter_activity transaction";
}

void ReporterActivity::handleActivity(const std::shared_ptr<Activity>& changed) {
  // Kept until the transaction is closed.
  // NOLINTNEXTLINE(performance-unnecessary-copy-initialization)
  const std::shared_ptr<Activity> activity = changed;
  const auto transaction = runtime_.openTransaction(kTransactionName);
  const int64_t state = activity->state();
  if (state == kActivityStateRun) {
    runOrDefer(activity);
  } else if (state == kActivityStateCheckIn) {
    tesselReporterLog().debug("Checking in\n");
  } else {
    tesselReporterLog().debug("Unknown state %ld\n", state);
  }
  runtime_.requestCleanExit();
}

void ReporterActivity::runOrDefer(const std::shared_ptr<Activity>& activity) {
  if (activity->shouldDefer() && activity->setState(kActivityStateDefer)) {
    tesselReporterLog().debug("Deferred tessel_reporter\n");
    return;
  }
  run_.performReportingRun(activity);
}

}  // namespace tessel
