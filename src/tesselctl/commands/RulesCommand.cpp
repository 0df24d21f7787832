// rules: what this build knows, and whether a value or a trace point would pass.
//
// The lists, the rows and the filter are those of the service. A check makes the trace point in
// question and lets the filter judge it; the lists are searched only to show what decided.

#include <algorithm>
#include <deque>
#include <span>

#include "platform/Invariant.h"
#include "platform/Text.h"
#include "tesselctl/commands/Command.h"
#include "tesselctl/commands/RecordedPoint.h"
#include "tesselctl/showing/RulesOutput.h"
#include "whitelist/StringWhitelist.h"

namespace tessel::ctl {

namespace {

struct RulesOptions {
  ReadingOptions reading;
  bool json = false;
  bool markdown = false;
  std::vector<std::string> words;  // of `rules check`
  std::array<std::optional<Labelled>, kLabelledStrings> strings;
};

// A marked event. Owns the texts that the event borrows.
class MarkedEvent {
 public:
  // Marked, since an unmarked trace point fails before any list is asked, and the answer would be
  // the same for each word.
  MarkedEvent(const RecordedPoint& point) : event_(fieldsFor(point), {}) {}
  const TesselEvent& event() const { return event_; }

 private:
  StringRef kept(const std::string& text) { return texts_.emplace_back(text); }

  TracePointFields fieldsFor(const RecordedPoint& point) {
    TracePointFields fields;
    fields.telemetryEnabled = true;
    if (!point.subsystem.empty()) fields.subsystem = kept(point.subsystem);
    if (!point.category.empty()) fields.category = kept(point.category);
    if (point.name) fields.name = kept(*point.name);
    for (size_t slot = 0; slot < point.strings.size(); ++slot) {
      if (const auto& string = point.strings[slot])
        fields.strings[slot] = {kept(string->label), kept(string->value)};
    }
    return fields;
  }

