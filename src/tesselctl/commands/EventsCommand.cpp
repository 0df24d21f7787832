// events: what the spool holds, newest last, or one row of it as a whole.
//
// We read the database beside the service and never write to it. Rows are printed page by page, so
// a spool of many megabytes needs no more memory than a page, or than the rows that -n asks for.

#include <charconv>
#include <chrono>
#include <deque>
#include <filesystem>
#include <thread>
#include <utility>

#include "platform/Text.h"
#include "tesselctl/commands/Command.h"
#include "tesselctl/judging/ObjectSelection.h"
#include "tesselctl/reading/SpoolReader.h"
#include "tesselctl/showing/EventOutput.h"

namespace tessel::ctl {

namespace {

struct EventsOptions {
  PeriodArguments period;
  std::vector<std::string> names;
  std::vector<std::string> subsystems;
  std::vector<std::string> categories;
  size_t newest = 0;  // 0: all
  bool follow = false;
  bool json = false;
  bool sent = false;
  bool waiting = false;
  std::optional<std::string> id;  // of `events show`

  // Whether the options choose among the rows.
  bool choose() const {
    return period.given() || !names.empty() || !subsystems.empty() || !categories.empty() ||
           newest != 0 || follow || sent || waiting;
  }
  SpoolRows rows() const {
    if (sent) return SpoolRows::delivered;
    return waiting ? SpoolRows::waiting : SpoolRows::all;
  }
};

// SQLite does not tell other processes of a new row, so --follow must look. Five looks a second
// seem immediate to people and cost one short query each.
constexpr std::chrono::milliseconds kLookForRowsEvery{200};

class RowSelection {
 public:
  RowSelection(const EventsOptions& options, std::optional<Period> period)
      : options_(options), period_(period) {}

  bool wants(const SpoolRow& stored) const {
    const SpooledEvent& row = stored.event;
    // Whoever asks for what was delivered yesterday means the day on which it left the machine.
    const Date date{std::chrono::microseconds{options_.sent ? stored.delivery->at : row.time}};
    // The end is not in the period, so two periods that touch never share a row.
    if (period_ && (date < period_->start || date >= period_->end)) return false;
    if (!fitsOne(options_.names, row.name)) return false;
    // Parsing costs more than all other tests. It comes last, and only if a pattern needs it.
    if (options_.subsystems.empty() && options_.categories.empty()) return true;
    const EventPath path = pathOf(row);
    return fitsOne(options_.subsystems, path.subsystem) &&
           fitsOne(options_.categories, path.category);
  }

 private:
  const EventsOptions& options_;
  const std::optional<Period> period_;
};

class EventsRun {
 public:
  EventsRun(const EventsOptions& options, std::optional<Period> period,
            const Surroundings& surroundings)
      : options_(options),
        period_(period),
        selection_(options, period),
        stateDirectory_(surroundings.launch.stateDirectory),
        spool_(surroundings.launch.stateDirectory),
        terminal_(surroundings.terminal) {}

  int list() {
    const SpoolReader::State state = spool_.open();
    // A machine that has reported nothing has no spool. With --follow the user waits for just that.
    if (state == SpoolReader::State::absent && options_.follow) {
      printError("There is no spool yet: nothing was reported. Waiting for " +
                 terminalText(spool_.path()) + ".\n");
    } else if (state == SpoolReader::State::absent) {
      return nothingReported();
    } else if (state != SpoolReader::State::open) {
      return complain(state);
    } else if (!show()) {
      return complain(SpoolReader::State::damaged);
    } else if (!options_.follow) {  // a list that goes on has no totals
      showTotals();
    }
    return options_.follow ? follow() : kDone;
  }

  // A row may have been delivered since somebody saw its id, so both tables are searched.
  int showRow(int64_t id) {
    const SpoolReader::State state = spool_.open();
    if (state != SpoolReader::State::open) return complain(state);
    const auto row = spool_.row(id);
    if (!row) {
      if (spool_.failed()) return complain(SpoolReader::State::damaged);
      return fail(kBad, "the spool holds no row " + std::to_string(id) + "; " + heldIds());
    }
    print(options_.json ? eventJson(*row) : wholeEvent(*row, terminal_));
    return kDone;
  }

 private:
  // In a pipe each line is a row, so the totals go to standard error.
  void showTotals() {
    // A program that asks for JSON adds up the rows by itself, and would have to take these lines
    // out of what it logs.
    if (options_.json) return;
    const auto contents = spool_.contents();
    if (!contents) return;  // damaged since the last row was read; nothing is known
    const std::string totals = options_.choose() ? whyNone() + chosenTotals(printed_, *contents)
                                                 : eventTotals(*contents, spool_.deliveries());
    terminal_.interactive ? print(terminal_.paint(Colour::faint, totals)) : printError(totals);
    flushOutput();
  }

