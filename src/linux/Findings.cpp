// What is found of a run, and the table of all findings.
//
// Each text of a run begins with words of its own. By these words linux/LogSinks.cpp finds the
// identifier under which `journalctl -x` explains the line, so they must stand in both places.

#include "linux/Findings.h"

#include <algorithm>
#include <iterator>

#include "platform/Log.h"
#include "platform/Text.h"

namespace tessel {

namespace {

// A command here names the units and paths of the package. Where a finding knows better (the path
// of a marker), it brings a command of its own.
constexpr struct {
  FindingCode code;
  std::string_view name;
  const char* advice;
  const char* command;
} kFindings[] = {
    {FindingCode::noAccess, "no_access",
     "Ask as root, or as a member of the groups tessel-reporter and systemd-journal.",
     "sudo tesselctl status"},
    {FindingCode::taskingUnreadable, "tasking_unreadable",
     "Let the service's user read the file. Until then the machine reports nothing.",
     "namei -l /etc/tessel/com.vantor.performance.tessel_reporter_tasking.json"},
    {FindingCode::recordUnwritable, "record_unwritable",
     "See to the permissions and the free space of the state directory. Runs go on, but nobody "
     "can tell how they ended.",
     "namei -l /var/lib/tessel; df /var/lib/tessel"},
    {FindingCode::markerStuck, "marker_stuck",
     "Remove the marker. Each run takes it for the marker of a run that died, and reads nothing.",
     "rm -rf /var/lib/tessel-marker/tessel_reporter_running"},
    {FindingCode::deferred, "deferred", "End the deferral. No run begins while it stands.",
     "tesselctl defer off"},
    {FindingCode::storeUnreadable, "store_unreadable",
     "Let the service's user read the files: it must be in the group systemd-journal. A file of "
     "an unknown layout stays unread.",
     "id tessel-reporter; ls -l /var/log/journal/*"},
    {FindingCode::storeDamaged, "store_damaged",
     "The trace points at the damaged places are lost. If damage comes back without a power cut, "
     "look at the disk.",
     "journalctl --verify"},
    {FindingCode::spoolDamaged, "spool_damaged",
     "Start a run: it sets the spool aside and begins a new one. Look at the disk.",
     "systemctl start tessel-reporter"},
    {FindingCode::forwarderStuck, "forwarder_stuck",
     "Look at what the forwarder says, and at the address and credentials of the collector.",
     "systemctl status statora-forwarder; journalctl -u statora-forwarder -n 20"},
    {FindingCode::spoolFilling, "spool_filling",
     "Let a forwarder deliver the rows, or raise TESSEL_SPOOL_LIMIT. A full spool refuses rows.",
     "systemctl status statora-forwarder"},
    {FindingCode::runFailed, "run_failed",
     "Remove the reason that the run gives, then start a run.", "systemctl start tessel-reporter"},
    {FindingCode::bailedOut, "bailed_out",
     "Find out what ends the runs before their time: a crash, the watchdog, a lack of memory, or "
     "a machine that is switched off meanwhile.",
     "journalctl -x -u tessel-reporter --since=-4d"},
    {FindingCode::rowsRefused, "rows_refused",
     "The reason says what to look at: the size of the spool, the disk, or a program that holds "
     "the spool locked.",
     "ls -l /var/lib/tessel; df /var/lib/tessel"},
    {FindingCode::rowsExpired, "rows_expired",
     "These rows were never delivered. Find out why the forwarder did not take them in time.",
     "systemctl status statora-forwarder; journalctl -u statora-forwarder -n 20"},
    {FindingCode::booksUnbalanced, "books_unbalanced",
     "This is a mistake in the service. Please report it with the record of the run.",
     "cat /var/lib/tessel/last_run.json"},
    {FindingCode::noCompletedRun, "no_completed_run",
     "See whether the timer is active and what the service says, then start a run.",
     "systemctl status tessel-reporter.timer tessel-reporter.service"},
    {FindingCode::nothingStartsRuns, "nothing_starts_runs",
     "Start the timer, or begin runs by other means. A day and a half without a run is a problem.",
     "systemctl enable --now tessel-reporter.timer"},
    {FindingCode::runCutShort, "run_cut_short",
     "The rest of the day is read only if the next run begins less than a day after this one.",
     "journalctl -u tessel-reporter -g 'stopped early' --since=-2d"},
    {FindingCode::lostAtSource, "lost_at_source",
     "The journal had no room when the programs recorded. Let them record less at a time, or wait "
     "longer for room (TESSEL_TRACE_WAIT).",
     "tesselctl explain --last 24h --summary"},
    {FindingCode::droppedByDaemon, "dropped_by_daemon",
     "Raise LogRateLimitBurst= of the unit that is named, or let it log less.",
     "journalctl -u systemd-journald -g Suppressed --since=-2d"},
    {FindingCode::overShare, "over_share",
     "The other writers lost nothing by it. Let the program that is named record less.",
     "tesselctl explain --last 24h --summary"},
    {FindingCode::malformed, "malformed",
     "Tell the authors of the program: these entries miss a field, or hold a value that makes no "
     "sense.",
     "tesselctl explain --last 24h --summary"},
    {FindingCode::numbersInNoFile, "numbers_in_no_file",
     "The journal may be too small to keep a day. SystemMaxUse= in journald.conf makes it larger.",
     "journalctl --disk-usage"},
    {FindingCode::storeBeginsLate, "store_begins_late",
     "On a new machine nothing is to be done. Otherwise the journal is too small to keep a day: "
     "SystemMaxUse= in journald.conf makes it larger.",
     "journalctl --disk-usage"},
    {FindingCode::spoolSetAside, "spool_set_aside",
     "Rows that were not yet delivered are in the old file. sqlite3 can recover them.",
     "ls -l /var/lib/tessel"},
};

constexpr bool tableIsInOrder() {
  for (size_t at = 0; at < std::size(kFindings); ++at) {
    if (kFindings[at].code != static_cast<FindingCode>(at)) return false;
  }
  return std::size(kFindings) == kFindingCodes;
}
static_assert(tableIsInOrder(), "codes index the table");

// A path of the journal takes some 100 bytes. With 256 for each foreign text a line stays below
// 1 KiB, so the journal keeps it whole and a terminal shows it on a few rows.
constexpr size_t kMaxForeignTextBytes = 256;
// A run knows fewer reasons and set-aside files. The bound matters for a record that was read from
// a file.
constexpr size_t kMaxOfAKind = 16;
constexpr std::string_view kObjectsLost = "Writers had more than their share, objects lost: ";

// Codes that stand side by side and have one reason share a line. Losses whose code is not here
// cost the day no trace point: a point whose executable is unknown is reported under another name,
// and what was lost earlier was lost before the day, as far as anybody knows.
struct LossFinding {
  LossCode first, last;
  FindingCode finding;
  std::string_view beginning;
};
constexpr LossFinding kLossFindings[] = {
    {LossCode::fileSkipped, LossCode::filesNotLookedAt, FindingCode::storeUnreadable,
     "Files of the trace store were not read: "},
    {LossCode::fileDamaged, LossCode::fileDamaged, FindingCode::storeDamaged,
     "The trace store is damaged: "},
    {LossCode::droppedByDaemon, LossCode::droppedByDaemon, FindingCode::droppedByDaemon,
     "The journal daemon dropped entries: "},
    {LossCode::entriesMissing, LossCode::entriesMissing, FindingCode::numbersInNoFile,
     "Entries are in no file of the trace store: "},
    {LossCode::malformed, LossCode::malformed, FindingCode::malformed,
     "Trace points were malformed: "},
    {LossCode::lostAtSource, LossCode::lostAtSource, FindingCode::lostAtSource,
     "Programs lost trace points before the journal: "},
    // Begins and objects are different things, so a sum of both would mean nothing. Five lines at
    // most, however many writers there are.
    {LossCode::openIntervalDropped, LossCode::openIntervalDropped, FindingCode::overShare,
     "Writers had more than their share, begins lost: "},
    {LossCode::beyondPairLimit, LossCode::beyondPairLimit, FindingCode::overShare, kObjectsLost},
    {LossCode::beyondImageLimit, LossCode::beyondImageLimit, FindingCode::overShare, kObjectsLost},
    {LossCode::beyondTextLimit, LossCode::beyondTextLimit, FindingCode::overShare, kObjectsLost},
    {LossCode::beyondTimeLimit, LossCode::beyondTimeLimit, FindingCode::overShare, kObjectsLost},
};

std::string escaped(std::string_view text) { return shortPlainText(text, kMaxForeignTextBytes); }

std::string joined(const std::vector<std::string>& names) {
  std::string list;
  for (size_t at = 0; at < std::min(names.size(), kMaxOfAKind); ++at)
    list += (at == 0 ? "" : ", ") + names[at];
  return escaped(list);
}

std::string unreadWords(const RunRecord& record) {
  if (!record.reading) return "its day was not read to the end";
  constexpr uint64_t kMinute = 60'000'000;
  // Rounded up: a minute that was read in part was not read.
  const uint64_t minutes = (record.reading->unread() + kMinute - 1) / kMinute;
  return "the last " + std::to_string(minutes) + " minutes of its day were not read";
}

// The findings of one run, in the order in which they weigh.
class RunFindings {
 public:
  explicit RunFindings(const RunRecord& record) : record_(record) {
    addOutcome();
    addRows();
    if (record.reading) addReading(*record.reading);
  }
  std::vector<Finding> take() { return std::move(findings_); }

