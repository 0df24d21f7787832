// Gathering what the service left on this machine.
//
// A question for the status must not delay a run, so nothing here holds the lock of a run for
// longer than an instant. The price: if a run ends while we look, the facts may come from two
// moments.

#include "tesselctl/judging/ReporterStatus.h"

#include <pwd.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <memory>

#include "journal/JournalStore.h"
#include "linux/RunRecordFile.h"
#include "linux/Scheduler.h"
#include "linux/StateDirectory.h"
#include "linux/SystemFacts.h"
#include "os/Files.h"
#include "service/ReportingRun.h"
#include "tesselctl/judging/ServiceUser.h"
#include "trace/TracePointTable.h"

namespace tessel::ctl {

namespace {

// What the package installs. The unit binds the last directory over /var/tmp. Only the service's
// user and root may look into it.
constexpr char kPackageStateDirectory[] = "/var/lib/tessel";
constexpr char kTimer[] = "tessel-reporter.timer";
constexpr char kUnitMarkerDirectory[] = "/var/lib/tessel-marker";

Marker lookForMarker(MarkerOf of, std::string path, uid_t service) {
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
  marker.ofService = facts.st_uid == service;
  marker.since = Date{std::chrono::seconds{facts.st_mtim.tv_sec}};
  // The user may be gone: a number still tells who made the marker.
  const passwd* user = ::getpwuid(facts.st_uid);
  marker.owner = user != nullptr ? user->pw_name : std::to_string(facts.st_uid);
  return marker;
}

std::vector<Marker> lookForMarkers(uid_t service) {
  std::vector<Marker> markers;
  // The package makes the directory, and the unit does not start without it. So a machine without
  // the directory has no run under the unit.
  struct stat facts {};
  if (::lstat(kUnitMarkerDirectory, &facts) == 0) {
    const std::string name = std::filesystem::path(cookieFilePath).filename();
    markers.push_back(lookForMarker(MarkerOf::unit, kUnitMarkerDirectory + ("/" + name), service));
  }
  markers.push_back(lookForMarker(MarkerOf::runByHand, cookieFilePath, service));
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
  // Headers of closed journals tell their oldest entry. An export file has no header, and to read
  // gigabytes for one line of the screen would take minutes. So of such a file we know the first
  // entry.
  trace.entries().next();
  const StoreReport report = trace.report();
  if (const auto oldest = report.reading.oldestEntry) {
    facts.oldest = Date{std::chrono::microseconds{static_cast<int64_t>(*oldest)}};
  }
  facts.mayBeOlder = std::any_of(report.files.begin(), report.files.end(),
                                 [](const auto& file) { return file.path.ends_with(".export"); });
  return facts;
}

void lookAtDeferral(ReporterStatus& status, const LaunchConfiguration& launch,
                    const StateDirectory& state) {
  const DeferralConditions conditions(launch.deferOn, state.deferFile());
  for (const DeferReason reason : {conditions.byFile(), conditions.byMachine()}) {
    if (reason == DeferReason::none) continue;
    status.deferral = conditions.words(reason);
    // The scheduler notes how long the machine has put the run off, in all.
    status.deferredSince =
        reason == DeferReason::file ? fileTime(state.deferFile()) : status.now - state.putOff();
    return;
  }
}

void lookAtRuns(ReporterStatus& status, const StateDirectory& state) {
  auto read = readRunHistory(state.path());
  if (auto* history = std::get_if<RunHistory>(&read)) {
    status.runs = std::move(history->runs);
    if (status.runs.size() > ReporterStatus::kMaxRuns)
      status.runs.erase(status.runs.begin(), status.runs.end() - ReporterStatus::kMaxRuns);
    status.run = std::move(history->last);
  } else {
    status.recordFailure = std::get<PlatformError>(std::move(read));
  }
  status.recordWritten = fileTime(runRecordPath(state.path()));
  status.underWay = state.isLocked();
  status.refusedFiles = state.refusedFiles();
  status.lastBegin = state.lastRun();
}

void lookAtSpool(ReporterStatus& status, const LaunchConfiguration& launch) {
  SpoolReader spool(launch.stateDirectory);
  status.spoolState = spool.open();
  if (status.spoolState == SpoolReader::State::open) {
    // A database may open well and fail at the first query.
    const auto contents = spool.contents();
    if (!contents) status.spoolState = SpoolReader::State::damaged;
    status.spool = contents.value_or(SpoolContents{});
  }
  status.spoolFailure = spool.reason();
  // The service may have other settings than this shell, so what it noted comes first.
  status.spoolLimitBytes = status.spool.limit.value_or(0);
  if (status.spoolLimitBytes == 0) status.spoolLimitBytes = launch.spoolLimitBytes;
}

// What stands in the way of replacing a file, though the directory may be changed.
std::optional<std::string> obstacle(const std::string& directory) {
  const std::string record = runRecordPath(directory);
  for (const std::string& path : {record, record + ".new"}) {
    struct stat facts {};
    if (::lstat(path.c_str(), &facts) == 0 && S_ISDIR(facts.st_mode))
      return path + " is a directory";
  }
  struct statvfs room {};
  if (::statvfs(directory.c_str(), &room) == 0 && room.f_blocks != 0 && room.f_bavail == 0)
    return directory + ": no space is left";
  return {};
}

ServiceAccess accessOfService(const LaunchConfiguration& launch, const Tasking& tasking,
                              uid_t user) {
  ServiceAccess access;
  // An internal build reports whatever the file says.
  const bool internal = tasking.decision.source() == TaskingSource::internalBuild;
  const auto reading = internal ? std::optional<int>(0) : tryToRead(user, tasking.file);
  access.taskingKnown = reading.has_value();
  if (reading && *reading != 0 && codeOf(*reading) != ErrorCode::notFound)
    access.taskingRefused = fileError(tasking.file, *reading).words;
  struct stat facts {};
  // Without a directory nothing is wrong yet: the first run makes it.
  if (::stat(launch.stateDirectory.c_str(), &facts) != 0) {
    access.recordKnown = errno == ENOENT;
    return access;
  }
  const auto change = tryToChange(user, launch.stateDirectory);
  access.recordKnown = change.has_value();
  if (change && *change != 0)
    access.recordRefused = fileError(launch.stateDirectory, *change).words;
  if (!access.recordRefused) access.recordRefused = obstacle(launch.stateDirectory);
  return access;
}

// A file that we may not reach looks like a file that is absent. Without this a machine that nobody
// may look at would seem to be one that never ran.
std::optional<std::string> refusalOf(const std::string& directory) {
  // With the dot, a file in the place of the directory is no matter of access.
  if (::access((directory + "/.").c_str(), R_OK | X_OK) == 0 || errno != EACCES) return {};
  return fileError("state directory " + directory, EACCES).words;
}

std::vector<std::string> variablesOfThisProcess() {
  std::vector<std::string> names;
  for (char** each = environ; *each != nullptr; ++each) {
    const std::string_view pair = *each;
    if (pair.starts_with("TESSEL_")) names.emplace_back(pair.substr(0, pair.find('=')));
  }
  std::sort(names.begin(), names.end());
  return names;
}

NextRun nextRunOf(const ReporterStatus& status, const LaunchConfiguration& launch) {
  if (status.underWay) return {NextRun::By::underWay, {}};
  const auto interval =
      status.run && status.run->interval ? status.run->interval : launch.activityInterval;
  if (interval) {
    const Date due = status.lastBegin ? *status.lastBegin + *interval : status.now;
    return {NextRun::By::interval, std::max(due, status.now)};
  }
  // The timer of the package starts runs on the state directory of the package.
  if (!status.ofPackage) return {};
  const TimerAnswer timer = askTimer(kTimer);
  if (timer.next) return {NextRun::By::timer, timer.next};
  return {NextRun::By::nothing, {}, timer.answered};
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

std::string_view nextRunName(NextRun::By by) {
  // In the order of NextRun::By, which indexes them.
  static constexpr std::string_view kNames[] = {"nothing", "timer", "interval", "under_way"};
  return kNames[static_cast<size_t>(by)];
}

ReporterStatus gatherStatus(const LaunchConfiguration& launch, Date now) {
  const StateDirectory state = StateDirectory::forReading(launch.stateDirectory);
  const uid_t service = serviceUser(launch.stateDirectory);
  ReporterStatus status;
  status.now = now;
  status.boot = thisBoot();
  status.variables = variablesOfThisProcess();
  status.stateDirectory = launch.stateDirectory;
  status.ofPackage = launch.stateDirectory == kPackageStateDirectory;
  status.stateRefused = refusalOf(launch.stateDirectory);
  status.tasking = askTasking(launch);
  status.taskingWords = taskingWords(status.tasking, launch);
  const bool internal = status.tasking.decision.source() == TaskingSource::internalBuild;
  status.taskingWritten = fileTime(internal ? launch.osReleasePath : status.tasking.file);
  status.service = accessOfService(launch, status.tasking, service);
  lookAtDeferral(status, launch, state);
  status.markers = lookForMarkers(service);
  lookAtRuns(status, state);
  lookAtSpool(status, launch);
  status.nextRun = nextRunOf(status, launch);
  status.store = launch.traceStore;
  status.journal = lookAtJournal(launch.traceStore);
  judge(status);
  return status;
}

}  // namespace tessel::ctl
