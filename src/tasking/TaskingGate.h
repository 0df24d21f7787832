// TaskingGate: decides whether a run may report at all, and says why.
//
// A build with internal diagnostics may report. Any other build needs the tasking configuration. It
// must arrive within 5 seconds, be a dictionary, and have a number under "TaskedOn" that is true.
// Each decision is logged in one debug line.
//
// The rules are free functions, so a tool that shows the decision applies the same rules.

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
// The type of the tasking configuration, and the key under which it says yes or no.
inline constexpr char kTaskingType[] = "com.vantor.performance.tessel_reporter_tasking";
inline constexpr char kTaskedOnKey[] = "TaskedOn";

enum class TaskingReason : uint8_t {
  internalBuild,
  taskedOn,
  taskedOff,
  noneArrived,     // the gate's wait ended before a configuration arrived
  notLookedAt,     // as before, because this process lacked what it needs to look at it
  unexpectedType,  // a configuration arrived, but not the tasking configuration
  nilConfiguration,
  noDictionary,
  noAnswer,  // the dictionary has no "TaskedOn"
  answerNotANumber,
};

// What made the decision.
enum class TaskingSource : uint8_t {
  internalBuild,
  configuration,  // the configuration says yes or no
  absent,         // no configuration arrived
  unusable,       // something arrived, but it says neither yes nor no
  unknown,        // whether there is a configuration could not be found out
};

struct TaskingDecision {
  TaskingReason reason = TaskingReason::noneArrived;

  bool on() const {
    return reason == TaskingReason::internalBuild || reason == TaskingReason::taskedOn;
  }
  TaskingSource source() const;
};

// Decides by the build alone if that is possible, and otherwise calls `askConfiguration`.
TaskingDecision decideTasking(BuildVariant& buildVariant,
                              const std::function<TaskingDecision()>& askConfiguration);
// The decision for one delivered configuration. Null stands for a configuration that is absent.
TaskingDecision taskingDecisionForConfiguration(const ConfigurationValue* configuration,
                                                const std::string& type);
// The decision for the value under "TaskedOn". Null means that there is no such value.
TaskingDecision taskingDecisionForTaskedOnValue(const ConfigurationValue* value);

// A gate keeps nothing between calls. If a configuration arrives after decide() has returned, it
// may still be logged, but it changes nothing.
class TaskingGate {
 public:
  TaskingGate(BuildVariant& buildVariant, ConfigurationService& configurations,
              QueueFactory& queues, Threads& threads)
      : buildVariant_(buildVariant),
        configurations_(configurations),
        queues_(queues),
        threads_(threads) {}

  // Blocks the caller for at most 5 seconds.
  TaskingDecision decide();
  bool shouldReport() { return decide().on(); }

 private:
  TaskingDecision awaitTaskingConfiguration();

  BuildVariant& buildVariant_;
  ConfigurationService& configurations_;
  QueueFactory& queues_;
  Threads& threads_;
};

// Hands configuration changes to a closure. The closure, and what it captured, lives for as long as
// the analytics service keeps the delegate, even after the gate has returned.
class TesselReporterConfigObserverDelegate final : public ConfigurationObserverDelegate {
 public:
  // Gets the configuration and its type. The configuration is null if it is absent.
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
