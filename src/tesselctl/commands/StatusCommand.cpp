// status: does this machine report, and do the books balance?
//
// Scripts act on the exit status, so it is bad only if the reporter itself failed. The screen also
// shows entries that the journal lost and a machine that is not tasked. Neither is a failure of the
// reporter, so neither changes the exit status.

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <functional>

#include "os/Files.h"
#include "platform/Text.h"
#include "tesselctl/commands/Command.h"
#include "tesselctl/judging/ReporterStatus.h"
#include "tesselctl/showing/Losses.h"
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

void writeSpool(JsonWriter& json, const ReporterStatus& status) {
  // In the order of SpoolReader::State, which indexes them.
  static constexpr std::string_view kStates[] = {"open", "absent", "no_access", "damaged"};
  json.member("state", kStates[static_cast<size_t>(status.spoolState)]);
  // A spool that we could not read has no figures. Zero rows would pass for an empty spool.
  if (status.spoolState == SpoolReader::State::open) {
    json.member("rows", status.spool.rows).member("bytes", status.spool.bytes);
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
  json.member("set_aside_dropped", counters.setAsideDropped);
  json.member("requests", counters.requests).member("retries", counters.retries);
  json.member("bytes_sent", counters.bytesSent).member("position", counters.position);
  json.member("last_success", counters.lastSuccess);
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
    json.array("checked", status.checked, [&](FindingCode code) { json.value(findingName(code)); });
    writeFindings(json, "problems", status.findings, true);
    writeFindings(json, "notes", status.findings, false);
    json.object("tasking", [&] {
      json.member("tasked", status.tasking.decision.on());
      json.member("source", taskingSourceName(status.tasking.decision.source()));
      json.member("file", status.tasking.file);
    });
    json.object("deferral", [&] {
      json.member("wanted", status.deferral.has_value()).member("reason", status.deferral);
    });
    json.object("marker", [&] { writeMarkers(json, status.markers); });
    json.array("refused_files", status.refusedFiles,
               [&](const PlatformError& error) { json.value(error.words); });
    if (status.run)
      json.object("last_run", [&] { writeRun(json, *status.run, status.hasBooks()); });
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

// One screen for a human.
class Screen {
 public:
  Screen(const ReporterStatus& status, const Terminal& terminal)
      : status_(status),
        terminal_(terminal),
        store_(status.store.value_or("the journal of this machine")) {}

  std::string render() {
    line("Tasking", status_.tasking.decision.on() ? "on" : "off",
         status_.tasking.decision.on() ? Colour::good : Colour::caution, status_.taskingWords);
    line("Deferral", status_.deferral ? "wanted" : "none",
         status_.deferral ? Colour::caution : Colour::plain,
         status_.deferral.value_or("nothing speaks against a run now"));
    lastRun();
    for (const Marker& each : status_.markers) marker(each);
    spool();
    if (status_.spool.forwarder) forwarder(*status_.spool.forwarder);
    journal();
    return out_;
  }

 private:
  static constexpr size_t kLabelWidth = 12;
  static constexpr size_t kAnswerWidth = 13;
  static constexpr size_t kLossesOfACode = 5;  // a store of many bad files must not fill the screen

  void line(std::string_view label, std::string_view answer, Colour colour,
            const std::string& words) {
    std::string left(label);
    left.resize(kLabelWidth, ' ');
    std::string middle(answer);
    // A long answer pushes its words to the right: without the one space the two would touch.
    middle.resize(std::max(middle.size() + 1, kAnswerWidth), ' ');
    const size_t indent = kLabelWidth + kAnswerWidth;
    out_ += left + terminal_.paint(colour, middle);
    out_ += wrappedBeside(terminalText(words), terminal_.width, indent);
    // Some answers need no words. The padding of the answer would then end the line with spaces.
    out_.erase(out_.find_last_not_of(' ') + 1);
    out_ += '\n';
  }
  void more(const std::string& words) { line("", "", Colour::plain, words); }

  std::string since(Date date) const {
    return dateText(date) + " (" + durationText(status_.now - date) + " ago)";
  }

  void lastRun() {
    if (!status_.run) {
      line("Last run", "none", Colour::plain, "no record of a run in the state directory");
    } else {
      const RunRecord& run = *status_.run;
      // Only a failed run makes good() false, so only a failed run is red. Every other outcome that
      // is not complete is a caution.
      const bool bad = run.outcome == RunOutcome::failed;
      const bool well = run.outcome == RunOutcome::completed;
      line("Last run", runOutcomeName(run.outcome),
           bad    ? Colour::bad
           : well ? Colour::good
                  : Colour::caution,
           since(run.start) + ", took " + durationText(run.end - run.start));
      if (!run.failure.empty()) more(run.failure);
      if (run.outcome == RunOutcome::bailedOut)
        more("the marker of a run that died stood there; it is removed");
      if (status_.hasBooks()) books(run);
      if (run.reading) store(*run.reading, run.logEvents);
    }
    for (const PlatformError& refused : status_.refusedFiles) more(refused.words);
    // The scheduler notes the begin of a run once the run has ended. So a begin after the end of
    // the recorded run belongs to a later run, and that one left no record.
    if (status_.runWithoutRecord()) {
      more(std::string(status_.run ? "A later run began " : "A run began ") +
           since(*status_.lastBegin) +
           " and left no record: it was not tasked, or the record could not be written.");
    }
  }

  void books(const RunRecord& run) {
    // We print the whole sum, not only its result. Where the books do not balance, the reader sees
    // which figure is the wrong one. kVerdictOrder names each verdict once, so the sum is complete.
    std::string sums = grouped(run.inspected) + " inspected of " +
                       counted(run.logEvents, "log event", "log events") + " =";
    std::string plus = " ";
    for (const auto verdict : kVerdictOrder) {
      sums += plus + grouped(run.classified[verdict]) + " " + std::string(verdictName(verdict));
      plus = " + ";
    }
    balance("Objects", run.objectsBalance(), sums);
    std::string rows =
        grouped(run.rowsStored) + " rows stored, expected 2 x " + grouped(run.reported()) +
        (run.unnamed == 0 ? "" : " - " + grouped(run.unnamed) + " without a name") +
        (run.unsendable == 0 ? "" : " - 2 x " + grouped(run.unsendable) + " without a payload") +
        " + " + grouped(run.countEvents) + " counts + 1";
    if (!run.rowsBalance()) rows += " = " + grouped(run.rowsExpected());
    balance("Rows", run.rowsBalance(), rows);
    for (const auto& [reason, count] : run.rowsFailed) {
      if (count != 0) more(grouped(count) + " rows failed: " + reason);
    }
    if (run.rowsExpired != 0) more(grouped(run.rowsExpired) + " rows of earlier runs expired");
    for (const std::string& name : run.setAside) more("a damaged spool was set aside as " + name);
  }
  void balance(std::string_view what, bool balances, const std::string& words) {
    line(what, balances ? "balance" : "DO NOT", balances ? Colour::good : Colour::bad,
         balances ? words : "balance: " + words);
  }

  // A store may lose entries before the run reads it. The reporter cannot help that, so a loss is a
  // caution and not a failure.
  void store(const StoreReading& reading, uint64_t entries) {
    std::string words = counted(reading.filesRead, "file", "files") + " and " +
                        counted(entries, "entry", "entries") + " read";
    if (reading.filesOutsideRange != 0)
      words += ", " + counted(reading.filesOutsideRange, "file", "files") + " of other days";
    const std::string part = partOfPeriod(reading);
    // A store may be undamaged and yet too young for the period, so both must hold.
    const bool whole = part.empty() && reading.losses.empty() && !reading.stopped;
    line("Store", whole ? "whole" : "not whole", whole ? Colour::good : Colour::caution, words);
    if (!part.empty()) more(part);
    if (reading.stopped) more(unreadPart(reading));
    for (const std::string& loss : lossLines(reading.losses, kLossesOfACode)) more(loss);
  }

  // The file alone does not tell a run at work from one that died. We say both and give the age of
  // the file, from which a reader can tell.
  void marker(const Marker& marker) {
    const bool ofUnit = marker.of == MarkerOf::unit;
    const std::string run = ofUnit ? "run under the unit" : "run by hand";
    switch (marker.state) {
      case Marker::State::absent:
        // On a machine with the unit, few run the service by hand. We spare those a line.
        if (ofUnit || status_.markers.size() == 1)
          line("Marker", "none", Colour::plain, "no " + run + " is reporting, and none died");
        return;
      case Marker::State::present:
        line("Marker", "present", Colour::caution,
             marker.path + " of " + marker.owner + ", since " + since(marker.since) + ": a " + run +
                 " is reporting, or died; then the next one only removes it");
        return;
      case Marker::State::cannotBeSeen:
        line("Marker", "unknown", Colour::caution,
             marker.path + " cannot be seen; root may look whether a " + run + " died");
        return;
    }
  }

  // An absent spool is plain, because a machine that was never tasked has none. Only a damaged one
  // is a failure: a user without access cannot know its state.
  void spool() {
    switch (status_.spoolState) {
      case SpoolReader::State::open:
        break;
      case SpoolReader::State::absent:
        line("Spool", "none", Colour::plain, "nothing was sent");
        return;
      case SpoolReader::State::noAccess:
        line("Spool", "no access", Colour::caution, status_.spoolFailure);
        return;
      case SpoolReader::State::damaged:
        line("Spool", "DAMAGED", Colour::bad, status_.spoolFailure);
        return;
    }
    const SpoolContents& spool = status_.spool;
    // Rounded up: a spool with rows in it must not seem to be empty.
    std::string words = grouped((spool.bytes + 1023) / 1024) + " KiB";
    // An empty spool has no oldest row. If there is an oldest row, there is a newest one.
    if (spool.oldest) {
      words += ", " + dateText(Date{std::chrono::microseconds{*spool.oldest}}) + " to " +
               dateText(Date{std::chrono::microseconds{*spool.newest}});
    }
    line("Spool", grouped(static_cast<uint64_t>(spool.rows)) + " rows", Colour::plain, words);
  }

  void forwarder(const ForwarderCounters& counters) {
    // Retries are no trouble: collectors are away now and then, and nothing is lost by waiting.
    const bool trouble = counters.rejected + counters.setAside > 0;
    std::string words = grouped(counters.delivered) + " delivered in " +
                        counted(counters.requests, "request", "requests") + ", " +
                        grouped(counters.retries) + " again, " + grouped(counters.rejected) +
                        " rejected, " + grouped(counters.setAside) + " set aside";
    if (counters.lastSuccess != 0) {
      const auto last = static_cast<int64_t>(counters.lastSuccess);
      words += "; last " + since(Date{std::chrono::microseconds{last}});
    }
    line("Forwarder", trouble ? "refused some" : "in use",
         trouble ? Colour::caution : Colour::plain, words);
  }

  // A run looks back 24 hours. If the oldest entry is younger, a run misses the time before it
  // without any sign of damage.
  void journal() {
    if (status_.journal.failure) {
      line("Journal", "unreadable", Colour::bad, status_.journal.failure->words);
    } else if (!status_.journal.oldest) {
      line("Journal", "empty", Colour::plain, store_);
    } else {
      const bool whole = status_.keepsADay();
      line("Journal", whole ? "whole day" : "part of day", whole ? Colour::good : Colour::caution,
           store_ + ": oldest entry " + since(*status_.journal.oldest) +
               (whole ? "" : "; a run looks back 24 h"));
    }
  }

  const ReporterStatus& status_;
  const Terminal& terminal_;
  const std::string store_;
  std::string out_;
};

struct StatusOptions {
  bool json = false;
};

int runStatus(const StatusOptions& options, const Surroundings& surroundings) {
  const std::string& directory = surroundings.launch.stateDirectory;
  // A file that we may not reach looks like a file that is absent. Without this check the screen
  // would report a healthy machine that never ran.
  if (::access(directory.c_str(), R_OK | X_OK) != 0 && errno == EACCES)
    return failToRead(fileError("state directory " + directory, EACCES), directory);
  const ReporterStatus status = gatherStatus(surroundings.launch, surroundings.now);
  print(options.json ? statusJson(status) : Screen(status, surroundings.terminal).render());
  flushOutput();
  // The screen is printed first: facts that this user may read are worth showing. A refusal
  // outranks the verdict of good(), since another user may get another answer.
  if (status.journal.failure && status.journal.failure->code == ErrorCode::noAccess)
    return failToRead(*status.journal.failure, status.store);
  if (status.spoolState == SpoolReader::State::noAccess) return kNoAccess;
  return status.good() ? kDone : kBad;
}

const CommandText kStatus{
    "status", "Say whether this machine reports, and whether the books balance",
    "The books of the last run balance where inspected = reported + every reason not to, and "
    "rows\n"
    "stored = 2 x reported (1 for an object without a name) + counts + 1. Exit status 1 where "
    "they\n"
    "do not, where the last run failed, and where the spool is damaged.\n\n"
    "Example: warn from a cron job\n"
    "  tesselctl status >/dev/null || tesselctl status | mail -s tessel root"};

}  // namespace

void addStatusCommand(CLI::App& app, Invocation& invocation) {
  const auto [command, options] = addCommand(app, invocation, kStatus, runStatus);
  command.add_flag("--json", options.json, "One JSON object");
}

}  // namespace tessel::ctl
