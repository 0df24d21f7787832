// explain: what becomes of each recorded trace point, and why.
//
// The filter of the service judges here, so we apply the rules of a run. Downsampling counts
// objects. So we judge every object first, and only then let the options choose which ones are
// shown.

#include <algorithm>
#include <memory>

#include "journal/EntryStream.h"
#include "linux/AppBundles.h"
#include "linux/SystemFacts.h"
#include "platform/Text.h"
#include "service/ObjectReporter.h"
#include "tesselctl/commands/Command.h"
#include "tesselctl/judging/ObjectSelection.h"
#include "tesselctl/judging/Tally.h"
#include "tesselctl/judging/Tasking.h"
#include "tesselctl/showing/ExplanationOutput.h"
#include "tesselctl/showing/Losses.h"
#include "tesselctl/showing/SummaryOutput.h"

namespace tessel::ctl {

namespace {

struct ExplainOptions {
  ReadingOptions reading;
  ObjectPatterns patterns;
  bool payload = false;
  bool summary = false;
  bool follow = false;
  bool json = false;
};

// Builds the payload with the code and the facts of a run, identities of processes included.
// A payload needs the mount table and the metadata of bundles, which cost file accesses. It is made
// only where --payload asks for it.
class PayloadBuilder {
 public:
  PayloadBuilder() : identity_(bundles_), bootVolume_(bootVolumeFacts(volumes_)) {}

  // Empty if a run would report nothing for the object.
  std::string json(const TesselObject& object) {
    const std::optional<Payload> payload = reportPayload(object, identity_, bootVolume_);
    return payload ? payloadJson(*payload, {.forTerminal = true}) : "";
  }

 private:
  MountTable volumes_;
  AppBundles bundles_{volumes_};
  ProcessIdentity identity_;
  const BootVolumeFacts bootVolume_;
};

class ExplainRun {
 public:
  ExplainRun(const ExplainOptions& options, const Reading& reading,
             const Surroundings& surroundings)
      : options_(options),
        reading_(reading),
        launch_(surroundings.launch),
        selection_(options.patterns),
        judge_(reading.machine),
        tally_(reading.period),
        terminal_(surroundings.terminal),
        now_(surroundings.now),
        lines_(terminal_, reading.period, options.follow ? std::optional(now_) : std::nullopt),
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
    // Judged before it is chosen: an object that is not shown has moved the counters of
    // downsampling all the same, as in a run.
    if (!selection_.chooses(object, decision.classification)) return;
    tally_.count(object, decision, entry);
    if (options_.summary) return;
    const Explanation explanation{
        object,
        entry,
        decision,
        run_.currentProcess(),
        judge_.downsamplingScope(object, decision),
        payloads_ && decision.shouldReport() ? payloads_->json(object) : ""};
    print(text(explanation));
  }

  std::string text(const Explanation& explanation) const {
    if (options_.json) return explanationJson(explanation);
    if (!terminal_.interactive) return explanationFields(explanation, options_.payload, terminal_);
    // The heading waits for the first row. Above nothing it would look like an answer.
    const bool first = tally_.traceObjects() == 1;
    return (first ? lines_.heading() : "") + lines_.lines(explanation);
  }

  // A reader of the pipe waits for each line, so the buffer is written whenever nothing more is to
  // be read for now.
  int follow() {
    const auto error = run_.follow(now_, flushWhileWaiting, [](const std::string& reason) {
      printError("Waiting for a journal: " + terminalText(reason) + "\n");
    });
    return error ? failToRead(*error, reading_.store) : kDone;
  }

  int readOnce() {
    // On a terminal the lines themselves show that the reading goes on.
    const auto error =
        readWithProgress(run_, reading_.period, options_.summary || !terminal_.interactive);
    if (error) return failToRead(*error, reading_.store);
    if (options_.summary) {
      print(options_.json ? summaryJson(tally_, run_.report())
                          : summaryText(tally_, run_.report(), terminal_));
    } else if (!options_.json && terminal_.interactive) {
      // Only rows go to a pipe, so that `wc -l` counts trace objects.
      print(closingLine());
    }
    flushOutput();
    if (!options_.json) tellWhatIsNotThere();
    return warnOfUnreadFiles(run_.report().store, reading_.store);
  }