 private:
  void add(FindingCode code, std::string words) {
    findings_.push_back(finding(code, std::move(words), record_.start));
  }

  void addOutcome() {
    if (record_.outcome == RunOutcome::failed) {
      add(FindingCode::runFailed, "The run failed: " + escaped(record_.failure));
    } else if (record_.outcome == RunOutcome::bailedOut) {
      add(FindingCode::bailedOut,
          "The run read nothing, because an earlier run died: the run marker was there when it "
          "began");
    } else if (record_.outcome == RunOutcome::interrupted) {
      add(FindingCode::runCutShort, "The run was cut short: " + unreadWords(record_));
    }
    if (record_.marker == "still there") {
      add(FindingCode::markerStuck,
          "The run marker could not be removed: the next run will take this one for dead and read "
          "nothing");
    }
  }

  void addRows() {
    uint64_t refused = 0;
    size_t reasons = 0;
    for (const auto& [reason, rows] : record_.rowsFailed) {
      refused += rows;
      if (rows == 0 || ++reasons > kMaxOfAKind) continue;
      add(FindingCode::rowsRefused, "The spool refused rows of the run: " + std::to_string(rows) +
                                        " of " + std::to_string(record_.rowsExpected()) +
                                        ", reason " + escaped(reason));
    }
    addBalances(refused);
    if (const uint64_t expired = record_.rowsExpired + record_.expiredSince; expired != 0) {
      add(FindingCode::rowsExpired, "Rows of the spool expired: " + std::to_string(expired) +
                                        " stood there for longer than TESSEL_SPOOL_DAYS");
    }
    if (!record_.setAside.empty())
      add(FindingCode::spoolSetAside, "A damaged spool was set aside: " + joined(record_.setAside));
  }

