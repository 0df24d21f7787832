// explain: what becomes of each recorded trace point, and why.

#include <fnmatch.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <memory>
#include <vector>

#include "journal/EntryStream.h"
#include "linux/SystemFacts.h"
#include "platform/Text.h"
#include "service/ObjectReporter.h"
#include "tesselctl/commands/ReadingOptions.h"
#include "tesselctl/judging/Tally.h"
#include "tesselctl/showing/SummaryOutput.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

namespace {

struct ExplainOptions {
  ReadingOptions reading;
  std::vector<std::string> subsystems;
  std::vector<std::string> categories;
  std::vector<std::string> names;
  std::vector<std::string> verdicts;
  bool payload = false;
  bool summary = false;
  bool follow = false;
  bool json = false;
};

// Which trace objects are shown.
class ObjectSelection {
 public:
  explicit ObjectSelection(const ExplainOptions& options) : options_(options) {}

  bool wants(const TesselObject& object, TesselReporterClassification verdict) const {
    return matches(options_.subsystems, object.subsystem()) &&
           matches(options_.categories, object.category()) &&
           matches(options_.names, object.name()) &&
           isOneOf(options_.verdicts, verdictName(verdict));
  }

 private:
  static bool isOneOf(const std::vector<std::string>& wanted, std::string_view name) {
    return wanted.empty() || std::find(wanted.begin(), wanted.end(), name) != wanted.end();
  }
  static bool matches(const std::vector<std::string>& patterns, StringRef text) {
    if (patterns.empty()) return true;
    const std::string value(text.textOr(""));
    return std::any_of(patterns.begin(), patterns.end(), [&](const std::string& pattern) {
      return ::fnmatch(pattern.c_str(), value.c_str(), 0) == 0;
    });
  }

  const ExplainOptions& options_;
};

// Builds what would be sent, as the run does.
class PayloadBuilder {
 public:
  PayloadBuilder() : identity_(bundles_), bootVolume_(bootVolumeFacts(volumes_)) {}

  // Empty where nothing would be sent.
  std::string json(const TesselObject& object) {
    const std::optional<Payload> payload = reportPayload(object, identity_, bootVolume_);
    return payload ? payloadJson(*payload, {.forTerminal = true}) : "";
  }

 private:
  AppBundles bundles_;
  MountTable volumes_;
  ProcessIdentity identity_;
  const BootVolumeFacts bootVolume_;
};

// One trace object and what became of it.
struct Explanation {
  const TesselObject& object;
  const EntryHeader& entry;
  const FilterDecision& decision;
  std::string scope;    // of the downsampling entry that was asked
  std::string payload;  // JSON; empty where there is none or none is wanted
};

std::string explanationJson(const Explanation& explanation) {
  const auto& [object, entry, decision, scope, payload] = explanation;
  return objectLine([&, &object = object, &entry = entry, &decision = decision, &scope = scope,
                     &payload = payload](JsonWriter& json) {
    json.member("classification", decision.classification);
    json.member("verdict", verdictName(decision.classification));
    json.member("kind", object.tesselType()).member("time", entry.realtime);
    json.member("subsystem", object.subsystem()).member("category", object.category());
    json.member("name", object.name());
    addRule(json, decision, scope);
    json.member("cursor", cursorOf(entry));
    if (!payload.empty()) json.rawMember("payload", payload);
  });
}

constexpr size_t kNameWidth = 60;     // columns of a subsystem, category or name
constexpr size_t kVerdictWidth = 18;  // of the longest verdict
constexpr size_t kKindWidth = 9;
constexpr size_t kFooterWidth = 94;  // as wide as the help text around it

std::string padded(std::string text, size_t width) {
  text.resize(std::max(width, text.size()), ' ');
  return text;
}

std::string shownPath(const TesselObject& object) {
  std::string path = shortened(terminalText(object.subsystem().textOr("-")), kNameWidth);
  path += " / " + shortened(terminalText(object.category().textOr("-")), kNameWidth);
  if (object.name()) path += " / " + shortened(terminalText(object.name().text()), kNameWidth);
  return path;
}

std::string shownKind(const TesselObject& object) {
  return object.isKindOf(TesselClass::animationInterval) ? "animation"
         : object.isKindOf(TesselClass::interval)        ? "interval"
                                                         : "event";
}

class HumanLines {
 public:
  HumanLines(const Terminal& terminal, const Period& period)
      : terminal_(terminal), withDay_(period.length() > std::chrono::hours{24}) {}

