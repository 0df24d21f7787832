// The layouts of an explained trace object.

#include "tesselctl/showing/ExplanationOutput.h"

#include <algorithm>
#include <vector>

#include "platform/Text.h"
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

}  // namespace

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

// One object as one line of fields. Scripts count fields from the first, so a further one must
// stand behind the reason. Only the payload stands behind it, as the last, where it is asked for.
std::string explanationFields(const Explanation& explanation, bool withPayload,
                              const Terminal& terminal) {
  const auto& [object, entry, decision, scope, payload] = explanation;
  std::vector<std::string> fields = {
      stampText(Date{std::chrono::microseconds{static_cast<int64_t>(entry.realtime)}}),
      terminal.paint(verdictColour(decision.classification), verdictName(decision.classification)),
      shownKind(object),
      terminalText(object.subsystem().textOr("")),
      terminalText(object.category().textOr("")),
      terminalText(object.name().textOr("")),
      ruleWords(decision, scope, terminal)};
  if (withPayload) fields.push_back(payload);
  return fieldsLine(fields);
}

std::string ExplanationLines::heading() const {
  return terminal_.paint(Colour::faint, padded("TIME", timeWidth()) +
                                            padded("VERDICT", kVerdictWidth + 2) +
                                            padded("KIND", kKindWidth + 2) + "TRACE POINT") +
         "\n";
}

std::string ExplanationLines::lines(const Explanation& explanation) const {
  const FilterDecision& decision = explanation.decision;
  const Date date{std::chrono::microseconds{static_cast<int64_t>(explanation.entry.realtime)}};
  const std::string time = withDay_ ? dateText(date).substr(5) : timeOfDayText(date);
  const size_t indent = timeWidth() + kVerdictWidth + 2 + kKindWidth + 2;
  std::string out = padded(time, timeWidth());
  out +=
      terminal_.paint(verdictColour(decision.classification),
                      padded(std::string(verdictName(decision.classification)), kVerdictWidth + 2));
  out += padded(shownKind(explanation.object), kKindWidth + 2);
  out += indented(shownPath(explanation.object), indent);
  if (const std::string why = ruleWords(decision, explanation.scope, terminal_); !why.empty()) {
    out += std::string(timeWidth(), ' ') + indented(why, timeWidth());
  }
  // The payload is not wrapped, so that it can be copied.
  if (!explanation.payload.empty())
    out += std::string(timeWidth(), ' ') + explanation.payload + "\n";
  return out;
}

}  // namespace tessel::ctl
