// Any bytes as the tasking configuration: only a dictionary whose TaskedOn is a number other than
// zero may switch reporting on. A dictionary that is switched on is on, with the same other
// members.

#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "statora/ConfigurationFiles.h"
#include "tasking/TaskingGate.h"

namespace {

using namespace tessel;

bool mayReport(const ConfigurationValue* configuration) {
  if (configuration == nullptr) return false;
  const auto* dictionary = std::get_if<ConfigurationValue::Dictionary>(&configuration->value);
  if (dictionary == nullptr || !dictionary->contains("TaskedOn")) return false;
  const auto* number = std::get_if<Number>(&dictionary->at("TaskedOn").value);
  return number != nullptr && booleanValue(*number);
}

void checkSwitchingOn(std::string_view text, const ConfigurationValue& configuration) {
  const auto* before = std::get_if<ConfigurationValue::Dictionary>(&configuration.value);
  if (before == nullptr) return;
  const auto changed = parseConfiguration(withMember(text, "TaskedOn", "true"));
  if (!mayReport(changed.get())) std::abort();
  const auto& after = std::get<ConfigurationValue::Dictionary>(changed->value);
  if (after.size() != before->size() + (before->contains("TaskedOn") ? 0 : 1)) std::abort();
  for (const auto& member : *before)
    if (!after.contains(member.first)) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  const auto configuration = parseConfiguration(text);
  const bool decided = taskingDecisionForConfiguration(
                           configuration.get(), "com.vantor.performance.tessel_reporter_tasking")
                           .on();
  if (decided != mayReport(configuration.get())) std::abort();
  if (configuration) checkSwitchingOn(text, *configuration);
  if (decided && text.find("TaskedOn") == std::string_view::npos &&
      text.find('\\') == std::string_view::npos)
    std::abort();
  if (taskingDecisionForConfiguration(configuration.get(), "com.vantor.other").on()) std::abort();
  return 0;
}