  // Whoever asks for yesterday must not take the sums of the whole spool for an answer.
  std::string whyNone() const {
    if (!printed_.none()) return "";
    const bool patterns =
        !options_.names.empty() || !options_.subsystems.empty() || !options_.categories.empty();
    return std::string(patterns ? "No row that fits" : "No row") +
           (options_.sent      ? " was delivered"
            : options_.waiting ? " waits"
                               : " is here") +
           (period_ ? ", " + periodText(*period_) : "") + "\n";
  }

  // That no row is there is an answer, and no failure. Where the state directory is something else,
  // we do not know.
  int nothingReported() const {
    std::error_code error;
    const auto kind = std::filesystem::status(stateDirectory_, error).type();
    if (kind != std::filesystem::file_type::directory &&
        kind != std::filesystem::file_type::not_found)
      return fail(kBad, stateDirectory_ + " is no directory; TESSEL_STATE_DIR names the state " +
                            "directory of the service");
    printError(
        "Nothing was reported, or TESSEL_STATE_DIR names another place: there is no spool at " +
        terminalText(spool_.path()) + ".\n");
    return kDone;
  }

  std::string heldIds() {
    const auto ids = spool_.ids();
    return ids ? "its ids go from " + std::to_string(ids->first) + " to " +
                     std::to_string(ids->second)
               : "it is empty";
  }

  int complain(SpoolReader::State state) {
    switch (state) {
      case SpoolReader::State::absent:
        return fail(kBad, "there is no spool at " + spool_.path() +
                              ": nothing was reported, or TESSEL_STATE_DIR names another place");
      case SpoolReader::State::noAccess:
        return fail(
            kNoAccess,
            spool_.reason() + "; run tesselctl as root, or as the user that the service runs as");
      default:
        if (!spool_.damaged()) return fail(kBad, "the spool cannot be read: " + spool_.reason());
        return fail(kBad, "the spool is damaged: " + spool_.reason() +
                              "; the service sets it aside in its next run and begins a new one");
    }
  }

  // Prints the rows that are new. Returns false if the spool cannot be read. --newest limits the
  // first look alone: under --follow each later row is new and must be shown.
  bool show() {
    std::deque<SpoolRow> last;
    const bool limited = options_.newest != 0 && !followed_;
    const bool read = spool_.readNew(options_.rows(), [&](const SpoolRow& row) {
      if (!selection_.wants(row)) return;
      if (!limited) return printRow(row);
      // The number of rows is not known before the last one is read, so we keep the newest and drop
      // the oldest of them. Memory stays bounded by -n.
      last.push_back(row);
      if (last.size() > options_.newest) last.pop_front();
    });
    for (const SpoolRow& row : last) printRow(row);
    // With --follow a reader of the pipe waits for these rows. A buffer would hold them back.
    flushOutput();
    return read;
  }

  int follow() {
    followed_ = true;
    for (;;) {
      flushWhileWaiting();
      std::this_thread::sleep_for(kLookForRowsEvery);
      // A spool may go and come back: the service replaces a damaged one. A damaged spool stays
      // what it is until the next run, which may be a day away, so nobody should wait for that.
      SpoolReader::State state = spool_.open();
      if (state == SpoolReader::State::absent) continue;
      if (state == SpoolReader::State::open && !show()) state = SpoolReader::State::damaged;
      if (state != SpoolReader::State::open && !spool_.locked()) return complain(state);
    }
  }

  // A row on a terminal shows neither year nor zone, so a line above the first does.
  void printRow(const SpoolRow& row) {
    printed_.add(row);
    if (options_.json) return print(eventJson(row));
    // As the period that --sent takes, so the times that it shows.
    const RowTime time = options_.sent ? RowTime::ofDelivery : RowTime::ofEvent;
    if (terminal_.interactive && !std::exchange(headed_, true))
      print(eventHeading(row, time, terminal_));
    print(eventLine(row, time, terminal_));
  }

