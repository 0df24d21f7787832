// Tasking: whether this machine reports, and what says so.
//
// The answer is worked out from the same files by the same rules as the service's gate. Stateless.

#pragma once

#include <optional>
#include <string>

#include "linux/LaunchConfiguration.h"

namespace tessel::ctl {

enum class TaskingSource {
  internalBuild,  // the operating system says that it is an internal build
  configuration,  // the tasking configuration says yes or no
  absent,         // there is no tasking configuration
  unusable,       // there is a file, but it is no configuration or does not say
};

struct Tasking {
  bool on = false;
  TaskingSource source = TaskingSource::absent;
  std::string file;  // of the configuration
};

std::string taskingFile(const LaunchConfiguration& launch);
Tasking askTasking(const LaunchConfiguration& launch);

// "internal_build", "configuration", "absent", "unusable".
std::string_view taskingSourceName(TaskingSource source);
// Where the answer comes from, in words.
std::string taskingWords(const Tasking& tasking, const LaunchConfiguration& launch);

}  // namespace tessel::ctl