  std::string heading() const {
    return terminal_.paint(Colour::faint, padded("TIME", timeWidth()) +
                                              padded("VERDICT", kVerdictWidth + 2) +
                                              padded("KIND", kKindWidth + 2) + "TRACE POINT") +
           "\n";
  }
  std::string lines(const Explanation& explanation) const {
    const FilterDecision& decision = explanation.decision;
    const Date date{std::chrono::microseconds{static_cast<int64_t>(explanation.entry.realtime)}};
    const std::string time = withDay_ ? dateText(date).substr(5) : timeOfDayText(date);
    const size_t indent = timeWidth() + kVerdictWidth + 2 + kKindWidth + 2;
    std::string out = padded(time, timeWidth());
    out += terminal_.paint(
        verdictColour(decision.classification),
        padded(std::string(verdictName(decision.classification)), kVerdictWidth + 2));
    out += padded(shownKind(explanation.object), kKindWidth + 2);
    out += indented(shownPath(explanation.object), indent);
    if (const std::string why = ruleWords(decision, explanation.scope); !why.empty()) {
      out += std::string(timeWidth(), ' ') + indented(why, timeWidth());
    }
    if (!explanation.payload.empty())
      out += std::string(timeWidth(), ' ') + explanation.payload + "\n";
    return out;
  }

 private:
  size_t timeWidth() const { return withDay_ ? 16 : 10; }
  std::string indented(const std::string& text, size_t indent) const {
    const size_t room = std::max(terminal_.width, indent + 12) - indent;
    std::string out = wrapped(text, room, 0);
    for (size_t at = out.find('\n'); at != std::string::npos;
         at = out.find('\n', at + indent + 1)) {
      out.insert(at + 1, indent, ' ');
    }
    return out + "\n";
  }

  const Terminal terminal_;
  const bool withDay_;
};

class ExplainRun {
 public:
  ExplainRun(const ExplainOptions& options, const Reading& reading)
      : options_(options),
        reading_(reading),
        selection_(options),
        judge_(reading.machine),
        tally_(reading.period),
        terminal_(terminalBehind(STDOUT_FILENO)),
        lines_(terminal_, reading.period),
        run_(reading.store, [this](const TesselObject& object, const EntryHeader& entry) {
          inspect(object, entry);
          return true;
        }) {
    if (options.payload) payloads_ = std::make_unique<PayloadBuilder>();
  }

  int explain() { return options_.follow ? follow() : readOnce(); }

 private:
  void inspect(const TesselObject& object, const EntryHeader& entry) {
    const FilterDecision decision = judge_.inspect(object);
    if (!selection_.wants(object, decision.classification)) return;
    tally_.count(object, decision, entry);
    if (options_.summary) return;
    const Explanation explanation{
        object, entry, decision, judge_.downsamplingScope(object, decision),
        payloads_ && decision.shouldReport() ? payloads_->json(object) : ""};
    if (!options_.json && tally_.traceObjects() == 1) print(lines_.heading());
    print(options_.json ? explanationJson(explanation) : lines_.lines(explanation));
  }

  int follow() {
    const auto error = run_.follow(SystemClock().now(), [] { std::fflush(stdout); });
    return error ? failToRead(error->words, reading_.store) : kDone;
  }

  int readOnce() {
    ProgressBar bar(options_.summary || !terminal_.interactive);
    const auto error = run_.read(reading_.period,
                                 [&](double part, uint64_t entries) { bar.update(part, entries); });
    bar.clear();
    if (error) return failToRead(error->words, reading_.store);
    if (options_.summary) {
      print(options_.json ? summaryJson(tally_, run_.report())
                          : summaryText(tally_, run_.report(), terminal_));
    } else if (!options_.json) {
      print(closingLine());
    }
    std::fflush(stdout);
    return warnOfUnreadFiles(run_.report().store, reading_.store, kDone);
  }

