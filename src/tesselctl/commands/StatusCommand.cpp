// status: does this machine report, and do the books balance?

#include <unistd.h>

#include <CLI/CLI.hpp>
#include <cerrno>
#include <memory>
#include <nlohmann/json.hpp>

#include "os/Files.h"
#include "service/CookieFile.h"
#include "tesselctl/commands/Environment.h"
#include "tesselctl/judging/ReporterStatus.h"
#include "tesselctl/reading/TimeArguments.h"
#include "tesselctl/showing/JsonLine.h"
#include "tesselctl/showing/Losses.h"
#include "tesselctl/showing/ShownText.h"
#include "tesselctl/showing/SummaryOutput.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

namespace {

void addDate(JsonObject& object, std::string_view key, std::optional<Date> date) {
  if (date) object.number(key, Number{int64_t{date->time_since_epoch().count()}});
}

void writeRun(std::string& out, const RunRecord& run, bool hasBooks) {
  JsonObject object(out);
  addDate(object, "start", run.start);
  addDate(object, "end", run.end);
  object.text("outcome", std::string_view(runOutcomeName(run.outcome)));
  if (!run.failure.empty()) object.text("failure", std::string_view(run.failure));
  object.count("log_events", run.logEvents).count("inspected", run.inspected);
  addVerdicts(object, run.classified);
  object.count("unnamed", run.unnamed).count("count_events", run.countEvents);
  object.count("rows_stored", run.rowsStored)
      .count("rows_expected", hasBooks ? run.rowsExpected() : 0);
  object.nested("rows_failed", [&](std::string& inner) {
    JsonObject failed(inner);
    for (const auto& [reason, count] : run.rowsFailed) failed.count(reason, count);
    failed.end();
  });
  if (hasBooks)
    object.boolean("objects_balance", run.objectsBalance())
        .boolean("rows_balance", run.rowsBalance());
  if (run.reading) object.raw("reading", terminalJson(jsonLine(digestJson(*run.reading))));
  object.end();
}

void writeSpool(std::string& out, const ReporterStatus& status) {
  static constexpr std::string_view kStates[] = {"open", "absent", "no_access", "damaged"};
  JsonObject object(out);
  object.text("state", kStates[static_cast<size_t>(status.spoolState)]);
  if (status.spoolState == SpoolReader::State::open) {
    object.number("rows", Number{status.spool.rows}).count("bytes", status.spool.bytes);
    if (status.spool.oldest) object.number("oldest", Number{*status.spool.oldest});
    if (status.spool.newest) object.number("newest", Number{*status.spool.newest});
  } else {
    object.text("reason", std::string_view(status.spoolFailure));
  }
  object.end();
}

void writeForwarder(std::string& out, const ForwarderCounters& counters) {
  JsonObject object(out);
  object.count("delivered", counters.delivered).count("rejected", counters.rejected);
  object.count("set_aside", counters.setAside).count("set_aside_dropped", counters.setAsideDropped);
  object.count("requests", counters.requests).count("retries", counters.retries);
  object.count("bytes_sent", counters.bytesSent).count("position", counters.position);
  object.count("last_success", counters.lastSuccess);
  object.end();
}

std::string statusJson(const ReporterStatus& status) {
  std::string out;
  JsonObject object(out);
  object.boolean("good", status.good());
  object.nested("tasking", [&](std::string& inner) {
    JsonObject(inner)
        .boolean("tasked", status.tasking.on)
        .text("source", taskingSourceName(status.tasking.source))
        .text("file", std::string_view(status.tasking.file))
        .end();
  });
  object.nested("deferral", [&](std::string& inner) {
    JsonObject deferral(inner);
    deferral.boolean("wanted", status.deferral.has_value());
    if (status.deferral) deferral.text("reason", std::string_view(*status.deferral));
    deferral.end();
  });
  object.nested("marker", [&](std::string& inner) {
    JsonObject marker(inner);
    marker.boolean("present", status.marker.present);
    if (status.marker.present) {
      marker.text("owner", std::string_view(status.marker.owner));
      addDate(marker, "since", status.marker.since);
    }
    marker.end();
  });
  if (status.run) {
    object.nested("last_run",
                  [&](std::string& inner) { writeRun(inner, *status.run, status.hasBooks()); });
  }
  addDate(object, "last_begin", status.lastBegin);
  object.nested("spool", [&](std::string& inner) { writeSpool(inner, status); });
  if (status.spool.forwarder) {
    object.nested("forwarder",
                  [&](std::string& inner) { writeForwarder(inner, *status.spool.forwarder); });
  }
  object.nested("journal", [&](std::string& inner) {
    JsonObject journal(inner);
    addDate(journal, "oldest", status.journal.oldest);
    journal.boolean("keeps_a_day", status.keepsADay());
    if (!status.journal.failure.empty())
      journal.text("failure", std::string_view(status.journal.failure));
    journal.end();
  });
  object.end();
  return out + "\n";
}

// One screen for a human.
class Screen {
 public:
  explicit Screen(const ReporterStatus& status)
      : status_(status), terminal_(terminalBehind(STDOUT_FILENO)) {}

