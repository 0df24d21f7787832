// Judging the facts of a status: which problems and notes there are.
//
// A problem concerns the state now, or the last run, and goes by itself with the next good one. So
// nothing here looks at what happened once and is over. The exceptions are the two questions that
// need more than one run: whether runs come at all, and whether they live.
//
// The wall clock may be set, and a status that takes a set clock for a day without a run is wrong.
//  - A time in the future tells nothing. What we know instead is how long the machine is up.
//  - Each run notes when its boot began by the wall clock. If the boot that we are in seems to have
//    begun at another time since, the clock was set by that much, and we correct by it. Times of
//    other boots cannot be corrected.
// Discarded: counting by a clock that nobody can set. It begins anew with each boot, and a machine
// that is switched off every night would never be up for a day and a half.

#include <algorithm>
#include <set>

#include "platform/Text.h"
#include "tesselctl/judging/ReporterStatus.h"
#include "tesselctl/reading/TimeArguments.h"

namespace tessel::ctl {

namespace {

using std::chrono::hours;
using std::chrono::microseconds;

// A run a day, half a day of grace: a machine is deferred, slow or switched off for a while.
constexpr hours kLongestWithoutRun{36};
// The timer catches up on a missed run soon after the machine is on, and runs may be put off for
// two hours by default.
constexpr hours kGraceAfterBoot{2};
constexpr hours kLongestDeferral{24};
constexpr hours kLongestWithoutDelivery{2};
// A machine that was off could not deliver. The forwarder then waits for its turn in the fleet,
// five minutes by default.
constexpr std::chrono::minutes kForwardersGrace{15};
constexpr size_t kRunsLookedAt = 4;
constexpr size_t kDeadOfThem = 2;
constexpr uint64_t kFillingPercent = 80;
// The forwarder caps the wait that a collector orders at an hour, and adds at most half of it.
constexpr hours kLongestOrder{2};
// Clocks are corrected by small steps all the time. Less than this is no setting of the clock.
constexpr std::chrono::minutes kClockTolerance{1};

class StatusJudge {
 public:
  explicit StatusJudge(ReporterStatus& status) : status_(status) {
    const RunNote* last = status.runs.empty() ? nullptr : &status.runs.back();
    if (last != nullptr && isOfThisBoot(*last)) {
      const auto set = status.boot.began - *last->bootBegan;
      if (set > kClockTolerance) setForward_ = set;
    }
  }

  void judge() {
    if (status_.run) addRun(*status_.run);
    lookAtAccess();
    lookAtStore();
    lookAtMarkers();
    lookAtDeferral();
    lookAtSpool();
    lookAtForwarder();
    lookAtDeadRuns();
    lookForRuns();
    nameCauses(status_);
    for (Finding& each : status_.findings) {
      each.command = onThisDirectory(each.command);
      each.since = std::min(each.since, status_.now);
    }
    std::stable_sort(status_.findings.begin(), status_.findings.end(),
                     [](const Finding& a, const Finding& b) { return a.code < b.code; });
    for (size_t at = 0; at < kFindingCodes; ++at) {
      const auto code = static_cast<FindingCode>(at);
      if (isProblem(code) && !notLookedAt_.contains(code)) status_.checked.push_back(code);
    }
  }

 private:
  Finding& add(FindingCode code, std::string words, Date since) {
    return status_.findings.emplace_back(finding(code, std::move(words), since));
  }
  void cannotLookAt(std::initializer_list<FindingCode> codes) { notLookedAt_.insert(codes); }

  bool isOfThisBoot(const RunNote& note) const {
    return note.bootBegan && !note.boot.empty() && note.boot == status_.boot.id;
  }
  // How long ago that was. Absent if the time is in the future. Times before 1970 stand in a spool
  // that somebody changed.
  std::optional<microseconds> age(Date time) const {
    time = std::max(time, Date{});
    if (time > status_.now + kClockTolerance) return {};
    return std::max<microseconds>(status_.now - time - setForward_, microseconds{0});
  }
  // When that was in the time of now. A time that cannot be right becomes the begin of this boot.
  Date whenItWas(const RunNote& note, Date time) const {
    if (isOfThisBoot(note)) time += status_.boot.began - *note.bootBegan;
    return time > status_.now + kClockTolerance ? status_.boot.began : std::min(time, status_.now);
  }
  Date whenItWas(Date time) const {
    const auto ago = age(time);
    return ago ? status_.now - *ago : status_.boot.began;
  }

