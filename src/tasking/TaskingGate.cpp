// The wait for the tasking configuration and the judgement of it.

#include "tasking/TaskingGate.h"

#include <atomic>

#include "platform/Log.h"
#include "platform/Queues.h"
#include "tasking/TesselReporterConfigObserverDelegate.h"

namespace tessel {

namespace {

constexpr std::chrono::nanoseconds kConfigurationWait{5'000'000'000};

// What the waiting gate and the callback share; the callback may outlive the gate's call.
struct SharedAnswer {
  Semaphore arrived{0};
  std::atomic<bool> taskedOn{false};
};

}  // namespace

bool TaskingGate::shouldReport() {
  if (buildVariant_.hasInternalDiagnostics(kBuildVariantSubsystem)) {
    tesselReporterLog().debug("Reporting based on os_flavor result");
    return true;
  }
  return awaitTaskingConfiguration();
}

bool TaskingGate::awaitTaskingConfiguration() {
  const auto queue = queues_.makeSerialQueue("tessel_reporter configuration observing queue");
  const auto answer = std::make_shared<SharedAnswer>();
  const auto observer = configurations_.makeObserver();
  const auto delegate = std::make_shared<TesselReporterConfigObserverDelegate>(
      [answer](const std::shared_ptr<const ConfigurationValue>& configuration,
               const std::string& type) {
        answer->taskedOn = taskingDecisionForConfiguration(configuration.get(), type);
        answer->arrived.signal();
      });
  observer->setDelegate(delegate, queue);
  observer->startObserving(kTaskingType);
  if (!clock_.wait(answer->arrived, kConfigurationWait)) {
    tesselReporterLog().debug(
        "Not reporting based on not being tasked-on by Statora (Timeout waiting for config)");
    return false;
  }
  return answer->taskedOn;
}

bool taskingDecisionForConfiguration(const ConfigurationValue* configuration,
                                     const std::string& type) {
  if (type != kTaskingType) {
    tesselReporterLog().debug(
        "Not reporting based on not being tasked-on by Statora (unexpected type string: '%@')",
        type);
    return false;
  }
  if (configuration == nullptr) {
    tesselReporterLog().debug(
        "Not reporting based on not being tasked-on by Statora (nil configuration object)");
    return false;
  }
  const auto* dictionary = std::get_if<ConfigurationValue::Dictionary>(&configuration->value);
  if (dictionary == nullptr) {
    tesselReporterLog().debug(
        "Not reporting based on not being tasked-on by Statora (Non-KVDictionary configuration "
        "object)");
    return false;
  }
  const auto taskedOn = dictionary->find(kTaskedOnKey);
  return taskingDecisionForTaskedOnValue(taskedOn == dictionary->end() ? nullptr
                                                                       : &taskedOn->second);
}

bool taskingDecisionForTaskedOnValue(const ConfigurationValue* value) {
  if (value == nullptr) {
    tesselReporterLog().debug(
        "Not reporting since is not tasked-on by Statora (nil value for %@ key)", kTaskedOnKey);
    return false;
  }
  const auto* number = std::get_if<Number>(&value->value);
  if (number == nullptr) {
    tesselReporterLog().debug(
        "Not reporting since not tasked-on by Statora (Wrong value class for class for %@)",
        kTaskedOnKey);
    return false;
  }
  if (booleanValue(*number)) {
    tesselReporterLog().debug("Reporting based on being tasked-on by Statora");
    return true;
  }
  tesselReporterLog().debug("Not reporting based on not being tasked-on by Statora ('%@' is false)",
                            kTaskedOnKey);
  return false;
}

}  // namespace tessel
