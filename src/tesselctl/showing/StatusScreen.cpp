// The status of this machine as one screen for people.

#include "tesselctl/showing/StatusScreen.h"

#include <algorithm>

#include "platform/Text.h"
#include "tesselctl/showing/Losses.h"
#include "tesselctl/showing/SummaryOutput.h"

namespace tessel::ctl {

namespace {

class Screen {
 public:
  Screen(const ReporterStatus& status, const Terminal& terminal)
      : status_(status),
        terminal_(terminal),
        store_(status.store.value_or("the journal of this machine")) {}

  std::string render() {
    // The dates below are of this zone.
    out_ = zonedText(status_.now) + "\n";
    settings();
    line("Tasking", status_.tasking.decision.on() ? "on" : "off",
         status_.tasking.decision.on() ? Colour::good : Colour::caution, status_.taskingWords);
    line("Deferral", status_.deferral ? "wanted" : "none",
         status_.deferral ? Colour::caution : Colour::plain,
         status_.deferral.value_or("nothing speaks against a run now"));
    nextRun();
    lastRun();
    for (const Marker& each : status_.markers) marker(each);
    spool();
    if (status_.spool.forwarder)
      forwarder(*status_.spool.forwarder);
    else if (status_.spoolState == SpoolReader::State::open)
      line("Forwarder", "none", Colour::plain, "none has worked on this spool: its rows stay here");
    journal();
    findings();
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
    out_ +=
        wrappedBeside(terminalText(words), terminal_.width, indent, middle.size() - kAnswerWidth);
    // Some answers need no words. The padding of the answer would then end the line with spaces.
    out_.erase(out_.find_last_not_of(' ') + 1);
    out_ += '\n';
  }
  // Further words stand below the words of their line, so that the left column stays a list of
  // questions with one answer each.
  void more(const std::string& words) { line("", "", Colour::plain, words); }

  // The age saves the reader the arithmetic, and the date lets him find the moment in the journal.
  std::string since(Date date) const {
    return dateText(date) + " (" + durationText(status_.now - date) + " ago)";
  }

  // Which files and limits are looked at depends on variables. The units may have others than this
  // shell, so the screen says whose they are.
  void settings() {
    std::string names;
    for (const std::string& name : status_.variables) names += (names.empty() ? "" : ", ") + name;
    line("Settings", names.empty() ? "defaults" : "set here", Colour::plain,
         (names.empty() ? "no TESSEL_ variable is set here" : names) +
             "; those of the units are not read: systemctl cat tessel-reporter statora-forwarder");
  }