  // The rows show what became an object. Whoever misses a point wants to know the rest, too. It
  // goes to standard error, so that a pipe gets rows alone.
  void tellWhatIsNotThere() {
    const auto say = [&](const std::string& line) {
      printError(wrapped(line, terminal_.width, 2) + "\n");
    };
    const std::string begins = openBegins();  // their names are among those that come near
    if (tally_.traceObjects() == 0) {
      for (const std::string& line : whyNothing()) say(line);
    }
    if (!begins.empty()) say(begins);
    if (!options_.summary) {
      const ExtractionReport report = run_.report();
      Losses lost;
      for (const Loss& loss : report.store.reading.losses.all()) {
        // warnOfUnreadFiles() names the damage of a stream.
        if (loss.code != LossCode::fileDamaged || reading_.store != kStandardInput) lost.add(loss);
      }
      for (const std::string& loss : lossLines(lost, 1)) say("Lost: " + terminalText(loss));
      if (const std::string unknown = unknownPrograms(lost); !unknown.empty()) say(unknown);
    }
    // A store that the command line names may be a copy from elsewhere.
    const Tasking tasking = askTasking(launch_);
    if (!options_.reading.store && tasking.isOff() &&
        tally_.verdicts()[TesselReporterClassificationTelemetryReported] != 0) {
      say("Reporting is off on this machine: " + terminalText(taskingWords(tasking, launch_)) +
          ". 'reported' tells what a run would report if it were on.");
    }
  }

  // An empty answer has four usual reasons: the wrong store, the wrong period, nothing recorded,
  // and a mistyped pattern. The lines let the reader tell them apart.
  std::vector<std::string> whyNothing() const {
    const ExtractionReport report = run_.report();
    const std::string store = reading_.store.value_or("the journal of this machine");
    std::vector<std::string> lines = {
        (report.delivered == 0 ? "No trace object: " : "No trace object fits: ") +
        counted(report.entriesRead, "log event", "log events") +
        (report.delivered == 0
             ? ""
             : " with " + counted(report.delivered, "trace object", "trace objects")) +
        " looked at, in " +
        terminalText(store == kStandardInput ? kStandardInputName : std::string_view(store)) +
        ", " + periodText(reading_.period)};
    for (const std::string& line : selection_.whyNone()) lines.push_back(terminalText(line));
    return lines;
  }

  // The begins among them that the patterns choose, with the first few of their names.
  std::string openBegins() {
    // Five names fit two lines. More would hide the losses that are told next.
    constexpr size_t kNamed = 5;
    std::vector<std::string> names;
    uint64_t begins = 0;
    run_.forEachOpen([&](StringRef subsystem, StringRef category, StringRef name) {
      if (!selection_.choosesBegin(subsystem, category, name)) return;
      ++begins;
      const std::string path = pathText(subsystem.textOr(""), category.textOr(""), name.textOr(""));
      if (names.size() < kNamed && std::ranges::find(names, path) == names.end())
        names.push_back(path);
    });
    if (begins == 0) return "";
    std::string words = counted(begins, "begin waits for its end", "begins wait for their ends") +
                        ", and " + (begins == 1 ? "is" : "are") + " no trace object before: ";
    for (const std::string& name : names) words += (&name == names.data() ? "" : ", ") + name;
    return words + (begins > names.size() ? ", ..." : "");
  }

