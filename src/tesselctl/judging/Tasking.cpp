// Deciding as the tasking gate of the service does.
//
// The gate waits for a configuration to be delivered. A command must answer at once, so we read the
// file ourselves and leave out the wait.

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
    // The service gets no delivery for an absent file. Its gate waits, then decides as we do here.
    if (::access(file.c_str(), F_OK) != 0) return {TaskingReason::noneArrived};
    // The service has the same limit, so a file too large for it is unusable here, too.
    const auto text = readSmallFile(file, FileConfigurationService::kMaxFileBytes);
    const auto configuration = text ? parseConfiguration(*text) : nullptr;
    return taskingDecisionForConfiguration(configuration.get(), kTaskingType);
  });
  return {decision, file};
}

std::string_view taskingSourceName(TaskingSource source) {
  // In the order of TaskingSource, which indexes them. Scripts compare these words.
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
  // The service may read the file as another user. Without this line we would call a good file bad.
  if (::access(tasking.file.c_str(), R_OK) != 0)
    return tasking.file + " may not be read by this user";
  return tasking.file + " does not hold a JSON object with a number or boolean under \"TaskedOn\"";
}

}  // namespace tessel::ctl