  void addRun(const RunRecord& run) {
    for (Finding& each : findingsOf(run)) {
      // What failed in an earlier run is over once a later one came to its end. Rows that expired
      // count until the next run, whatever that run does.
      if (status_.lastRunWasUntasked() && each.code != FindingCode::rowsExpired) continue;
      // These need more than the run, and are judged below.
      if (each.code == FindingCode::markerStuck || each.code == FindingCode::bailedOut) continue;
      // Without a forwarder rows expire because nobody wants them.
      const auto& forwarder = status_.spool.forwarder;
      if (each.code == FindingCode::rowsExpired && (!forwarder || forwarder->delivered == 0))
        continue;
      status_.findings.push_back(std::move(each));
    }
    if (run.reading && run.reading->oldestEntry && !run.reading->reachesRangeStart()) {
      const auto late = microseconds(*run.reading->oldestEntry - run.reading->rangeStart);
      add(FindingCode::storeBeginsLate,
          "The store begins " + durationText(late) + " after the begin of the last run's day",
          run.start);
    }
  }

  void lookAtAccess() {
    using enum FindingCode;
    const auto& service = status_.service;
    if (!service.taskingKnown) cannotLookAt({taskingUnreadable});
    if (!service.recordKnown) cannotLookAt({recordUnwritable});
    if (service.taskingRefused) {
      add(taskingUnreadable,
          "The tasking file cannot be read by the service's user: " + *service.taskingRefused,
          whenItWas(status_.taskingWritten.value_or(status_.now)))
          .command = "namei -l " + shellWord(status_.tasking.file);
    } else if (service.taskingKnown &&
               status_.tasking.decision.source() == TaskingSource::unusable) {
      Finding& unusable = add(taskingUnreadable,
                              "The tasking file says neither yes nor no: " + status_.taskingWords,
                              whenItWas(status_.taskingWritten.value_or(status_.now)));
      unusable.advice = "Correct the file. Until then the machine reports nothing.";
      unusable.command = "cat " + shellWord(status_.tasking.file);
    }
    if (service.recordRefused || endIsMissing()) {
      add(recordUnwritable,
          "The record of a run cannot be written: " +
              service.recordRefused.value_or("the last run ended well and left no end"),
          status_.run ? status_.run->end : status_.now)
          .command = "namei -l " + shellWord(status_.stateDirectory) + "; df " +
                     shellWord(status_.stateDirectory);
    }
    const bool record = status_.recordFailure && status_.recordFailure->code == ErrorCode::noAccess;
    if (status_.stateRefused || record) {
      add(noAccess,
          "This user may not look at the state of the service: " +
              (status_.stateRefused ? *status_.stateRefused : status_.recordFailure->words),
          status_.now);
      cannotLookAt({bailedOut, noCompletedRun, runFailed, booksUnbalanced, rowsRefused, rowsExpired,
                    storeDamaged, storeUnreadable});
      if (status_.stateRefused)
        cannotLookAt({recordUnwritable, deferred, spoolDamaged, spoolFilling, forwarderStuck});
    } else if (status_.spoolState == SpoolReader::State::noAccess) {
      add(noAccess, "This user may not read the spool: " + status_.spoolFailure, status_.now);
      cannotLookAt({spoolDamaged, spoolFilling, forwarderStuck, rowsExpired});
    } else if (status_.journal.failure && status_.journal.failure->code == ErrorCode::noAccess) {
      add(noAccess, "This user may not read the trace store: " + status_.journal.failure->words,
          status_.now);
    }
  }

  // A run that began now would fail, whether or not one is to begin. Without access we know nothing
  // about the store: see lookAtAccess().
  void lookAtStore() {
    const auto& failure = status_.journal.failure;
    if (!failure || failure->code == ErrorCode::noAccess) return;
    Finding& unreadable = add(FindingCode::storeUnreadable,
                              "The trace store cannot be read: " + failure->words, status_.now);
    unreadable.advice =
        "See whether the journal daemon runs, and whether TESSEL_TRACE_STORE names a store. A run "
        "fails without one.";
    unreadable.command = "ls -ld " + (status_.store ? shellWord(*status_.store)
                                                    : "/var/log/journal/* /run/log/journal/*");
  }

