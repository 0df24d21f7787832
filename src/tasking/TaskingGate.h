// TaskingGate: whether a run may report at all, and why.
//
// A build with internal diagnostics may. Any other build may only if the tasking configuration
// arrives within 5 seconds, is a dictionary, and holds under "TaskedOn" a number that is true.
// Every decision is logged in one debug line.
//
// The rules are functions of their own, so that a tool which shows the decision applies the same.

#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

#include "platform/Analytics.h"
#include "platform/Queues.h"
#include "platform/System.h"

namespace tessel {

// A build with internal diagnostics for this subsystem reports without being tasked.
inline constexpr std::string_view kBuildVariantSubsystem = "com.vantor.tessel";
// The configuration that tasks, and the key of its answer.
inline constexpr char kTaskingType[] = "com.vantor.performance.tessel_reporter_tasking";
inline constexpr char kTaskedOnKey[] = "TaskedOn";

enum class TaskingReason : uint8_t {
  internalBuild,
  taskedOn,
  taskedOff,
  noneArrived,     // within the time that the gate waits
  unexpectedType,  // a configuration arrived that is not the tasking configuration
  nilConfiguration,
  noDictionary,
  noAnswer,  // nothing stands under "TaskedOn"
  answerNotANumber,
};

// What a decision rests on.
enum class TaskingSource : uint8_t {
  internalBuild,
  configuration,  // it says yes or no
  absent,         // there is no configuration
  unusable,       // there is a configuration, but it does not say
};

struct TaskingDecision {
  TaskingReason reason = TaskingReason::noneArrived;

  bool on() const {
    return reason == TaskingReason::internalBuild || reason == TaskingReason::taskedOn;
  }
  TaskingSource source() const;
};

// The decision on this build. `askConfiguration` is called only where the build does not decide.
TaskingDecision decideTasking(BuildVariant& buildVariant,
                              const std::function<TaskingDecision()>& askConfiguration);
// The decision that one delivered configuration yields; null is an absent one.
TaskingDecision taskingDecisionForConfiguration(const ConfigurationValue* configuration,
                                                const std::string& type);
// The decision for what stands under "TaskedOn"; null if nothing does.
TaskingDecision taskingDecisionForTaskedOnValue(const ConfigurationValue* value);

// Keeps nothing between calls. A configuration that arrives after the gate has returned is judged
// and logged as usual and changes nothing.
class TaskingGate {
 public:
  TaskingGate(BuildVariant& buildVariant, ConfigurationService& configurations,
              QueueFactory& queues, Clock& clock)
      : buildVariant_(buildVariant),
        configurations_(configurations),
        queues_(queues),
        clock_(clock) {}

  // Blocks the caller for at most 5 seconds.
  TaskingDecision decide();
  bool shouldReport() { return decide().on(); }

 private:
  TaskingDecision awaitTaskingConfiguration();

  BuildVariant& buildVariant_;
  ConfigurationService& configurations_;
  QueueFactory& queues_;
  Clock& clock_;
};

// Hands configuration changes to a closure. The closure, and what it captured, lives for as long as
// the analytics service keeps the delegate, even after the gate has returned.
class TesselReporterConfigObserverDelegate final : public ConfigurationObserverDelegate {
 public:
  // Takes the configuration, null if it is absent, and its type.
  using CallbackBlock =
      std::function<void(const std::shared_ptr<const ConfigurationValue>&, const std::string&)>;

  explicit TesselReporterConfigObserverDelegate(CallbackBlock callbackBlock)
      : callbackBlock_(std::move(callbackBlock)) {}

  void observerDidChangeConfiguration(
      ConfigurationObserver& /*observer*/,
      const std::shared_ptr<const ConfigurationValue>& configuration,
      const std::string& type) override {
    callbackBlock_(configuration, type);
  }

 private:
  const CallbackBlock callbackBlock_;
};

}  // namespace tessel
