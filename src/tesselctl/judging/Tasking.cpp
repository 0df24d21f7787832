// Deciding as the tasking gate of the service does.
//
// The gate waits for a configuration to be delivered. A command must answer at once, so we read the
// file ourselves and leave out the wait.

#include "tesselctl/judging/Tasking.h"

#include <unistd.h>

#include <variant>

#include "linux/SystemFacts.h"
#include "statora/ConfigurationFiles.h"

namespace tessel::ctl {

std::string taskingFile(const LaunchConfiguration& launch) {
  return launch.configurationDirectory + "/" + kTaskingType + ".json";
}

Tasking askTasking(const LaunchConfiguration& launch) {
  const std::string file = taskingFile(launch);
  std::string failure;
  OsReleaseBuildVariant variant(launch.osReleasePath);
  const TaskingDecision decision = decideTasking(variant, [&]() -> TaskingDecision {
    const auto looked = lookAtConfiguration(file);
    if (const auto* error = std::get_if<PlatformError>(&looked)) {
      failure = error->words;
      return {TaskingReason::notLookedAt};
    }
    const auto& found = std::get<ConfigurationFile>(looked);
    // The service gets no delivery for an absent file. Its gate waits, then decides as we do here.
    if (!found.exists) return {TaskingReason::noneArrived};
    const auto configuration = found.text ? parseConfiguration(*found.text) : nullptr;
    return taskingDecisionForConfiguration(configuration.get(), kTaskingType);
  });
  // The service reads the file as another user. Without this a good file would be called bad.
  const bool unreadable =
      decision.source() == TaskingSource::unusable && ::access(file.c_str(), R_OK) != 0;
  Tasking tasking{decision, failure, file, readRollout(launch), {}, unreadable};
  if (tasking.rollout) tasking.place = placeOf(machineId().value_or(""), tasking.rollout->cohort);
  return tasking;
}

std::string_view taskingSourceName(TaskingSource source) {
  // In the order of TaskingSource, which indexes them. Scripts compare these words.
  static constexpr std::string_view kNames[] = {"internal_build", "configuration", "absent",
                                                "unusable", "unknown"};
  return kNames[static_cast<size_t>(source)];
}

namespace {

std::string sourceWords(const Tasking& tasking, const LaunchConfiguration& launch) {
  switch (tasking.decision.source()) {
    case TaskingSource::internalBuild:
      return launch.osReleasePath + " says that this is an internal build";
    case TaskingSource::configuration:
      return tasking.file + " says so";
    case TaskingSource::absent:
      return "there is no " + tasking.file;
    case TaskingSource::unknown:
      return "it could not be looked at: " + tasking.failure;
    case TaskingSource::unusable:
      break;
  }
  if (tasking.unreadable) return tasking.file + " may not be read by this user";
  return tasking.file + " does not hold a JSON object with a number or boolean under \"TaskedOn\"";
}

// Without the zeros at the end: "5 %", "0.25 %".
std::string percentWords(uint32_t parts) {
  std::string text = std::to_string(parts / 1e4);
  text.erase(text.find_last_not_of('0') + 1);
  if (text.ends_with('.')) text.pop_back();
  return text + " %";
}

}  // namespace

std::string taskingWords(const Tasking& tasking, const LaunchConfiguration& launch) {
  std::string words = sourceWords(tasking, launch);
  if (!tasking.rollout) return words;
  words += "; the roll-out takes " + percentWords(tasking.rollout->share) + " of the cohort " +
           tasking.rollout->cohort;
  if (!tasking.place) return words + ", and this machine has no id to find its place";
  words += ", and this machine is at " + percentWords(*tasking.place);
  // Somebody has changed one of the two files alone.
  if (tasking.decision.source() == TaskingSource::configuration &&
      tasking.decision.on() != tasking.inShare())
    words += ": it does not follow";
  return words;
}

}  // namespace tessel::ctl