  // Whether the last run that has no end came to one all the same: the scheduler notes a run only
  // after its end, with a begin of a moment before ours. The run waits at most some seconds for the
  // tasking configuration, hence the minute.
  bool endIsMissing() const {
    if (!status_.lastRunDied() || !status_.lastBegin) return false;
    const Date start = status_.runs.back().start;
    const bool afterOthers =
        status_.runs.size() < 2 || *status_.lastBegin > status_.runs[status_.runs.size() - 2].start;
    return afterOthers && *status_.lastBegin <= start &&
           start - *status_.lastBegin < kClockTolerance;
  }

  void lookAtMarkers() {
    for (const Marker& marker : status_.markers) {
      // Any user can put a marker where runs by hand look for it. Runs under the unit look
      // elsewhere, so on a machine of theirs that is no problem.
      const bool concernsNobody =
          marker.of == MarkerOf::runByHand && status_.markers.size() > 1 && status_.ofPackage;
      if (marker.state == Marker::State::cannotBeSeen && !concernsNobody)
        cannotLookAt({FindingCode::markerStuck});
      if (!marker.present() || concernsNobody || status_.underWay) continue;
      const bool leftOver = status_.run && status_.run->marker == "still there";
      if (marker.ofService && !leftOver) continue;
      add(FindingCode::markerStuck,
          marker.ofService ? "The run marker could not be removed: " + marker.path
                           : "The run marker belongs to " + marker.owner +
                                 " and not to the service's user: " + marker.path,
          marker.since)
          .command = "rm -rf " + shellWord(marker.path);
    }
  }

  void lookAtDeferral() {
    if (!status_.deferral || !status_.deferredSince) return;
    const auto stood = age(*status_.deferredSince);
    if (!stood || *stood < kLongestDeferral) return;
    add(FindingCode::deferred,
        "Runs have been put off for " + durationText(*stood) + ": " + *status_.deferral,
        *status_.deferredSince);
  }

  void lookAtSpool() {
    if (status_.spoolState == SpoolReader::State::damaged) {
      add(FindingCode::spoolDamaged, "The spool cannot be read: " + status_.spoolFailure,
          status_.now);
    }
    if (status_.spool.bytesOfWaiting > status_.spoolLimitBytes / 100 * kFillingPercent) {
      const Date since{microseconds{status_.spool.newest.value_or(0)}};
      add(FindingCode::spoolFilling,
          "The spool is " + std::to_string(status_.spoolPercent()) +
              " % full, and refuses rows at " + std::to_string(status_.spoolLimitBytes) + " bytes",
          whenItWas(since));
    }
  }

  // Since when the oldest row waits. If the clock was set, its time may be in the future. The rows
  // then wait at least since the last run ended.
  std::optional<Date> waitingSince() const {
    if (status_.spool.rows == 0 || !status_.spool.oldest) return {};
    const Date oldest{microseconds{std::max<int64_t>(*status_.spool.oldest, 0)}};
    if (age(oldest)) return oldest;
    if (status_.run && age(status_.run->end)) return status_.run->end;
    return {};
  }

  void lookAtForwarder() {
    const auto& forwarder = status_.spool.forwarder;
    std::optional<Date> since = waitingSince();
    if (!forwarder || !since || status_.boot.upFor < kForwardersGrace) return;
    const auto at = [](uint64_t time) { return Date{microseconds{static_cast<int64_t>(time)}}; };
    const Date success = at(forwarder->lastSuccess), order = at(forwarder->orderedUntil);
    if (age(success)) since = std::max(*since, success);
    if (order < status_.now + kLongestOrder) since = std::max(*since, order);
    // What the forwarder waits by its settings is no silence. Its interval may be as long as a
    // year. So the begin of the wait tells whether the clock was set back since.
    if (const Date next = at(forwarder->nextAttempt); age(at(forwarder->restsSince)))
      since = std::max(*since, next);
    const auto silent = age(*since);
    if (!silent || *silent <= kLongestWithoutDelivery) return;
    std::string words = "The forwarder has delivered nothing for " + durationText(*silent) +
                        ", and " + std::to_string(status_.spool.rows) + " events wait; ";
    if (forwarder->lastErrorAt > forwarder->lastSuccess) {
      const auto ago = age(at(forwarder->lastErrorAt));
      words += "the last error" + (ago ? ", " + durationText(*ago) + " ago" : std::string()) +
               ": " + shortPlainText(forwarder->lastError, kMaxErrorBytes);
    } else {
      words += "it has told no error since, so it does not run";
    }
    add(FindingCode::forwarderStuck, std::move(words), *since);
  }
  static constexpr size_t kMaxErrorBytes = 300;

