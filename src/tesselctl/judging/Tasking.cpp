// Asking what the gate asks, without its wait.

#include "tesselctl/judging/Tasking.h"

#include <unistd.h>

#include "linux/SystemFacts.h"
#include "os/Files.h"
#include "statora/ConfigurationFiles.h"

namespace tessel::ctl {

std::string taskingFile(const LaunchConfiguration& launch) {
  return launch.configurationDirectory + "/" + kTaskingType + ".json";
}

Tasking askTasking(const LaunchConfiguration& launch) {
  const std::string file = taskingFile(launch);
  OsReleaseBuildVariant variant(launch.osReleasePath);
  const TaskingDecision decision = decideTasking(variant, [&]() -> TaskingDecision {
    // Nothing is delivered for a file that is not there, so the gate would wait in vain.
    if (::access(file.c_str(), F_OK) != 0) return {TaskingReason::noneArrived};
    const auto text = readSmallFile(file, FileConfigurationService::kMaxFileBytes);
    const auto configuration = text ? parseConfiguration(*text) : nullptr;
    return taskingDecisionForConfiguration(configuration.get(), kTaskingType);
  });
  return {decision, file};
}

std::string_view taskingSourceName(TaskingSource source) {
  static constexpr std::string_view kNames[] = {"internal_build", "configuration", "absent",
                                                "unusable"};
  return kNames[static_cast<size_t>(source)];
}

std::string taskingWords(const Tasking& tasking, const LaunchConfiguration& launch) {
  switch (tasking.decision.source()) {
    case TaskingSource::internalBuild:
      return launch.osReleasePath + " says that this is an internal build";
    case TaskingSource::configuration:
      return tasking.file + " says so";
    case TaskingSource::absent:
      return "there is no " + tasking.file;
    case TaskingSource::unusable:
      break;
  }
  if (::access(tasking.file.c_str(), R_OK) != 0)
    return tasking.file + " may not be read by this user";
  return tasking.file + " does not hold a JSON object with a number or boolean under \"TaskedOn\"";
}

}  // namespace tessel::ctl
