// The layouts of an explained trace object.

#include "tesselctl/showing/ExplanationOutput.h"

#include <algorithm>
#include <vector>

#include "platform/Text.h"
#include "tesselctl/judging/Durations.h"
#include "tesselctl/showing/DurationOutput.h"
#include "tesselctl/showing/SummaryOutput.h"

namespace tessel::ctl {

namespace {

// Columns. A name may be 4,096 bytes long, and one object must not fill the screen.
constexpr size_t kNameWidth = 60;
constexpr size_t kVerdictWidth = 18;  // of the longest verdict that a store yields
constexpr size_t kKindWidth = 9;

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

// Seconds. Absent for an event that states no duration: it lasts no time, and a 0 would look like a
// measurement.
std::optional<float> durationOf(const TesselObject& object) {
  if (!hasDuration(object)) return std::nullopt;
  return object.durationSeconds();
}

// Frames per second; absent if the object is no animation.
std::optional<float> frameRateOf(const TesselObject& object) {
  if (!object.isKindOf(TesselClass::animationInterval)) return std::nullopt;
  return static_cast<const TesselAnimationInterval&>(object).frameRate();
}

// Of an interval, the process of its end.
EmittingProcess emittingProcessOf(const TesselObject& object) {
  if (object.isKindOf(TesselClass::interval))
    return static_cast<const TesselInterval&>(object).endEvent();
  if (!object.isKindOf(TesselClass::event)) return {};
  const auto& event = static_cast<const TesselEvent&>(object);
  return {event.processImagePath(), event.processName()};
}

void writeProcess(JsonWriter& json, const char* key, const EmittingProcess& process,
                  const EntryProcess& numbers) {
  json.object(key, [&] {
    json.member("name", process.name).member("image", process.imagePath);
    json.member("pid", numbers.id).member("uid", numbers.user);
  });
}

// A process may begin an interval and another one end it. The begin is written where it differs.
void writeProcesses(JsonWriter& json, const TesselObject& object, const EntryProcess& numbers) {
  const EmittingProcess end = emittingProcessOf(object);
  writeProcess(json, "process", end, numbers);
  if (!object.isKindOf(TesselClass::interval)) return;
  const EmittingProcess& begin = static_cast<const TesselInterval&>(object).beginEvent();
  // Two absent names are the same here: nothing is known of either, so nothing is worth a member.
  const auto same = [](StringRef a, StringRef b) {
    return a.present() ? sameString(a, b) : !b.present();
  };
  if (!same(begin.name, end.name) || !same(begin.imagePath, end.imagePath))
    writeProcess(json, "begin_process", begin, {});
}

// Process 0 and user 0 exist, so an unknown number is an empty field and not a zero.
std::string numberOrNothing(std::optional<uint32_t> number) {
  return number ? std::to_string(*number) : "";
}

// "1.25 s, 59.9 fps, Calendar[4711], uid 1000".
std::string shownFacts(const Explanation& explanation) {
  std::string facts;
  const auto add = [&](const std::string& fact) { facts += (facts.empty() ? "" : ", ") + fact; };
  if (const auto duration = durationOf(explanation.object)) add(secondsText(*duration));
  if (const auto rate = frameRateOf(explanation.object)) add(frameRateText(*rate));
  const EntryProcess& numbers = explanation.process;
  const StringRef name = emittingProcessOf(explanation.object).name;
  if (name || numbers.id) {
    // As `ps` and the journal write a process, name and id, so that people can paste either.
    add(shortened(terminalText(name.textOr("")), kNameWidth) +
        (numbers.id ? "[" + std::to_string(*numbers.id) + "]" : ""));
  }
  if (numbers.user) add("uid " + std::to_string(*numbers.user));
  return facts;
}

}  // namespace

std::string explanationJson(const Explanation& explanation) {
  const TesselObject& object = explanation.object;
  const FilterDecision& decision = explanation.decision;
  return objectLine([&](JsonWriter& json) {
    json.member("classification", decision.classification);
    json.member("verdict", verdictName(decision.classification));
    json.member("kind", object.tesselType()).member("time", explanation.entry.realtime);
    json.member("subsystem", object.subsystem()).member("category", object.category());
    json.member("name", object.name());
    json.member("duration", durationOf(object)).member("frame_rate", frameRateOf(object));
    writeProcesses(json, object, explanation.process);
    addRule(json, decision, explanation.scope);
    json.member("cursor", cursorOf(explanation.entry));
    if (!explanation.payload.empty()) json.rawMember("payload", explanation.payload);
  });
}

// One object as one line of fields. Scripts count fields from the first, so a further one must
// stand behind the reason. Only the payload stands behind it, as the last, where it is asked for.
std::string explanationFields(const Explanation& explanation, bool withPayload,
                              const Terminal& terminal) {
  const auto& [object, entry, decision, process, scope, payload] = explanation;
  const auto digits = [](std::optional<float> value) { return value ? plainDigits(*value) : ""; };
  std::vector<std::string> fields = {
      stampText(Date{std::chrono::microseconds{static_cast<int64_t>(entry.realtime)}}),
      terminal.paint(verdictColour(decision.classification), verdictName(decision.classification)),
      shownKind(object),
      terminalText(object.subsystem().textOr("")),
      terminalText(object.category().textOr("")),
      terminalText(object.name().textOr("")),
      ruleWords(decision, scope, terminal),
      digits(durationOf(object)),
      digits(frameRateOf(object)),
      terminalText(emittingProcessOf(object).name.textOr("")),
      numberOrNothing(process.id),
      numberOrNothing(process.user)};
  if (withPayload) fields.push_back(payload);
  return fieldsLine(fields);
}

std::string ExplanationLines::heading() const {
  return shownPeriod_ + "\n" +
         terminal_.paint(Colour::faint, padded("TIME", timeWidth()) +
                                            padded("VERDICT", kVerdictWidth + 2) +
                                            padded("KIND", kKindWidth + 2) + "TRACE POINT") +
         "\n";
}

std::string ExplanationLines::lines(const Explanation& explanation) const {
  const FilterDecision& decision = explanation.decision;
  const Date date{std::chrono::microseconds{static_cast<int64_t>(explanation.entry.realtime)}};
  const std::string time = withDay_ ? dateText(date).substr(5) : timeOfDayText(date);
  const size_t indent = timeWidth() + kVerdictWidth + 2 + kKindWidth + 2;
  // Only a time with its zone is longer than the column. It takes two spaces behind it, too.
  const size_t beyond = std::max(time.size() + 2, timeWidth()) - timeWidth();
  std::string out = padded(time, timeWidth() + beyond);
  out +=
      terminal_.paint(verdictColour(decision.classification),
                      padded(std::string(verdictName(decision.classification)), kVerdictWidth + 2));
  out += padded(shownKind(explanation.object), kKindWidth + 2);
  const std::string facts = shownFacts(explanation);
  out += indented(shownPath(explanation.object) + (facts.empty() ? "" : " (" + facts + ")"), indent,
                  beyond);
  if (const std::string why = ruleWords(decision, explanation.scope, terminal_); !why.empty()) {
    out += std::string(timeWidth(), ' ') + indented(why, timeWidth());
  }
  // The payload is not wrapped, so that it can be copied.
  if (!explanation.payload.empty())
    out += std::string(timeWidth(), ' ') + explanation.payload + "\n";
  return out;
}

}  // namespace tessel::ctl
