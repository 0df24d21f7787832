// Gathering what the service left on this machine.
//
// A question for the status must not delay a run, so nothing here takes the lock of a run. The
// price: if a run ends while we look, the facts may come from two moments.

#include "tesselctl/judging/ReporterStatus.h"

#include <pwd.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <memory>

#include "journal/JournalStore.h"
#include "linux/RunRecordFile.h"
#include "linux/Scheduler.h"
#include "linux/StateDirectory.h"
#include "service/ReportingRun.h"
#include "trace/TracePointTable.h"

namespace tessel::ctl {

namespace {

// The unit binds this directory over /var/tmp. Only the service's user and root may look into it.
constexpr char kUnitMarkerDirectory[] = "/var/lib/tessel-marker";

Marker lookForMarker(MarkerOf of, std::string path) {
  struct stat facts {};
  Marker marker;
  marker.of = of;
  marker.path = std::move(path);
  // The service takes anything of that name for a marker, so a broken link counts too.
  if (::lstat(marker.path.c_str(), &facts) != 0) {
    // After any error but these two a marker may still be there.
    if (errno != ENOENT && errno != ENOTDIR) marker.state = Marker::State::cannotBeSeen;
    return marker;
  }
  marker.state = Marker::State::present;
  marker.since = Date{std::chrono::seconds{facts.st_mtim.tv_sec}};
  // The user may be gone: a number still tells who made the marker.
  const passwd* user = ::getpwuid(facts.st_uid);
  marker.owner = user != nullptr ? user->pw_name : std::to_string(facts.st_uid);
  return marker;
}

std::vector<Marker> lookForMarkers() {
  std::vector<Marker> markers;
  // The package makes the directory, and the unit does not start without it. So a machine without
  // the directory has no run under the unit.
  struct stat facts {};
  if (::lstat(kUnitMarkerDirectory, &facts) == 0) {
    const std::string name = std::filesystem::path(cookieFilePath).filename();
    markers.push_back(lookForMarker(MarkerOf::unit, kUnitMarkerDirectory + ("/" + name)));
  }
  markers.push_back(lookForMarker(MarkerOf::runByHand, cookieFilePath));
  return markers;
}

JournalFacts lookAtJournal(const std::optional<std::string>& store) {
  TracePointTable table;
  const StopFlag stop = false;
  auto opened = JournalStore::open(store, TimeRange{}, table, stop);
  JournalFacts facts;
  if (auto* error = std::get_if<PlatformError>(&opened)) {
    facts.failure = std::move(*error);
    return facts;
  }
  auto& trace = *std::get<std::unique_ptr<JournalStore>>(opened);
  // Headers of closed journals tell their oldest entry. An export file has no header: it shows its
  // oldest entry only once it is read.
  trace.entries().next();
  if (const auto oldest = trace.report().reading.oldestEntry) {
    facts.oldest = Date{std::chrono::microseconds{static_cast<int64_t>(*oldest)}};
  }
  return facts;
}

std::optional<std::string> deferralNow(const LaunchConfiguration& launch,
                                       const StateDirectory& state) {
  const DeferralConditions conditions(launch.deferOn, state.deferFile());
  for (const DeferReason reason : {conditions.byFile(), conditions.byMachine()}) {
    if (reason != DeferReason::none) return conditions.words(reason);
  }
  return {};
}

}  // namespace

std::string_view markerOfName(MarkerOf kind) { return kind == MarkerOf::unit ? "unit" : "by_hand"; }

std::string_view markerStateName(Marker::State state) {
  switch (state) {
    case Marker::State::absent:
      return "absent";
    case Marker::State::present:
      return "present";
    case Marker::State::cannotBeSeen:
      break;
  }
  return "cannot_be_seen";
}

ReporterStatus gatherStatus(const LaunchConfiguration& launch, Date now) {
  const StateDirectory state = StateDirectory::forReading(launch.stateDirectory);
  ReporterStatus status;
  status.now = now;
  status.tasking = askTasking(launch);
  status.taskingWords = taskingWords(status.tasking, launch);
  status.deferral = deferralNow(launch, state);
  status.markers = lookForMarkers();
  status.run = readRunRecord(launch.stateDirectory);
  status.refusedFiles = state.refusedFiles();
  status.lastBegin = state.lastRun();
  SpoolReader spool(launch.stateDirectory);
  status.spoolState = spool.open();
  if (status.spoolState == SpoolReader::State::open) {
    // A database may open well and fail at the first query.
    const auto contents = spool.contents();
    if (!contents) status.spoolState = SpoolReader::State::damaged;
    status.spool = contents.value_or(SpoolContents{});
  }
  status.spoolFailure = spool.reason();
  status.store = launch.traceStore;
  status.journal = lookAtJournal(launch.traceStore);
  judge(status);
  return status;
}

}  // namespace tessel::ctl
