// Asking what the gate asks.

#include "tesselctl/judging/Tasking.h"

#include <unistd.h>

#include "linux/SystemFacts.h"
#include "os/Files.h"
#include "statora/ConfigurationFiles.h"
#include "tasking/TaskingGate.h"

namespace tessel::ctl {

namespace {

bool saysWhetherTasked(const ConfigurationValue* configuration) {
  if (configuration == nullptr) return false;
  const auto* dictionary = std::get_if<ConfigurationValue::Dictionary>(&configuration->value);
  if (dictionary == nullptr) return false;
  const auto found = dictionary->find(kTaskedOnKey);
  return found != dictionary->end() && std::holds_alternative<Number>(found->second.value);
}

}  // namespace

std::string taskingFile(const LaunchConfiguration& launch) {
  return launch.configurationDirectory + "/" + kTaskingType + ".json";
}

Tasking askTasking(const LaunchConfiguration& launch) {
  Tasking tasking;
  tasking.file = taskingFile(launch);
  if (OsReleaseBuildVariant(launch.osReleasePath).hasInternalDiagnostics(kBuildVariantSubsystem)) {
    tasking.on = true;
    tasking.source = TaskingSource::internalBuild;
    return tasking;
  }
  if (::access(tasking.file.c_str(), F_OK) != 0) return tasking;
  const auto text = readSmallFile(tasking.file, FileConfigurationService::kMaxFileBytes);
  const auto configuration = text ? parseConfiguration(*text) : nullptr;
  tasking.on = taskingDecisionForConfiguration(configuration.get(), kTaskingType);
  tasking.source = saysWhetherTasked(configuration.get()) ? TaskingSource::configuration
                                                          : TaskingSource::unusable;
  return tasking;
}

std::string_view taskingSourceName(TaskingSource source) {
  switch (source) {
    case TaskingSource::internalBuild:
      return "internal_build";
    case TaskingSource::configuration:
      return "configuration";
    case TaskingSource::absent:
      return "absent";
    case TaskingSource::unusable:
      break;
  }
  return "unusable";
}

std::string taskingWords(const Tasking& tasking, const LaunchConfiguration& launch) {
  switch (tasking.source) {
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