  const EventsOptions& options_;
  const std::optional<Period> period_;
  const RowSelection selection_;
  const std::string stateDirectory_;
  SpoolReader spool_;
  const Terminal& terminal_;
  bool followed_ = false;
  bool headed_ = false;
  ChosenRows printed_;
};

int showEvent(const EventsOptions& options, const Surroundings& surroundings) {
  if (options.choose())
    return fail(kUsage, "'events show' shows the row that it names; only --json goes with it");
  int64_t id = 0;
  const std::string& word = *options.id;
  const char* end = word.data() + word.size();
  const auto [stop, error] = std::from_chars(word.data(), end, id);
  if (error != std::errc() || stop != end || id < 1)
    return fail(
        kUsage,
        "'" + word +
            "' is no id; 'tesselctl events' begins each row with its id, a whole number from 1");
  return EventsRun(options, {}, surroundings).showRow(id);
}

int runEvents(const EventsOptions& options, const Surroundings& surroundings) {
  checkZone();
  if (options.id) return showEvent(options, surroundings);
  std::optional<Period> period;
  if (options.period.given()) {
    const PeriodResult result = periodOf(options.period, surroundings.now);
    if (!result.period) return fail(kUsage, result.error);
    period = result.period;
    // Without --until a period ends now. Every row that --follow waits for would lie behind it.
    if (options.follow && !options.period.until) period->end = Date::max();
  }
  return EventsRun(options, period, surroundings).list();
}

// Rows that -n asks for are kept in memory. Nobody reads more.
constexpr uint64_t kMostRows = 1'000'000;

CommandText eventsText() {
  return {
      "events", "Show what the spool holds, newest last",
      helpText(
          "The spool is statora.db in the state directory: one row per event that the "
          "service reported, in order. A row waits until a forwarder has delivered it. Then it "
          "stays for 7 days, or less where room is needed, with the time and the "
          "destination. On a terminal '~' stands for 'com.vantor.performance.'. Patterns "
          "may hold *, ? and [...].") +
          helpText("Without a terminal a row is one line, with tabs between: id, time, name, "
                   "time of delivery, destination, payload as 'path key=value ...'. While a row "
                   "waits, time of delivery and destination are empty. How many rows wait and "
                   "went where goes to standard error.") +
          helpEnvironment({"TESSEL_STATE_DIR", "TZ"}) +
          "Examples:\n"
          "  tesselctl events -n 20\n"
          "  tesselctl events --sent --since yesterday --until today\n"
          "  tesselctl events show 42\n"
          "  tesselctl events | grep -c String1Value=week\n"
          "  tesselctl events --name '*.tessel_reporting_stats' --json\n"
          "  tesselctl events --follow --subsystem com.vantor.Calendar"};
}

}  // namespace

void addEventsCommand(CLI::App& app, Invocation& invocation) {
  const auto [command, options] = addCommand(app, invocation, eventsText(), runEvents);
  command
      .add_option("--since", options.period.since,
                  "Only events reported since then: 2026-11-22, '2026-11-22 21:45 CET', 21:45, "
                  "yesterday, monday, -24h, '2 hours ago'")
      ->type_name("DATE");
  command
      .add_option("--until", options.period.until,
                  "Only events reported before then, in the same forms")
      ->type_name("DATE");
  command
      .add_option("--last", options.period.last, "Only events of this length of time: 30m, 24h, 7d")
      ->type_name("DURATION");
  addPatterns(command, "--name", options.names, "Only events of this name; may be repeated");
  addPatterns(command, "--subsystem", options.subsystems,
              "Only payloads of this subsystem; may be repeated");
  addPatterns(command, "--category", options.categories,
              "Only payloads of this category; may be repeated");
  takesWhole(command.add_option("-n,--newest", options.newest, "Only so many, the newest"), 1,
             kMostRows, "rows")
      ->type_name("COUNT");
  auto* const sent = command.add_flag(
      "--sent", options.sent,
      "Only what was delivered; --since, --until and --last then mean the time of delivery");
  command.add_flag("--waiting", options.waiting, "Only what waits for delivery")->excludes(sent);
  command.add_flag("--follow", options.follow, "Go on with what is reported from now on");
  command.add_flag("--json", options.json,
                   "One JSON object a line: id, time, name, state, payload");
  CLI::App* show = command.add_subcommand("show", "Show one row whole, its payload laid out");
  show->add_option("ID", options.id, "The id of the row, as 'tesselctl events' shows it")
      ->required()
      ->type_name("");
  show->add_flag("--json", options.json, "One JSON object: id, time, name, payload");
  addColourOption(*show, invocation);
  // Without one of its own the parser repeats the notes of `events`, which are about lists.
  show->footer(
      helpText("A row that was delivered is found as well as one that waits. If the spool holds no "
               "row of that id, the ids that it holds are named, and the exit status is 1.") +
      "Example:\n"
      "  tesselctl events show 42");
  command.require_subcommand(0, 1);
}

}  // namespace tessel::ctl