  std::string render() {
    line("Tasking", status_.tasking.on ? "on" : "off",
         status_.tasking.on ? Colour::good : Colour::caution, status_.taskingWords);
    line("Deferral", status_.deferral ? "wanted" : "none",
         status_.deferral ? Colour::caution : Colour::plain,
         status_.deferral.value_or("nothing speaks against a run now"));
    lastRun();
    marker();
    spool();
    if (status_.spool.forwarder) forwarder(*status_.spool.forwarder);
    journal();
    return out_;
  }

 private:
  static constexpr size_t kLabelWidth = 12;
  static constexpr size_t kAnswerWidth = 13;

  void line(std::string_view label, std::string_view answer, Colour colour,
            const std::string& words) {
    std::string left(label);
    left.resize(kLabelWidth, ' ');
    std::string middle(answer);
    middle.resize(std::max(middle.size() + 1, kAnswerWidth), ' ');
    const size_t indent = kLabelWidth + kAnswerWidth;
    const std::string right =
        wrapped(terminalText(words), std::max(terminal_.width, indent + 12) - indent, 0);
    out_ += left + terminal_.paint(colour, middle);
    for (const char character : right) {
      out_ += character;
      if (character == '\n') out_.append(indent, ' ');
    }
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
    if (status_.runWithoutRecord()) {
      more(std::string(status_.run ? "A later run began " : "A run began ") +
           since(*status_.lastBegin) +
           " and left no record: it was not tasked, is under way, or died.");
    }
  }

  void books(const RunRecord& run) {
    std::string sums = grouped(run.inspected) + " inspected of " +
                       counted(run.logEvents, "log event", "log events") + " =";
    std::string plus = " ";
    for (const auto verdict : kVerdictOrder) {
      sums += plus + grouped(run.classified[verdict]) + " " + std::string(verdictName(verdict));
      plus = " + ";
    }
    balance("Objects", run.objectsBalance(), sums);
    std::string rows = grouped(run.rowsStored) + " rows stored, expected 2 x " +
                       grouped(run.classified[RunRecord::kReported]) +
                       (run.unnamed == 0 ? "" : " - " + grouped(run.unnamed) + " without a name") +
                       " + " + grouped(run.countEvents) + " counts + 1";
    if (!run.rowsBalance()) rows += " = " + grouped(run.rowsExpected());
    balance("Rows", run.rowsBalance(), rows);
    for (const auto& [reason, count] : run.rowsFailed) {
      if (count != 0) more(grouped(count) + " rows failed: " + reason);
    }
    for (const std::string& name : run.setAside) more("a damaged spool was set aside as " + name);
  }
  void balance(std::string_view what, bool balances, const std::string& words) {
    line(what, balances ? "balance" : "DO NOT", balances ? Colour::good : Colour::bad,
         balances ? words : "balance: " + words);
  }