  void addBalances(uint64_t refused) {
    if (record_.hasBooks() && record_.rowsStored + refused != record_.rowsExpected()) {
      add(FindingCode::booksUnbalanced,
          "The books of the run do not balance: " + std::to_string(record_.rowsStored) +
              " rows stored and " + std::to_string(refused) + " refused, of " +
              std::to_string(record_.rowsExpected()));
    }
    if (record_.hasBooks() && !record_.objectsBalance()) {
      add(FindingCode::booksUnbalanced,
          "The books of the run do not balance: " + std::to_string(record_.classifiedSum()) +
              " objects have a classification, of " + std::to_string(record_.inspected));
    }
  }

  void addReading(const StoreReading& reading) {
    for (const auto& row : kLossFindings) addLosses(reading.losses, row);
  }

  void addLosses(const Losses& losses, const LossFinding& row) {
    uint64_t count = 0;
    const Loss* first = nullptr;  // the list is sorted by code
    for (const Loss& loss : losses.all()) {
      if (loss.code < row.first || loss.code > row.last) continue;
      count += loss.count;
      if (first == nullptr) first = &loss;
    }
    if (first == nullptr) return;
    add(row.finding,
        std::string(row.beginning) + std::to_string(count) + "; the first: " + example(*first));
  }

  static std::string example(const Loss& loss) {
    const std::string where = loss.where();
    return escaped(loss.words) + (where.empty() ? "" : " (" + escaped(where) + ")");
  }

  const RunRecord& record_;
  std::vector<Finding> findings_;
};

}  // namespace

std::string_view findingName(FindingCode code) { return kFindings[static_cast<size_t>(code)].name; }

Finding finding(FindingCode code, std::string words, Date since) {
  const auto& row = kFindings[static_cast<size_t>(code)];
  return {code, std::move(words), since, row.advice, row.command, {}};
}

std::string shellWord(std::string_view text) {
  constexpr std::string_view kPlain =
      "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789/._-+=:,@";
  if (!text.empty() && text.find_first_not_of(kPlain) == std::string_view::npos)
    return std::string(text);
  // Between single quotes a shell obeys nothing. A quote in the text ends them and begins them
  // anew.
  std::string word = "'";
  for (const char c : text) word += c == '\'' ? std::string("'\\''") : std::string(1, c);
  return word + "'";
}

std::vector<Finding> findingsOf(const RunRecord& record) { return RunFindings(record).take(); }

void logFindings(const RunRecord& record) {
  for (const Finding& found : findingsOf(record)) platformLog().warning("%@", found.words);
}

}  // namespace tessel
