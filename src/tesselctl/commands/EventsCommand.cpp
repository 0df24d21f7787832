// events: what the spool holds, newest last.
//
// We read the database beside the service and never write to it. Rows are printed page by page, so
// a spool of many megabytes needs no more memory than a page, or than the rows that -n asks for.

#include <chrono>
#include <deque>
#include <nlohmann/json.hpp>
#include <thread>

#include "platform/Text.h"
#include "tesselctl/commands/Command.h"
#include "tesselctl/reading/SpoolReader.h"

namespace tessel::ctl {

namespace {

using Json = nlohmann::ordered_json;

struct EventsOptions {
  PeriodArguments period;
  std::vector<std::string> names;
  std::vector<std::string> subsystems;
  std::vector<std::string> categories;
  size_t newest = 0;  // 0: all
  bool follow = false;
  bool json = false;
};

// SQLite does not tell other processes of a new row, so --follow must look. Five looks a second
// seem immediate to people and cost one short query each.
constexpr std::chrono::milliseconds kLookForRowsEvery{200};

// The payload as JSON. A payload that is no JSON gives a "discarded" value instead of an exception;
// a discarded value is no object, so member() finds nothing in it.
Json parsed(std::string_view payload) { return Json::parse(payload, nullptr, false); }

std::string member(const Json& payload, const char* key) {
  const auto found = payload.is_object() ? payload.find(key) : payload.end();
  return found != payload.end() && found->is_string() ? found->get<std::string>() : "";
}

class RowSelection {
 public:
  RowSelection(const EventsOptions& options, std::optional<Period> period)
      : options_(options), period_(period) {}

  bool wants(const SpooledEvent& row) const {
    const Date date{std::chrono::microseconds{row.time}};
    // The end is not in the period, so two periods that touch never share a row.
    if (period_ && (date < period_->start || date >= period_->end)) return false;
    if (!fitsOne(options_.names, row.name)) return false;
    // Parsing costs more than all other tests. It comes last, and only if a pattern needs it.
    if (options_.subsystems.empty() && options_.categories.empty()) return true;
    const Json payload = parsed(row.payload);
    return fitsOne(options_.subsystems, member(payload, "Subsystem")) &&
           fitsOne(options_.categories, member(payload, "Category"));
  }

 private:
  const EventsOptions& options_;
  const std::optional<Period> period_;
};

std::string rowJson(const SpooledEvent& row) {
  return objectLine([&](JsonWriter& json) {
    json.member("id", row.id).member("time", row.time).member("name", row.name);
    // Any writer of the spool may have made this row. A payload that is no JSON would break the
    // line around it, so it goes out as a text under another key. A script can tell the two by the
    // key.
    if (Json::accept(row.payload))
      json.rawMember("payload", replaceInvalidUtf8(row.payload));
    else
      json.member("payload_text", row.payload);
  });
}

// The payload as one line "path key=value ...". A glance is enough here; --json shows all of it.
std::string glance(const Json& payload, std::string_view text) {
  if (!payload.is_object()) return terminalText(text);
  std::string path;
  for (const char* key : {"Subsystem", "Category", "Name"}) {
    const std::string value = member(payload, key);
    if (!value.empty()) path += (path.empty() ? "" : "/") + value;
  }
  std::string out = terminalText(path);
  for (const auto& [key, value] : payload.items()) {
    if (key == "Subsystem" || key == "Category" || key == "Name") continue;
    out += (out.empty() ? "" : " ") + terminalText(key) + "=";
    out += terminalText(value.is_string()
                            ? value.get_ref<const std::string&>()
                            : value.dump(-1, ' ', false, Json::error_handler_t::replace));
  }
  return out;
}

// All events of the service share one prefix. Without it the rest of the name, which differs, fits
// the column.
std::string shownName(std::string_view name) {
  constexpr std::string_view kCommon = "com.vantor.performance.";
  if (name.starts_with(kCommon)) return "~" + terminalText(name.substr(kCommon.size()));
  return terminalText(name);
}

constexpr size_t kEventWidth = 24;

std::string humanLine(const SpooledEvent& row, const Terminal& terminal) {
  std::string name = shortened(shownName(row.name), kEventWidth);
  name.append(kEventWidth - std::min(kEventWidth, displayWidth(name)), ' ');
  const std::string time = dateText(Date{std::chrono::microseconds{row.time}}).substr(5);
  // The payload gets the rest of the line, and one column at least on a narrow terminal.
  const size_t used = time.size() + 2 + kEventWidth + 2;
  const std::string payload = cutOff(glance(parsed(row.payload), row.payload),
                                     terminal.width - std::min(used, terminal.width - 1));
  return terminal.paint(Colour::faint, time) + "  " + name + "  " + payload + "\n";
}

class EventsRun {
 public:
  EventsRun(const EventsOptions& options, std::optional<Period> period,
            const Surroundings& surroundings)
      : options_(options),
        selection_(options, period),
        spool_(surroundings.launch.stateDirectory),
        terminal_(surroundings.terminal) {}

