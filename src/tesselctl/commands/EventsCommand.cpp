// events: what the spool holds, newest last.

#include <fnmatch.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <chrono>
#include <deque>
#include <memory>
#include <nlohmann/json.hpp>
#include <thread>

#include "linux/SystemFacts.h"
#include "platform/Text.h"
#include "tesselctl/commands/Environment.h"
#include "tesselctl/commands/ReadingOptions.h"
#include "tesselctl/reading/SpoolReader.h"
#include "tesselctl/showing/Terminal.h"

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

constexpr std::chrono::milliseconds kLookForRowsEvery{200};

// What a payload says about itself.
Json parsed(std::string_view payload) { return Json::parse(payload, nullptr, false); }

std::string member(const Json& payload, const char* key) {
  const auto found = payload.is_object() ? payload.find(key) : payload.end();
  return found != payload.end() && found->is_string() ? found->get<std::string>() : "";
}

bool matches(const std::vector<std::string>& patterns, const std::string& text) {
  if (patterns.empty()) return true;
  for (const std::string& pattern : patterns) {
    if (::fnmatch(pattern.c_str(), text.c_str(), 0) == 0) return true;
  }
  return false;
}

class RowSelection {
 public:
  RowSelection(const EventsOptions& options, std::optional<Period> period)
      : options_(options), period_(period) {}

  bool wants(const SpoolRow& row) const {
    const Date date{std::chrono::microseconds{row.time}};
    if (period_ && (date < period_->start || date >= period_->end)) return false;
    if (!matches(options_.names, std::string(row.name))) return false;
    if (options_.subsystems.empty() && options_.categories.empty()) return true;
    const Json payload = parsed(row.payload);
    return matches(options_.subsystems, member(payload, "Subsystem")) &&
           matches(options_.categories, member(payload, "Category"));
  }

 private:
  const EventsOptions& options_;
  const std::optional<Period> period_;
};

std::string rowJson(const SpoolRow& row) {
  return objectLine([&](JsonWriter& json) {
    json.member("id", row.id).member("time", row.time).member("name", row.name);
    if (Json::accept(row.payload))
      json.rawMember("payload", replaceInvalidUtf8(row.payload));
    else
      json.member("payload_text", row.payload);
  });
}

// The payload's values beside their keys, for a glance; the rest of it is for --json.
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

// Names that begin alike differ at their ends, and the payload tells a per-name event's path.
std::string shownName(std::string_view name) {
  constexpr std::string_view kCommon = "com.vantor.performance.";
  if (name.starts_with(kCommon)) return "~" + terminalText(name.substr(kCommon.size()));
  return terminalText(name);
}

constexpr size_t kEventWidth = 24;

std::string humanLine(const SpoolRow& row, const Terminal& terminal) {
  std::string name = shortened(shownName(row.name), kEventWidth);
  name.append(kEventWidth - std::min(kEventWidth, displayWidth(name)), ' ');
  const std::string time = dateText(Date{std::chrono::microseconds{row.time}}).substr(5);
  const size_t used = time.size() + 2 + kEventWidth + 2;
  const std::string payload = cutOff(glance(parsed(row.payload), row.payload),
                                     terminal.width - std::min(used, terminal.width - 1));
  return terminal.paint(Colour::faint, time) + "  " + name + "  " + payload + "\n";
}

class EventsRun {
 public:
  EventsRun(const EventsOptions& options, std::optional<Period> period, SpoolReader& spool)
      : options_(options),
        selection_(options, period),
        spool_(spool),
        terminal_(terminalBehind(STDOUT_FILENO)) {}

  int list() {
    const SpoolReader::State state = spool_.open();
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
        fail(kBad, "the spool is damaged: " + spool_.reason());
        printError("The service sets it aside in its next run and begins a new one.\n");
        return kBad;
    }
  }

  // The rows that are new; with --newest, the last of them.
  bool show() {
    std::deque<std::string> last;
    const bool limited = options_.newest != 0;
    const bool read = spool_.readNew([&](const SpoolRow& row) {
      if (!selection_.wants(row)) return true;
      std::string line = options_.json ? rowJson(row) : humanLine(row, terminal_);
      if (!limited || followed_) {
        print(line);
        return true;
      }
      last.push_back(std::move(line));
      if (last.size() > options_.newest) last.pop_front();
      return true;
    });
    for (const std::string& line : last) print(line);
    std::fflush(stdout);
    return read;
  }

  int follow() {
    followed_ = true;
    for (;;) {
      std::this_thread::sleep_for(kLookForRowsEvery);
      const SpoolReader::State state = spool_.open();
      if (state == SpoolReader::State::noAccess) return complain(state);
      // A damaged spool is about to be set aside, an absent one to be made.
      if (state == SpoolReader::State::open) show();
    }
  }

  const EventsOptions& options_;
  const RowSelection selection_;
  SpoolReader& spool_;
  const Terminal terminal_;
  bool followed_ = false;
};

int runEvents(const EventsOptions& options) {
  const auto launch = launchConfiguration();
  if (!launch) return kUsage;
  std::optional<Period> period;
  if (options.period.given()) {
    const PeriodResult result = periodOf(options.period, SystemClock().now());
    if (!result.period) return fail(kUsage, result.error);
    period = result.period;
    // What is sent from now on is not in a period that ends now.
    if (options.follow && options.period.until.empty()) period->end = Date::max();
  }
  SpoolReader spool(launch->stateDirectory);
  return EventsRun(options, period, spool).list();
}

constexpr char kEventsFooter[] =
    "The spool is statora.db in the state directory ($TESSEL_STATE_DIR): one row per event sent, "
    "in\n"
    "order. '~' stands for 'com.vantor.performance.'. Patterns may hold * and ?.\n\n"
    "Examples:\n"
    "  tesselctl events -n 20\n"
    "  tesselctl events --name com.vantor.performance.tessel_reporting_stats --json\n"
    "  tesselctl events --follow --subsystem com.vantor.Calendar";

}  // namespace

void addEventsCommand(CLI::App& app, Invocation& invocation) {
  const auto options = std::make_shared<EventsOptions>();
  CLI::App* command = app.add_subcommand("events", "Show what the spool holds, newest last");
  command->add_option("--since", options->period.since,
                      "Only events sent since then; see 'tesselctl explain --help'");
  command->add_option("--until", options->period.until, "Only events sent before then");
  command->add_option("--last", options->period.last,
                      "Only events of this length of time: 30m, 24h, 7d");
  const auto filter = [&](const char* name, std::vector<std::string>& values, const char* help) {
    command->add_option(name, values, help)->allow_extra_args(false)->type_name("PATTERN");
  };
  filter("--name", options->names, "Only events of this name; may be repeated");
  filter("--subsystem", options->subsystems, "Only payloads of this subsystem; may be repeated");
  filter("--category", options->categories, "Only payloads of this category; may be repeated");
  command->add_option("-n,--newest", options->newest, "Only so many, the newest")
      ->type_name("COUNT");
  command->add_flag("--follow", options->follow, "Go on with what is sent from now on");
  command->add_flag("--json", options->json, "One JSON object a line: id, time, name, payload");
  command->footer(kEventsFooter);
  command->callback([&invocation, options] { invocation.status = runEvents(*options); });
}

}  // namespace tessel::ctl
