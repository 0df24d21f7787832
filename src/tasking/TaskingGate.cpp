// The rules of tasking, their log lines, and the wait for the configuration.
//
// A machine that nobody asked to report must not report. So whatever goes wrong here means "no".

#include "tasking/TaskingGate.h"

#include <atomic>
#include <iterator>

#include "platform/Log.h"

namespace tessel {

namespace {

// The scheduler's thread waits here, so the wait must have an end. A run waits at most 5 s. A
// configuration that arrives later only counts for the next run.
constexpr std::chrono::nanoseconds kConfigurationWait{5'000'000'000};

struct ReasonRow {
  TaskingReason reason;
  TaskingSource source;
  LogFormat<> line;
};

constexpr ReasonRow kReasons[] = {
    {TaskingReason::internalBuild, TaskingSource::internalBuild,
     "Reporting based on os_flavor result"},
    {TaskingReason::taskedOn, TaskingSource::configuration,
     "Reporting based on being tasked-on by Statora"},
    {TaskingReason::taskedOff, TaskingSource::configuration,
     "Not reporting based on not being tasked-on by Statora ('TaskedOn' is false)"},
    {TaskingReason::noneArrived, TaskingSource::absent,
     "Not reporting based on not being tasked-on by Statora (Timeout waiting for config)"},
    {TaskingReason::notLookedAt, TaskingSource::unknown,
     "Not reporting based on not being tasked-on by Statora (Timeout waiting for config)"},
    // This line names the type that arrived, so logged() writes it.
    {TaskingReason::unexpectedType, TaskingSource::unusable, ""},
    {TaskingReason::nilConfiguration, TaskingSource::unusable,
     "Not reporting based on not being tasked-on by Statora (nil configuration object)"},
    {TaskingReason::noDictionary, TaskingSource::unusable,
     "Not reporting based on not being tasked-on by Statora (Non-KVDictionary configuration "
     "object)"},
    {TaskingReason::noAnswer, TaskingSource::unusable,
     "Not reporting since is not tasked-on by Statora (nil value for TaskedOn key)"},
    {TaskingReason::answerNotANumber, TaskingSource::unusable,
     "Not reporting since not tasked-on by Statora (Wrong value class for class for TaskedOn)"},
};

// rowOf() uses the reason as the index. A reason without a row would read past the end of the
// table.
static_assert([] {
  for (size_t place = 0; place < std::size(kReasons); ++place) {
    if (static_cast<size_t>(kReasons[place].reason) != place) return false;
  }
  return std::size(kReasons) == static_cast<size_t>(TaskingReason::answerNotANumber) + 1;
}());

const ReasonRow& rowOf(TaskingDecision decision) {
  return kReasons[static_cast<size_t>(decision.reason)];
}

TaskingDecision logged(TaskingDecision decision, const std::string& type = {}) {
  if (decision.reason == TaskingReason::unexpectedType) {
    tesselReporterLog().debug(
        "Not reporting based on not being tasked-on by Statora (unexpected type string: '%@')",
        type);
  } else {
    tesselReporterLog().debug(rowOf(decision).line);
  }
  return decision;
}

// The gate and its callback share this, because the callback may still run after the gate's call
// has returned. Whichever of the two ends last frees it.
struct SharedAnswer {
  Semaphore arrived{0};
  std::atomic<TaskingDecision> decision;
};

}  // namespace

TaskingSource TaskingDecision::source() const { return rowOf(*this).source; }

TaskingDecision decideTasking(BuildVariant& buildVariant,
                              const std::function<TaskingDecision()>& askConfiguration) {
  if (buildVariant.hasInternalDiagnostics(kBuildVariantSubsystem))
    return {TaskingReason::internalBuild};
  return askConfiguration();
}

TaskingDecision taskingDecisionForConfiguration(const ConfigurationValue* configuration,
                                                const std::string& type) {
  // Another configuration may have the same key. It must not task this machine.
  if (type != kTaskingType) return {TaskingReason::unexpectedType};
  if (configuration == nullptr) return {TaskingReason::nilConfiguration};
  const auto* dictionary = std::get_if<ConfigurationValue::Dictionary>(&configuration->value);
  if (dictionary == nullptr) return {TaskingReason::noDictionary};
  const auto answer = dictionary->find(kTaskedOnKey);
  return taskingDecisionForTaskedOnValue(answer == dictionary->end() ? nullptr : &answer->second);
}

TaskingDecision taskingDecisionForTaskedOnValue(const ConfigurationValue* value) {
  if (value == nullptr) return {TaskingReason::noAnswer};
  // Only a number is an answer. A text is none, not even "true".
  const auto* number = std::get_if<Number>(&value->value);
  if (number == nullptr) return {TaskingReason::answerNotANumber};
  return {booleanValue(*number) ? TaskingReason::taskedOn : TaskingReason::taskedOff};
}

TaskingDecision TaskingGate::decide() {
  const TaskingDecision decision =
      decideTasking(buildVariant_, [this] { return awaitTaskingConfiguration(); });
  // The callback has already logged a configuration that arrived. A second line would make one
  // decision look like two.
  const bool arrived = decision.source() == TaskingSource::configuration ||
                       decision.source() == TaskingSource::unusable;
  return arrived ? decision : logged(decision);
}

TaskingDecision TaskingGate::awaitTaskingConfiguration() {
  const auto queue = queues_.makeSerialQueue("tessel_reporter configuration observing queue");
  const auto answer = std::make_shared<SharedAnswer>();
  // Each run makes a new observer, because a new observer is told the configuration of this moment.
  const auto observer = configurations_.makeObserver();
  observer->setDelegate(std::make_shared<TesselReporterConfigObserverDelegate>(
                            [answer](const std::shared_ptr<const ConfigurationValue>& configuration,
                                     const std::string& type) {
                              // Several may arrive before the gate reads the answer. The newest
                              // decides, so each one overwrites the one before. The answer is
                              // stored before the signal, so the gate never reads an empty one.
                              answer->decision = logged(
                                  taskingDecisionForConfiguration(configuration.get(), type), type);
                              answer->arrived.signal();
                            }),
                        queue);
  observer->startObserving(kTaskingType);
  if (!threads_.wait(answer->arrived, kConfigurationWait))
    return {observer->blind() ? TaskingReason::notLookedAt : TaskingReason::noneArrived};
  return answer->decision;
}

}  // namespace tessel