  // Of the last runs: those that read nothing or died. If the last of them is good, it is over.
  void lookAtDeadRuns() {
    std::vector<RunNote> runs = status_.runs;
    if (status_.underWay && !runs.empty() && !runs.back().end) runs.pop_back();
    if (endIsMissing()) runs.pop_back();
    if (runs.empty() || runs.back().reported() || status_.lastRunWasUntasked()) return;
    const auto isBad = [](const RunNote& note) {
      return !note.outcome || *note.outcome == RunOutcome::bailedOut;
    };
    runs.erase(runs.begin(),
               runs.end() - static_cast<ptrdiff_t>(std::min(runs.size(), kRunsLookedAt)));
    const auto bad = std::count_if(runs.begin(), runs.end(), isBad);
    if (static_cast<size_t>(bad) < kDeadOfThem) return;
    add(FindingCode::bailedOut,
        std::to_string(bad) + " of the last " + std::to_string(runs.size()) +
            " runs died, or read nothing because one had died",
        std::find_if(runs.begin(), runs.end(), isBad)->start);
  }

  // Since when the machine is to report. A tool that manages machines may write the tasking file
  // anew every hour. Its time then says nothing: the last three runs each met another file.
  std::optional<Date> taskedSince() const {
    const auto& runs = status_.runs;
    const size_t count = runs.size();
    if (count >= 3) {
      const std::set<std::optional<Date>> times{runs[count - 1].taskingWritten,
                                                runs[count - 2].taskingWritten,
                                                runs[count - 3].taskingWritten};
      if (times.size() == 3) return {};
    }
    if (!status_.taskingWritten) return {};
    Date since = whenItWas(*status_.taskingWritten);
    // A file may be older than the moment at which it came here. If a later run was not tasked,
    // reporting is on since that run at most.
    if (status_.runWithoutNote() && !status_.service.recordRefused)
      since = std::max(since, whenItWas(*status_.lastBegin));
    return since;
  }

  void lookForRuns() {
    if (!status_.tasking.decision.on()) return;
    const bool idle = status_.nextRun.timerInactive;
    if (idle) {
      add(FindingCode::nothingStartsRuns,
          "tessel-reporter.timer is not active, so no run begins by itself", status_.now);
    }
    if (status_.boot.upFor < kGraceAfterBoot) return;
    const auto last = std::find_if(status_.runs.rbegin(), status_.runs.rend(),
                                   [](const RunNote& note) { return note.reported(); });
    std::optional<Date> since = taskedSince();
    const bool ran = last != status_.runs.rend();
    if (ran) since = std::max(since, std::optional<Date>(whenItWas(*last, *last->end)));
    if (!since && !status_.runs.empty())
      since = whenItWas(status_.runs.front(), status_.runs.front().start);
    if (!since || status_.now - *since <= kLongestWithoutRun) return;
    add(FindingCode::noCompletedRun,
        "No run has reported for " + durationText(status_.now - *since) +
            (ran ? "" : ", none since reporting is on") +
            (idle ? ", and tessel-reporter.timer is not active" : ""),
        *since);
  }

  // The commands of the table name the package's state directory.
  std::string onThisDirectory(std::string command) const {
    constexpr std::string_view kPackages = "/var/lib/tessel";
    const std::string own = shellWord(status_.stateDirectory);
    for (size_t at = 0; !status_.ofPackage && (at = command.find(kPackages, at)) != command.npos;) {
      const size_t end = at + kPackages.size();
      // Not the directory of the marker, whose name begins alike.
      const bool whole = end == command.size() || command.find_first_of("/; ", end) == end;
      if (whole) command.replace(at, kPackages.size(), own);
      at += whole ? own.size() : kPackages.size();
    }
    return command;
  }

  ReporterStatus& status_;
  microseconds setForward_{0};  // by how much the clock was set forward since the last run
  std::set<FindingCode> notLookedAt_;
};

}  // namespace

void judge(ReporterStatus& status) {
  status.findings.clear();
  status.checked.clear();
  StatusJudge(status).judge();
}

}  // namespace tessel::ctl