  void lastRun() {
    const auto& failure = status_.recordFailure;
    if (failure && failure->code == ErrorCode::noAccess) {
      line("Last run", "no access", Colour::caution, failure->words);
      return;
    }
    if (!status_.run) {
      line("Last run", "none", Colour::plain, "no record of a run in the state directory");
    } else {
      const RunRecord& run = *status_.run;
      // A run that failed is a problem by itself, so it is red. Any other outcome that is not
      // complete is a caution.
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
    if (status_.recordFailure) more(status_.recordFailure->words);
    for (const PlatformError& refused : status_.refusedFiles) {
      if (!status_.recordFailure || refused.words != status_.recordFailure->words)
        more(refused.words);
    }
    if (status_.lastRunDied()) {
      more("A later run began " + since(status_.runs.back().start) + " and has no end: it died.");
    } else if (!status_.underWay && status_.runWithoutNote()) {
      more(std::string(status_.runs.empty() ? "A run began " : "A later run began ") +
           since(*status_.lastBegin) +
           " and left no record: it was not tasked, or the record could not be written.");
    }
  }

  void nextRun() {
    switch (status_.nextRun.by) {
      case NextRun::By::underWay:
        line("Next run", "under way", Colour::good,
             status_.runs.empty() || status_.runs.back().end
                 ? "it has not yet begun to report"
                 : "it began " + since(status_.runs.back().start));
        return;
      case NextRun::By::timer:
      case NextRun::By::interval:
        line("Next run", status_.deferral ? "put off" : "planned",
             status_.deferral ? Colour::caution : Colour::plain,
             dateText(*status_.nextRun.at) + " (in " +
                 durationText(std::max<std::chrono::microseconds>(*status_.nextRun.at - status_.now,
                                                                  std::chrono::microseconds{0})) +
                 "), by " +
                 (status_.nextRun.by == NextRun::By::timer ? "the timer tessel-reporter.timer"
                                                           : "TESSEL_ACTIVITY_INTERVAL"));
        return;
      case NextRun::By::nothing:
        line("Next run", "unknown", status_.ofPackage ? Colour::caution : Colour::plain,
             !status_.ofPackage ? "no timer of the package serves this state directory"
             : status_.nextRun.timerInactive
                 ? "tessel-reporter.timer is not active; 'systemctl enable --now "
                   "tessel-reporter.timer' starts it"
                 : "no service manager answers, which would know of tessel-reporter.timer");
        return;
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
        counted(run.rowsStored, "row", "rows") + " stored, expected 2 x " +
        grouped(run.reported()) +
        (run.unnamed == 0 ? "" : " - " + grouped(run.unnamed) + " without a name") +
        (run.unsendable == 0 ? "" : " - 2 x " + grouped(run.unsendable) + " without a payload") +
        " + " + grouped(run.countEvents) + " counts + 1";
    if (!run.rowsBalance()) rows += " = " + grouped(run.rowsExpected());
    balance("Rows", run.rowsBalance(), rows);
    for (const auto& [reason, count] : run.rowsFailed) {
      if (count != 0) more(counted(count, "row", "rows") + " failed: " + reason);
    }
    if (run.rowsExpired != 0)
      more(counted(run.rowsExpired, "row", "rows") + " of earlier runs expired");
    for (const std::string& name : run.setAside) more("a damaged spool was set aside as " + name);
  }
  void balance(std::string_view what, bool balances, const std::string& words) {
    line(what, balances ? "balance" : "DO NOT", balances ? Colour::good : Colour::bad,
         balances ? words : "balance: " + words);
  }

  // A store that begins late is whole for all that we know: on a new machine there was nothing
  // before.
  void store(const StoreReading& reading, uint64_t entries) {
    std::string words = counted(reading.filesRead, "file", "files") + " and " +
                        counted(entries, "entry", "entries") + " read";
    if (reading.filesOutsideRange != 0)
      words += ", " + counted(reading.filesOutsideRange, "file", "files") + " of other days";
    const std::string part = partOfPeriod(reading);
    const auto losses = lossLines(reading.losses, kLossesOfACode);
    const bool whole = losses.empty() && !reading.stopped;
    const bool late = whole && !part.empty();
    line("Store",
         late    ? "begins late"
         : whole ? "whole"
                 : "not whole",
         whole ? Colour::good : Colour::caution, words);
    if (!part.empty()) more(part);
    if (reading.stopped) more(unreadPart(reading));
    for (const std::string& loss : losses) more(loss);
    if (const std::string unknown = unknownPrograms(reading.losses); !unknown.empty())
      more(unknown);
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
        line("Spool", "none", Colour::plain, "no run has reported anything yet");
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
    std::string words = grouped((spool.bytes + 1023) / 1024) + " KiB, " +
                        std::to_string(status_.spoolPercent()) + " % of its limit";
    // An empty spool has no oldest row. If there is an oldest row, there is a newest one.
    if (spool.oldest) {
      words += ", " + dateText(Date{std::chrono::microseconds{*spool.oldest}}) + " to " +
               dateText(Date{std::chrono::microseconds{*spool.newest}});
    }
    // Delivered rows lie in the same file. Without this word a spool of a few rows that wait would
    // seem too large.
    if (spool.delivered != 0)
      words += "; " +
               counted(static_cast<uint64_t>(spool.delivered), "delivered row", "delivered rows") +
               " kept";
    const auto rows = static_cast<uint64_t>(spool.rows);
    line("Spool", counted(rows, "row waits", "rows wait"), Colour::plain, words);
  }

  void forwarder(const ForwarderCounters& counters) {
    // A collector that is away now and then is no trouble: nothing is lost by waiting. But who asks
    // why rows wait must see its last answer at once.
    const bool trouble = counters.rejected + counters.setAside > 0;
    const bool inVain = counters.lastErrorAt > counters.lastSuccess;
    const auto at = [](uint64_t time) {
      return Date{std::chrono::microseconds{static_cast<int64_t>(time)}};
    };
    std::string words = grouped(counters.delivered) + " delivered in " +
                        counted(counters.requests, "request", "requests") + ", " +
                        grouped(counters.refusedRequests) + " of them refused and " +
                        grouped(counters.failedRequests) + " failed on the way, " +
                        grouped(counters.rejected) + " rejected, " + grouped(counters.setAside) +
                        " set aside";
    if (counters.lastSuccess != 0) words += "; last " + since(at(counters.lastSuccess));
    if (inVain)
      words += "; the last try, " + since(at(counters.lastErrorAt)) + ": " + counters.lastError;
    line("Forwarder",
         inVain    ? "in vain"
         : trouble ? "refused some"
                   : "in use",
         trouble || inVain ? Colour::caution : Colour::plain, words);
  }

  // A finding in full: what it is, since when, what to do, and a command. What follows from it
  // stands below it, so that nobody looks for a second cause. A command stands on a line of its own
  // and is never broken, so that it can be pasted.
  void inFull(const Finding& found, std::string_view label, Colour colour) {
    line(label, findingName(found.code), colour, found.words);
    more("since " + since(found.since) + ". " + found.advice);
    out_ += std::string(kLabelWidth + kAnswerWidth + 2, ' ') + found.command + '\n';
    hence(found.code);
  }
  // This ends, because no finding is among the causes of its own cause.
  void hence(FindingCode cause) {
    for (const Finding& other : status_.findings) {
      if (other.because != cause) continue;
      more("Hence " + std::string(findingName(other.code)) + ": " + other.words);
      hence(other.code);
    }
  }

  // "good" is worth as much as what was looked at, so each code that was looked for is named.
  std::string namesOf(const std::vector<FindingCode>& codes) const {
    std::string names;
    for (const FindingCode code : codes)
      names += (names.empty() ? "" : ", ") + std::string(findingName(code));
    return names;
  }

  // What needs somebody comes last, because the end of a screen is read first.
  void findings() {
    const auto isBad = [](const Finding& found) { return isProblem(found.code); };
    for (const Finding& found : status_.findings) {
      if (!isBad(found)) inFull(found, "Note", Colour::caution);
    }
    // Problems that follow from another one count as well: a script finds as many in the JSON.
    const auto problems = static_cast<uint64_t>(
        std::count_if(status_.findings.begin(), status_.findings.end(), isBad));
    const std::string sum = (problems == 0 ? "none" : grouped(problems)) +
                            " of these problems: " + namesOf(status_.checked);
    const auto isIdle = [](const Finding& found) {
      return found.code == FindingCode::nothingStartsRuns;
    };
    // A machine that reports nothing is not well, and not ill either. "good" would promise reports.
    if (problems != 0) {
      line("All in all", "NOT GOOD", Colour::bad, sum);
    } else if (!status_.tasking.decision.on()) {
      // Who set up a share of a fleet has switched this machine off on purpose.
      line("All in all", "off", Colour::caution,
           std::string("this machine reports nothing; ") +
               (status_.tasking.rollout ? "" : "'tesselctl tasking on' switches reporting on; ") +
               sum);
    } else if (std::any_of(status_.findings.begin(), status_.findings.end(), isIdle)) {
      line("All in all", "idle", Colour::caution,
           "reporting is on, but nothing starts a run; " + sum);
    } else {
      line("All in all", "good", Colour::good, sum);
    }
    for (const Finding& found : status_.findings) {
      if (isBad(found) && !found.because) inFull(found, "Problem", Colour::bad);
    }
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
      line("Journal", whole ? "whole day" : "part of day", whole ? Colour::good : Colour::plain,
           store_ + (status_.journal.mayBeOlder ? ": first entry " : ": oldest entry ") +
               since(*status_.journal.oldest) + (whole ? "" : "; a run looks back 24 h") +
               (!whole && status_.journal.mayBeOlder
                    ? ", and an export file may hold older entries further on"
                    : ""));
    }
  }

  const ReporterStatus& status_;
  const Terminal& terminal_;
  const std::string store_;
  std::string out_;
};

}  // namespace

std::string statusScreen(const ReporterStatus& status, const Terminal& terminal) {
  return Screen(status, terminal).render();
}

}  // namespace tessel::ctl
