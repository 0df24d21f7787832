// status: does this machine report, and is all well with it?
//
// Scripts act on the exit status, so it is bad exactly where there is a problem. Notes tell what
// any user of the machine can cause; they do not change it.

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <functional>

#include "linux/StateDirectory.h"
#include "os/Files.h"
#include "statora/SpoolFile.h"
#include "tesselctl/commands/Command.h"
#include "tesselctl/judging/ReporterStatus.h"
#include "tesselctl/showing/Losses.h"
#include "tesselctl/showing/StatusScreen.h"
#include "tesselctl/showing/SummaryOutput.h"

namespace tessel::ctl {

namespace {

// A run that reported nothing by design stores no rows, not even the one of the summary. Its rows
// would not balance, so a script finds the two balances only if there are books.
void writeRun(JsonWriter& json, const RunRecord& run, bool hasBooks) {
  json.member("start", run.start).member("end", run.end);
  json.member("outcome", runOutcomeName(run.outcome));
  if (!run.failure.empty()) json.member("failure", run.failure);
  json.member("log_events", run.logEvents).member("inspected", run.inspected);
  addVerdicts(json, run.classified);
  json.member("unnamed", run.unnamed).member("unsendable", run.unsendable);
  json.member("count_events", run.countEvents);
  json.member("rows_stored", run.rowsStored);
  // A run without books stores no row. The formula would still expect the row of the summary.
  json.member("rows_expected", hasBooks ? run.rowsExpected() : 0);
  json.object("rows_failed", [&] {
    for (const auto& [reason, count] : run.rowsFailed) json.member(reason, count);
  });
  json.member("rows_expired", run.rowsExpired);
  json.object("totals", [&] {
    json.member("expired", run.totals.expired);
    json.object("failed", [&] {
      for (const auto& [reason, count] : run.totals.failed) json.member(reason, count);
    });
  });
  if (hasBooks) {
    json.member("objects_balance", run.objectsBalance());
    json.member("rows_balance", run.rowsBalance());
  }
  if (run.reading) json.object("reading", [&] { addReading(json, *run.reading); });
}

void writeRuns(JsonWriter& json, const ReporterStatus& status) {
  json.array("runs", status.runs, [&](const RunNote& note) {
    json.object([&] {
      json.member("start", note.start).member("end", note.end);
      const bool underWay = status.underWay && &note == &status.runs.back();
      json.member("outcome", note.outcome ? runOutcomeName(*note.outcome)
                             : underWay   ? "under_way"
                                          : "died");
    });
  });
}

void writeSpool(JsonWriter& json, const ReporterStatus& status) {
  // In the order of SpoolReader::State, which indexes them.
  static constexpr std::string_view kStates[] = {"open", "absent", "no_access", "damaged"};
  json.member("state", kStates[static_cast<size_t>(status.spoolState)]);
  // A spool that we could not read has no figures. Zero rows would pass for an empty spool.
  if (status.spoolState == SpoolReader::State::open) {
    json.member("rows", status.spool.rows).member("bytes", status.spool.bytes);
    json.member("used_bytes", status.spool.bytesOfWaiting).member("limit", status.spoolLimitBytes);
    json.member("oldest", status.spool.oldest).member("newest", status.spool.newest);
  } else {
    json.member("reason", status.spoolFailure);
  }
}

// The first marker that is present speaks for the object, and `places` tells of each place.
void writeMarkers(JsonWriter& json, const std::vector<Marker>& markers) {
  const auto owned = [&json](const Marker& marker) {
    if (marker.present()) json.member("owner", marker.owner).member("since", marker.since);
  };
  const auto first = std::find_if(markers.begin(), markers.end(), std::mem_fn(&Marker::present));
  json.member("present", first != markers.end());
  if (first != markers.end()) owned(*first);
  json.array("places", markers, [&](const Marker& marker) {
    json.object([&] {
      json.member("of", markerOfName(marker.of)).member("path", marker.path);
      json.member("state", markerStateName(marker.state));
      owned(marker);
    });
  });
}

void writeForwarder(JsonWriter& json, const ForwarderCounters& counters) {
  json.member("delivered", counters.delivered).member("rejected", counters.rejected);
  json.member("set_aside", counters.setAside);
  json.member("requests", counters.requests).member("retries", counters.retries);
  json.member("refused_requests", counters.refusedRequests);
  json.member("failed_requests", counters.failedRequests);
  json.member("bytes_sent", counters.bytesSent).member("position", counters.position);
  // A 0 says that it has never succeeded. Other times are left out where they are not known, since
  // a script would take them for dates of 1970.
  json.member("last_success", counters.lastSuccess);
  if (counters.nextAttempt != 0)
    json.member("rests_since", counters.restsSince).member("next_attempt", counters.nextAttempt);
  if (counters.lastErrorAt == 0) return;
  json.member("last_error", counters.lastError).member("last_error_at", counters.lastErrorAt);
  if (counters.orderedUntil != 0) json.member("ordered_until", counters.orderedUntil);
}

void writeFindings(JsonWriter& json, std::string_view name, const std::vector<Finding>& findings,
                   bool problems) {
  std::vector<Finding> wanted;
  std::copy_if(findings.begin(), findings.end(), std::back_inserter(wanted),
               [&](const Finding& found) { return isProblem(found.code) == problems; });
  json.array(name, wanted, [&](const Finding& found) {
    json.object([&] {
      json.member("code", findingName(found.code)).member("words", found.words);
      json.member("since", found.since).member("advice", found.advice);
      json.member("command", found.command);
      if (found.because) json.member("because", findingName(*found.because));
    });
  });
}

// A member stands for a fact that exists: without a run there is no "last_run", without a forwarder
// no "forwarder". Zeros in their place would say that a run counted nothing.
std::string statusJson(const ReporterStatus& status) {
  return objectLine([&](JsonWriter& json) {
    json.member("good", status.good());
    // The verdict comes first: whoever looks at a long line by eye wants that.
    json.member("time", status.now).member("version", TESSEL_VERSION);
    json.array("checked", status.checked, [&](FindingCode code) { json.value(findingName(code)); });
    writeFindings(json, "problems", status.findings, true);
    writeFindings(json, "notes", status.findings, false);
    json.object("tasking", [&] {
      json.member("tasked", status.tasking.decision.on());
      json.member("source", taskingSourceName(status.tasking.decision.source()));
      json.member("file", status.tasking.file);
      if (!status.tasking.rollout) return;
      json.member("share", status.tasking.rollout->percent());
      json.member("cohort", status.tasking.rollout->cohort);
      json.member("in_share", status.tasking.inShare());
    });
    json.object("next_run", [&] {
      json.member("by", nextRunName(status.nextRun.by)).member("at", status.nextRun.at);
    });
    json.object("deferral", [&] {
      json.member("wanted", status.deferral.has_value()).member("reason", status.deferral);
    });
    json.object("marker", [&] { writeMarkers(json, status.markers); });
    json.array("refused_files", status.refusedFiles,
               [&](const PlatformError& error) { json.value(error.words); });
    if (status.run)
      json.object("last_run", [&] { writeRun(json, *status.run, status.hasBooks()); });
    writeRuns(json, status);
    json.member("last_begin", status.lastBegin);
    json.object("spool", [&] { writeSpool(json, status); });
    if (status.spool.forwarder)
      json.object("forwarder", [&] { writeForwarder(json, *status.spool.forwarder); });
    json.object("journal", [&] {
      json.member("oldest", status.journal.oldest).member("keeps_a_day", status.keepsADay());
      if (status.journal.failure) json.member("failure", status.journal.failure->words);
    });
  });
}

struct StatusOptions {
  bool json = false;
  bool save = false;
  std::optional<std::string> prometheus;
};

// Both programs that use the spool are of the group of its directory, and so must be able to write
// what we make there. An exporter that reads our metrics is of no group of ours.
constexpr mode_t kShareWithGroup = 0007;
constexpr mode_t kShareWithAll = 0022;
constexpr unsigned kReadableByGroup = 0640;
constexpr unsigned kReadableByAll = 0644;

// The forwarder believes only files of the directory's owner. A spool of anybody else would be
// refused by the service.
std::optional<PlatformError> refusalToSave(const std::string& directory) {
  struct stat facts {};
  if (::stat(directory.c_str(), &facts) != 0) return fileError(directory, errno);
  if (facts.st_uid == ::geteuid()) return {};
  return PlatformError{ErrorCode::noAccess, directory + ": it belongs to user " +
                                                std::to_string(facts.st_uid) +
                                                ", and only its owner can save a status there"};
}

// A machine that is not tasked has no spool. The forwarder delivers health records from one and
// cannot make it, because the service would not believe a spool of the forwarder's.
void makeSpool(const std::string& directory) {
  const std::string path = directory + "/" + kSpoolFileName;
  if (::access(path.c_str(), F_OK) == 0) return;
  SqliteDatabase database;
  // No patience: if another process makes the spool in this moment, there is one. A failure is seen
  // by the next look, ten minutes later.
  openSpoolDatabase(database, path, 0);
}

std::optional<PlatformError> writeFiles(const StatusOptions& options,
                                        const ReporterStatus& status) {
  if (options.save) {
    ::umask(kShareWithGroup);
    if (auto refused = refusalToSave(status.stateDirectory)) return refused;
    makeSpool(status.stateDirectory);
    const std::string path = status.stateDirectory + "/" + kSavedStatusName;
    if (auto failed = replaceFileDurably(path, statusJson(status), kReadableByGroup)) return failed;
  }
  if (!options.prometheus) return {};
  ::umask(kShareWithAll);
  return replaceFileDurably(*options.prometheus, statusMetrics(status), kReadableByAll);
}

int runStatus(const StatusOptions& options, const Surroundings& surroundings) {
  checkZone();
  const ReporterStatus status = gatherStatus(surroundings.launch, surroundings.now);
  const bool toFiles = options.save || options.prometheus;
  // A timer wants no screen in the journal every ten minutes.
  if (options.json || !toFiles)
    print(options.json ? statusJson(status) : statusScreen(status, surroundings.terminal));
  flushOutput();
  if (const auto failed = writeFiles(options, status)) return failToWrite(*failed);
  if (status.good()) return kDone;
  // What this user may not see outranks what he sees, since another user may get another answer.
  // The screen is printed first: facts that he may see are worth showing.
  const Finding& first = status.findings.front();
  if (first.code != FindingCode::noAccess) return kBad;
  return fail(kNoAccess, first.words + "; " + first.command + " shows all");
}

// Problems first, as in the list of codes.
// The help has shorter words than docs/operating.md: a list that is longer than a screen is not
// read.
constexpr const char* kMeanings[] = {
    "this user may not look at the state of the service",
    "the service's user cannot read the tasking file, or it says neither yes nor no",
    "the service's user cannot write the record of a run",
    "the run marker is not the service's own, or could not be removed",
    "runs are put off for a day",
    "the trace store cannot be opened, or the last run could not read files of it",
    "the last run met damage in the trace store",
    "the spool cannot be read as what it is",
    "rows wait, and the forwarder has delivered none for two hours",
    "the spool is over 80 % full",
    "the last run failed",
    "two of the last four runs died, or read nothing because one had died",
    "the spool refused rows of the last run",
    "since the last run rows left the spool undelivered because of their age",
    "the sums of the last run do not agree",
    "reporting is on, and no run has read its day for 36 hours",
    "reporting is on, and the timer of the package is not active",
    "a deferral or the limit on its time ended the last run early",
    "programs recorded trace points that the journal did not take",
    "the journal daemon dropped entries",
    "a writer had more than his share",
    "entries miss a field of a trace point, or hold a bad one",
    "entries are in no file of the store: vacuumed, not exported or lost",
    "the store reaches back less than a day",
    "a damaged spool was set aside",
};
static_assert(std::size(kMeanings) == kFindingCodes, "codes index the meanings");

CommandText statusText() {
  std::vector<HelpRow> problems;
  std::vector<HelpRow> notes;
  for (size_t at = 0; at < kFindingCodes; ++at) {
    const auto code = static_cast<FindingCode>(at);
    (isProblem(code) ? problems : notes).push_back({std::string(findingName(code)), kMeanings[at]});
  }
  return {"status", "Say whether this machine reports, and whether all is well",
          helpText(
              "Exit status 0 if there is no problem, 1 if there is one, 4 if this user may not "
              "look. A problem concerns the state now or the last run, and goes by itself once "
              "the state is well. It comes with advice and a command. Without a problem the last "
              "line says good; off, where reporting is off; or idle, where nothing starts a run.") +
              helpTable("Problems", problems) +
              helpTable("Notes, which leave the exit status alone", notes) +
              helpEnvironment({"TESSEL_STATE_DIR", "TESSEL_CONFIG_DIR", "TESSEL_TRACE_STORE",
                               "TESSEL_OS_RELEASE", "TESSEL_DEFER_ON", "TESSEL_ACTIVITY_INTERVAL",
                               "TESSEL_SPOOL_LIMIT", "TZ"}) +
              "Example: warn from a cron job\n"
              "  tesselctl status >/dev/null || tesselctl status | mail -s tessel root"};
}

}  // namespace

void addStatusCommand(CLI::App& app, Invocation& invocation) {
  const auto [command, options] = addCommand(app, invocation, statusText(), runStatus);
  command.add_flag("--json", options.json,
                   "One JSON object: good, checked, problems, notes, and the facts");
  command.add_flag("--save", options.save,
                   "Keep the JSON as status.json in the state directory, for the forwarder");
  command
      .add_option("--prometheus", options.prometheus,
                  "Replace FILE by metrics, for the node exporter")
      ->type_name("FILE");
}

}  // namespace tessel::ctl