  std::string closingLine() const {
    std::string counts;
    for (const auto verdict : kVerdictOrder) {
      const uint64_t count = tally_.verdicts()[verdict];
      if (count != 0)
        counts +=
            (counts.empty() ? "" : ", ") + grouped(count) + " " + std::string(verdictName(verdict));
    }
    return "\n" +
           wrapped(counted(run_.report().entriesRead, "log event", "log events") + ", " +
                       counted(tally_.traceObjects(), "trace object", "trace objects") +
                       (counts.empty() ? "" : ": " + counts),
                   terminal_.width, 2) +
           "\n";
  }

  const ExplainOptions& options_;
  const Reading& reading_;
  const ObjectSelection selection_;
  Judge judge_;
  Tally tally_;
  const Terminal terminal_;
  const HumanLines lines_;
  std::unique_ptr<PayloadBuilder> payloads_;
  DryRun run_;
};

int runExplain(const ExplainOptions& options) {
  const auto launch = launchConfiguration();
  if (!launch) return kUsage;
  const auto reading = readingOf(options.reading, *launch, SystemClock().now());
  if (!reading) return kUsage;
  if (options.follow && (options.summary || options.reading.period.given())) {
    return fail(
        kUsage,
        "--follow shows what is recorded from now on; it goes with neither --summary nor a period");
  }
  return ExplainRun(options, *reading).explain();
}

std::string explainFooter() {
  std::string verdicts;
  for (const ClassificationRow& row : kClassifications)
    verdicts += (verdicts.empty() ? "Verdicts: " : ", ") + std::string(row.name);
  return "Nothing is sent, and neither run marker nor spool is touched. Downsampling begins at "
         "zero, "
         "as\n"
         "in a service that has just started. Without a period the last 24 hours are read, as in a "
         "run.\n"
         "Patterns may hold * and ?. Members of the group systemd-journal may read the "
         "journal.\n\n" +
         wrapped(verdicts + ".", kFooterWidth, 0) +
         "\n\n"
         "Examples:\n"
         "  tesselctl explain --last 1h --subsystem 'com.vantor.*' --verdict string_whitelist\n"
         "  tesselctl explain --follow\n"
         "  tesselctl explain --summary";
}

void addFilterOptions(CLI::App& command, ExplainOptions& options) {
  const auto filter = [&](const char* name, std::vector<std::string>& values, const char* help) {
    return command.add_option(name, values, help)->allow_extra_args(false)->type_name("PATTERN");
  };
  filter("--subsystem", options.subsystems, "Only trace points of this subsystem; may be repeated");
  filter("--category", options.categories, "Only of this category; may be repeated");
  filter("--name", options.names, "Only of this name; may be repeated");
  filter("--verdict", options.verdicts, "Only with this verdict; may be repeated")
      ->type_name("VERDICT")
      ->check([](const std::string& name) {
        const bool known = std::ranges::count(kClassifications, name, &ClassificationRow::name);
        return known ? "" : "'" + terminalText(name) + "' is no verdict";
      });
}

}  // namespace

void addExplainCommand(CLI::App& app, Invocation& invocation) {
  const auto options = std::make_shared<ExplainOptions>();
  CLI::App* command =
      app.add_subcommand("explain", "Say what becomes of each recorded trace point, and why");
  addPeriodOptions(*command, options->reading);
  addJudgeOptions(*command, options->reading);
  addFilterOptions(*command, *options);
  command->add_flag("--payload", options->payload, "Show the payload of what would be sent");
  command->add_flag("--summary", options->summary, "Show figures instead of trace points");
  command->add_flag("--follow", options->follow, "Go on with what is recorded from now on");
  command->add_flag("--json", options->json, "One JSON object a line; with --summary one object");
  command->footer(explainFooter());
  command->callback([&invocation, options] { invocation.status = runExplain(*options); });
}

}  // namespace tessel::ctl