  std::deque<SharedString> texts_;  // a deque never moves what it holds
  const TesselEvent event_;
};

// The lists that a labelled string may stand on. The rule for performance logging has one list for
// each slot; any other trace point may use all lists of its platform.
std::vector<const StringListRow*> listsFor(const TesselObject& object, size_t slot,
                                           const PlatformProfile& profile) {
  static constexpr StringListSource kRoles[] = {perfLoggingComponentNames, perfLoggingActionNames};
  static_assert(std::size(kRoles) == kLabelledStrings);
  if (profile.hasPerfLoggingRule &&
      isPerfLoggingOperation(object.subsystem(), object.category(), object.name()))
    return listRows({&kRoles[slot], 1});
  return listRows(profile.whitelist);
}

StringAnswer answerFor(const TesselObject& object, size_t slot, const PlatformProfile& profile) {
  const LabelledString& string = object.labelledStrings()[slot];
  StringAnswer answer;
  answer.slot = slot + 1;
  answer.present = string.value.present();
  answer.label = string.label.textOr("");
  answer.value = string.value.textOr("");
  answer.allowed = listsFor(object, slot, profile);
  answer.list = listWith(answer.allowed, answer.value);
  if (answer.list == nullptr) {
    answer.near = nearValues(answer.allowed, answer.value);
    // A value that is known elsewhere was most often checked against the wrong platform.
    for (const PlatformProfile& other : platformProfiles()) {
      if (&other != &profile && listWith(listRows(other.whitelist), answer.value) != nullptr)
        answer.elsewhere.push_back(other.name);
    }
  }
  return answer;
}

CheckAnswer judge(const RecordedPoint& point, const JudgedMachine& machine) {
  const MarkedEvent marked(point);
  const TesselEvent& event = marked.event();
  const PlatformProfile& profile = profileOf(machine.platform);
  Judge judge(machine);
  FilterDecision decision = judge.inspect(event);
  // An entry lets every ratio-th object through. The ratio-th one shows whether any passes at all.
  const uint64_t attempts =
      decision.downsampleEntry == nullptr ? 1 : decision.downsampleEntry->downsampleRatio();
  for (uint64_t seen = 1; seen < attempts && !decision.shouldReport(); ++seen)
    decision = judge.inspect(event);

  CheckAnswer answer;
  answer.machine = machine;
  answer.passes = decision.shouldReport();
  answer.verdict = verdictName(decision.classification);
  answer.failedSlot = decision.stringSlot;
  answer.special = decision.specialRule;
  if (const TRDownsampleEntry* entry = decision.downsampleEntry)
    answer.downsampling = {judge.downsamplingScope(event, decision), entry->cap(),
                           entry->downsampleRatio()};
  for (size_t slot = 0; slot < kLabelledStrings; ++slot) {
    if (point.strings[slot] || decision.stringSlot == slot + 1)
      answer.strings.push_back(answerFor(event, slot, profile));
  }
  // The filter has its own sets of the same lists. If a list holds the value that the filter
  // refused, then we show a list that the service does not use.
  for (const StringAnswer& string : answer.strings)
    TESSEL_INVARIANT(string.slot != decision.stringSlot || string.list == nullptr);
  return answer;
}

// A value alone is judged in a trace point without a path: no downsampling row covers that, so the
// lists alone decide.
int check(const RulesOptions& options, const JudgedMachine& machine,
          const Surroundings& surroundings) {
  RecordedPoint point;
  point.telemetry = true;
  point.strings = options.strings;
  const bool wholePoint = options.words.size() == 3;
  if (wholePoint) {
    point.subsystem = options.words[0];
    point.category = options.words[1];
    point.name = options.words[2];
    // What `record` would refuse never reaches the service.
    const auto fields = fieldsOf(point);
    if (const auto* complaint = std::get_if<std::string>(&fields)) return fail(kUsage, *complaint);
  } else if (options.words.size() != 1) {
    return fail(kUsage, "'rules check' takes one VALUE, or SUBSYSTEM CATEGORY NAME");
  } else if (point.strings[0] || point.strings[1]) {
    return fail(kUsage, "--string1 and --string2 need SUBSYSTEM CATEGORY NAME");
  } else {
    point.strings[0] = Labelled{"value", options.words[0]};
  }
  CheckAnswer answer = judge(point, machine);
  if (wholePoint) answer.path = options.words;
  print(options.json ? checkJson(answer) : checkText(answer, surroundings.terminal));
  return answer.passes ? kDone : kBad;
}

int runRules(const RulesOptions& options, const Surroundings& surroundings) {
  const auto reading = readingOf(options.reading, surroundings);
  if (!reading) return kUsage;
  if (!options.words.empty()) {
    if (options.markdown) return fail(kUsage, "--markdown prints all rules; it checks nothing");
    return check(options, reading->machine, surroundings);
  }
  // The page is compared with docs/rules.md letter for letter. An option that changed it would make
  // a page that nothing checks.
  if (options.markdown && (options.json || options.reading.platform))
    return fail(kUsage, "--markdown prints the rules of all platforms, in one form");
  const PlatformProfile& profile = profileOf(reading->machine.platform);
  if (options.markdown) {
    print(rulesMarkdown());
  } else if (surroundings.terminal.interactive && !options.json) {
    print(rulesText(profile, reading->machine.internal, surroundings.terminal));
  } else {
    print(rulesLines(profile, options.json));
  }
  return kDone;
}

CommandText rulesText() {
  return {"rules", "Show which words may be written, and check one",
          helpText(
              "A labelled string is reported only if its value stands on a list of the platform. A "
              "build with internal diagnostics asks no list. A downsampling row lets one in "
              "'ratio' of its trace points through, and 'cap' at most.") +
              helpTable("Without a terminal a record is one line, with tabs between",
                        {{"platform", "NAME, 'this' or 'other', values known, downsampling rows"},
                         {"value", "PLATFORM, list, value"},
                         {"special",
                          "PLATFORM, subsystem, category, name, list of string 1, list "
                          "of string 2"},
                         {"downsampling",
                          "PLATFORM, subsystem, category, name (* for any), cap, ratio"}}) +
              helpEnvironment({"TESSEL_OS_RELEASE"}) +
              "Examples:\n"
              "  tesselctl rules | grep -i week\n"
              "  tesselctl rules check week\n"
              "  tesselctl rules check com.vantor.Calendar View Open --string1 period=week"};
}

}  // namespace

void addRulesCommand(CLI::App& app, Invocation& invocation) {
  const auto [command, options] = addCommand(app, invocation, rulesText(), runRules);
  addJudgeOptions(command, options.reading);
  command.add_flag("--json", options.json, "One JSON object a line");
  command.add_flag("--markdown", options.markdown, "A page with the rules of all platforms");
  CLI::App* check =
      command.add_subcommand("check", "Say whether a value or trace point would pass");
  check
      ->add_option("WORDS", options.words,
                   "VALUE of a labelled string; or SUBSYSTEM CATEGORY NAME of a marked trace point")
      ->required()
      ->expected(1, 3)
      ->type_name("");
  addSlotOptions(*check, "--string", options.strings, "Labelled string");
  check->footer(
      helpText(
          "The further options are those of 'tesselctl rules'. Exit status: 0 it would pass, or "
          "a part of such trace points would; 1 it would not. Without a terminal the answer is "
          "one line, with tabs between 'passes' or 'fails', the verdict, the platform and what "
          "decided.") +
      "Examples:\n"
      "  tesselctl rules check --platform Quarro vfs1.root\n"
      "  tesselctl rules check com.vantor.TextInput Keyboard Show");
  // So `rules check VALUE --platform NAME` works: people add an option where the line ends.
  check->fallthrough();
  command.require_subcommand(0, 1);
}

}  // namespace tessel::ctl