  int list() {
    const SpoolReader::State state = spool_.open();
    // A machine that has sent nothing has no spool. With --follow the user waits for just that.
    if (state == SpoolReader::State::absent && options_.follow) {
      printError("There is no spool yet: nothing was sent. Waiting for " +
                 terminalText(spool_.path()) + ".\n");
    } else if (state != SpoolReader::State::open) {
      return complain(state);
    } else if (!show()) {
      return complain(SpoolReader::State::damaged);
    }
    return options_.follow ? follow() : kDone;
  }

 private:
  int complain(SpoolReader::State state) {
    switch (state) {
      case SpoolReader::State::absent:
        return fail(kBad, "there is no spool at " + spool_.path() +
                              ": nothing was sent, or TESSEL_STATE_DIR names another place");
      case SpoolReader::State::noAccess:
        fail(kNoAccess, spool_.reason());
        printError("Run tesselctl as root, or as the user that the service runs as.\n");
        return kNoAccess;
      default:
        if (!spool_.damaged()) return fail(kBad, "the spool cannot be read: " + spool_.reason());
        fail(kBad, "the spool is damaged: " + spool_.reason());
        printError("The service sets it aside in its next run and begins a new one.\n");
        return kBad;
    }
  }

  // Prints the rows that are new. Returns false if the spool cannot be read. --newest limits the
  // first look alone: under --follow each later row is new and must be shown.
  bool show() {
    std::deque<std::string> last;
    const bool limited = options_.newest != 0;
    const bool read = spool_.readNew([&](const SpooledEvent& row) {
      if (!selection_.wants(row)) return;
      std::string line = options_.json ? rowJson(row) : humanLine(row, terminal_);
      if (!limited || followed_) {
        print(line);
        return;
      }
      // The number of rows is not known before the last one is read, so we keep the newest lines
      // and drop the oldest of them. Memory stays bounded by -n.
      last.push_back(std::move(line));
      if (last.size() > options_.newest) last.pop_front();
    });
    for (const std::string& line : last) print(line);
    // With --follow a reader of the pipe waits for these rows. A buffer would hold them back.
    std::fflush(stdout);
    return read;
  }

  int follow() {
    followed_ = true;
    for (;;) {
      std::this_thread::sleep_for(kLookForRowsEvery);
      // A spool may go and come back: the service replaces a damaged one. A damaged spool stays
      // what it is until the next run, which may be a day away, so nobody should wait for that.
      SpoolReader::State state = spool_.open();
      if (state == SpoolReader::State::absent) continue;
      if (state == SpoolReader::State::open && !show()) state = SpoolReader::State::damaged;
      if (state != SpoolReader::State::open && !spool_.locked()) return complain(state);
    }
  }

  const EventsOptions& options_;
  const RowSelection selection_;
  SpoolReader spool_;
  const Terminal& terminal_;
  bool followed_ = false;
};

int runEvents(const EventsOptions& options, const Surroundings& surroundings) {
  std::optional<Period> period;
  if (options.period.given()) {
    const PeriodResult result = periodOf(options.period, surroundings.now);
    if (!result.period) return fail(kUsage, result.error);
    period = result.period;
    // Without --until a period ends now. Every row that --follow waits for would lie behind it.
    if (options.follow && options.period.until.empty()) period->end = Date::max();
  }
  return EventsRun(options, period, surroundings).list();
}

const CommandText kEvents{
    "events", "Show what the spool holds, newest last",
    "The spool is statora.db in the state directory ($TESSEL_STATE_DIR): one row per event sent, "
    "in\n"
    "order. '~' stands for 'com.vantor.performance.'. Patterns may hold * and ?.\n\n"
    "Examples:\n"
    "  tesselctl events -n 20\n"
    "  tesselctl events --name com.vantor.performance.tessel_reporting_stats --json\n"
    "  tesselctl events --follow --subsystem com.vantor.Calendar"};

}  // namespace

void addEventsCommand(CLI::App& app, Invocation& invocation) {
  const auto [command, options] = addCommand(app, invocation, kEvents, runEvents);
  command.add_option("--since", options.period.since,
                     "Only events sent since then; see 'tesselctl explain --help'");
  command.add_option("--until", options.period.until, "Only events sent before then");
  command.add_option("--last", options.period.last,
                     "Only events of this length of time: 30m, 24h, 7d");
  addPatterns(command, "--name", options.names, "Only events of this name; may be repeated");
  addPatterns(command, "--subsystem", options.subsystems,
              "Only payloads of this subsystem; may be repeated");
  addPatterns(command, "--category", options.categories,
              "Only payloads of this category; may be repeated");
  command.add_option("-n,--newest", options.newest, "Only so many, the newest")->type_name("COUNT");
  command.add_flag("--follow", options.follow, "Go on with what is sent from now on");
  command.add_flag("--json", options.json, "One JSON object a line: id, time, name, payload");
}

}  // namespace tessel::ctl
