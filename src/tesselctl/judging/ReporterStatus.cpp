#include "tesselctl/judging/ReporterStatus.h"

#include <pwd.h>
#include <sys/stat.h>

#include <memory>

#include "journal/JournalStore.h"
#include "linux/RunRecordFile.h"
#include "linux/Scheduler.h"
#include "linux/StateDirectory.h"
#include "linux/SystemFacts.h"
#include "os/Files.h"
#include "service/ReportingRun.h"
#include "trace/TracePointTable.h"

namespace tessel::ctl {

namespace {

Marker lookForMarker() {
  struct stat facts {};
  Marker marker;
  if (::lstat(cookieFilePath, &facts) != 0) return marker;
  marker.present = true;
  marker.since = Date{std::chrono::seconds{facts.st_mtim.tv_sec}};
  const passwd* user = ::getpwuid(facts.st_uid);
  marker.owner = user != nullptr ? user->pw_name : std::to_string(facts.st_uid);
  return marker;
}

JournalFacts lookAtJournal(const std::optional<std::string>& store) {
  TracePointTable table;
  const StopFlag stop = false;
  auto opened = JournalStore::open(store, TimeRange{}, table, stop);
  JournalFacts facts;
  if (const auto* error = std::get_if<PlatformError>(&opened)) {
    facts.failure = error->words;
    return facts;
  }
  auto& trace = *std::get<std::unique_ptr<JournalStore>>(opened);
  trace.entries().next();  // files whose headers do not tell show their first entry
  if (const auto oldest = trace.report().reading.oldestEntry) {
    facts.oldest = Date{std::chrono::microseconds{static_cast<int64_t>(*oldest)}};
  }
  return facts;
}

}  // namespace

ReporterStatus gatherStatus(const LaunchConfiguration& launch) {
  const StateDirectory state = StateDirectory::forReading(launch.stateDirectory);
  ReporterStatus status;
  status.now = SystemClock().now();
  status.tasking = askTasking(launch);
  status.taskingWords = taskingWords(status.tasking, launch);
  status.deferral = DeferralConditions(launch.deferOn, state.deferFile()).reason();
  status.marker = lookForMarker();
  status.run = readRunRecord(launch.stateDirectory);
  status.lastBegin = state.lastRun();
  SpoolReader spool(launch.stateDirectory);
  status.spoolState = spool.open();
  if (status.spoolState == SpoolReader::State::open) {
    const auto contents = spool.contents();
    if (!contents) status.spoolState = SpoolReader::State::damaged;
    status.spool = contents.value_or(SpoolContents{});
  }
  status.spoolFailure = spool.reason();
  status.store = launch.traceStore;
  status.journal = lookAtJournal(launch.traceStore);
  return status;
}

}  // namespace tessel::ctl