  // Verdicts that no object got are left out here: the line is for a glance, and --summary has them
  // all.
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
  const LaunchConfiguration& launch_;
  ObjectSelection selection_;
  Judge judge_;
  Tally tally_;
  const Terminal& terminal_;
  const Date now_;
  const ExplanationLines lines_;
  std::unique_ptr<PayloadBuilder> payloads_;
  DryRun run_;
};

int runExplain(const ExplainOptions& options, const Surroundings& surroundings) {
  checkZone();
  const auto reading = readingOf(options.reading, surroundings);
  if (!reading) return kUsage;
  // A summary has an end, and what is followed has none. A period would have to be waited for.
  if (options.follow && (options.summary || options.reading.period.given())) {
    return fail(
        kUsage,
        "--follow shows what is recorded from now on; it goes with neither --summary nor a period");
  }
  if (options.follow && reading->store == kStandardInput) {
    return fail(
        kUsage,
        "--follow looks for new entries in files; --store - reads standard input to its end "
        "without --follow");
  }
  return ExplainRun(options, *reading, surroundings).explain();
}

// What a verdict means for the writer of a trace point.
std::string meaningOf(TesselReporterClassification verdict) {
  switch (verdict) {
    case TesselReporterClassificationTelemetryReported:
      return "it would be reported";
    case TesselReporterClassificationTelemetryDisabled:
      return "it is not marked for telemetry (TESSEL_TELEMETRY=1)";
    case TesselReporterClassificationFailedStringWhitelist:
      return "a labelled string has a value that stands on no list; 'tesselctl rules' shows them";
    case TesselReporterClassificationDurationThreshold:
      return "its duration is negative";
    case TesselReporterClassificationFailedSCFilter:
      return "only one in so many of these is reported; 'tesselctl rules' shows the rows";
    case TesselReporterClassificationClassNotSupported:
      return "its kind cannot be reported";
  }
  return "";
}

CommandText explainText() {
  std::vector<HelpRow> verdicts;
  for (const auto verdict : kVerdictOrder)
    verdicts.push_back({std::string(verdictName(verdict)), meaningOf(verdict)});
  return {
      "explain", "Say what becomes of each recorded trace point, and why",
      helpText("Nothing is reported, and neither run marker nor spool is touched. Downsampling "
               "begins at zero, as in a service that has just started. Without a period the "
               "last 24 hours are read, as in a run. Patterns may hold *, ? and [...]. Members "
               "of the group systemd-journal may read the journal.") +
          helpTable("Verdicts", verdicts) +
          helpText("Without a terminal a trace point is one line, with tabs between: time, "
                   "verdict, kind (event, interval, animation), subsystem, category, name, "
                   "reason, duration in seconds, frames per second, name of the process, its "
                   "id, its user; with --payload the payload. What is not known is empty. Standard "
                   "error tells of trace points in no row: begins that wait for their ends, "
                   "and losses.") +
          helpEnvironment({"TESSEL_TRACE_STORE", "TESSEL_OS_RELEASE", "TZ"}) +
          "Examples:\n"
          "  tesselctl explain --last 1h --subsystem 'com.vantor.*' \\\n"
          "    --verdict string_whitelist\n"
          "  tesselctl explain --follow\n"
          "  tesselctl explain --summary\n"
          "  tesselctl explain --last 7d | cut -f 2 | sort | uniq -c"};
}

// From the same table as the output, so that the help and the completion offer each word that can
// occur, and no other.
std::vector<std::string> verdictWords() {
  std::vector<std::string> words;
  for (const auto verdict : kVerdictOrder) words.emplace_back(verdictName(verdict));
  return words;
}

}  // namespace

void addExplainCommand(CLI::App& app, Invocation& invocation) {
  const auto [command, options] = addCommand(app, invocation, explainText(), runExplain);
  addPeriodOptions(command, options.reading);
  addJudgeOptions(command, options.reading);
  addPatterns(command, "--subsystem", options.patterns.subsystems,
              "Only trace points of this subsystem; may be repeated");
  addPatterns(command, "--category", options.patterns.categories,
              "Only of this category; may be repeated");
  addPatterns(command, "--name", options.patterns.names, "Only of this name; may be repeated");
  takesOneOf(addPatterns(command, "--verdict", options.patterns.verdicts,
                         "Only with this verdict; may be repeated"),
             verdictWords())
      ->type_name("VERDICT");
  auto* const payload =
      command.add_flag("--payload", options.payload, "Show the payload of what would be reported");
  command.add_flag("--summary", options.summary, "Show figures instead of trace points")
      ->excludes(payload);
  command.add_flag("--follow", options.follow, "Go on with what is recorded from now on");
  command.add_flag("--json", options.json, "One JSON object a line; with --summary one object");
}

}  // namespace tessel::ctl