  void store(const ReadingDigest& reading, uint64_t entries) {
    std::string words = counted(reading.filesRead, "file", "files") + " and " +
                        counted(entries, "entry", "entries") + " read";
    if (reading.filesOutsideRange != 0)
      words += ", " + counted(reading.filesOutsideRange, "file", "files") + " of other days";
    const std::vector<std::string> losses = wordsForLosses(reading);
    line("Store", losses.empty() ? "whole" : "not whole",
         losses.empty() ? Colour::good : Colour::caution, words);
    for (const std::string& loss : losses) more(loss);
  }

  void marker() {
    if (!status_.marker.present) {
      line("Marker", "none", Colour::plain, "no run is reporting, and none died");
      return;
    }
    line("Marker", "present", Colour::caution,
         std::string(cookieFilePath) + " of " + status_.marker.owner + ", since " +
             since(status_.marker.since) +
             ": a run is reporting, or died; then the next one only removes it");
  }

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
    std::string words = grouped((spool.bytes + 1023) / 1024) + " KiB";
    if (spool.oldest) {
      words += ", " + dateText(Date{std::chrono::microseconds{*spool.oldest}}) + " to " +
               dateText(Date{std::chrono::microseconds{*spool.newest}});
    }
    line("Spool", grouped(static_cast<uint64_t>(spool.rows)) + " rows", Colour::plain, words);
  }

  void forwarder(const ForwarderCounters& counters) {
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

  void journal() {
    if (!status_.journal.failure.empty()) {
      line("Journal", "unreadable", Colour::bad, status_.journal.failure);
    } else if (!status_.journal.oldest) {
      line("Journal", "empty", Colour::plain, storeName(status_.store));
    } else {
      const bool whole = status_.keepsADay();
      line("Journal", whole ? "whole day" : "part of day", whole ? Colour::good : Colour::caution,
           storeName(status_.store) + ": oldest entry " + since(*status_.journal.oldest) +
               (whole ? "" : "; a run looks back 24 h"));
    }
  }

  const ReporterStatus& status_;
  const Terminal terminal_;
  std::string out_;
};

int runStatus(bool json) {
  const auto launch = launchConfiguration();
  if (!launch) return kUsage;
  if (::access(launch->stateDirectory.c_str(), R_OK | X_OK) != 0 && errno == EACCES) {
    return failToRead("state directory " + launch->stateDirectory + ": " + errorWords(EACCES),
                      launch->stateDirectory);
  }
  const ReporterStatus status = gatherStatus(*launch);
  print(json ? statusJson(status) : Screen(status).render());
  std::fflush(stdout);
  if (speaksOfPermission(status.journal.failure))
    return failToRead(status.journal.failure, launch->traceStore);
  if (status.spoolState == SpoolReader::State::noAccess) return kNoAccess;
  return status.good() ? kDone : kBad;
}

}  // namespace

void addStatusCommand(CLI::App& app, Invocation& invocation) {
  CLI::App* command = app.add_subcommand(
      "status", "Say whether this machine reports, and whether the books balance");
  command->footer(
      "The books of the last run balance where inspected = reported + every reason not to, and "
      "rows\n"
      "stored = 2 x reported (1 for an object without a name) + counts + 1. Exit status 1 where "
      "they\n"
      "do not, where the last run failed, and where the spool is damaged.\n\n"
      "Example: warn from a cron job\n"
      "  tesselctl status >/dev/null || tesselctl status | mail -s tessel root");
  const auto json = std::make_shared<bool>(false);
  command->add_flag("--json", *json, "One JSON object");
  command->callback([&invocation, json] { invocation.status = runStatus(*json); });
}

}  // namespace tessel::ctl
