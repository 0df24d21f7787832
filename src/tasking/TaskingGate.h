// TaskingGate: whether a run may report at all.
//
// Yes on an internal-diagnostics build. Elsewhere only where the tasking configuration arrives
// within 5 seconds, is a dictionary, and holds under "TaskedOn" a number that is true. Every
// outcome is said in one debug line.
//
// The gate keeps nothing between calls. A configuration that comes after the gate has returned is
// judged and logged as usual and changes nothing.

#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "platform/Analytics.h"
#include "platform/Queues.h"
#include "platform/System.h"

namespace tessel {

// Whose internal diagnostics make a build report without being tasked.
inline constexpr std::string_view kBuildVariantSubsystem = "com.vantor.tessel";
// The configuration that tasks, and its key that says so.
inline constexpr char kTaskingType[] = "com.vantor.performance.tessel_reporter_tasking";
inline constexpr char kTaskedOnKey[] = "TaskedOn";

class TaskingGate {
 public:
  TaskingGate(BuildVariant& buildVariant, ConfigurationService& configurations,
              QueueFactory& queues, Clock& clock)
      : buildVariant_(buildVariant),
        configurations_(configurations),
        queues_(queues),
        clock_(clock) {}

  // Blocks the caller for at most 5 seconds.
  bool shouldReport();

 private:
  bool awaitTaskingConfiguration();

  BuildVariant& buildVariant_;
  ConfigurationService& configurations_;
  QueueFactory& queues_;
  Clock& clock_;
};

// The decision that one delivered configuration yields; null is an absent one.
bool taskingDecisionForConfiguration(const ConfigurationValue* configuration,
                                     const std::string& type);

// The decision for what stands under "TaskedOn"; null where nothing does.
bool taskingDecisionForTaskedOnValue(const ConfigurationValue* value);

}  // namespace tessel
