// The analytics service as the service uses it: send an event, observe a configuration.

#pragma once

#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/Payload.h"
#include "platform/Queues.h"

namespace tessel {

class EventSender {
 public:
  virtual ~EventSender() = default;
  // Sends one event. False if it was not taken. Called on the reporting queue only.
  virtual bool sendEvent(std::string_view name, const Payload& payload) = 0;
};

// A value of a configuration: null, a number, a string, a list or a dictionary.
struct ConfigurationValue {
  using List = std::vector<ConfigurationValue>;
  using Dictionary = std::map<std::string, ConfigurationValue, std::less<>>;
  std::variant<std::monostate, Number, std::string, List, Dictionary> value;
};

class ConfigurationObserver;

class ConfigurationObserverDelegate {
 public:
  virtual ~ConfigurationObserverDelegate() = default;
  // `configuration` is null if it is absent.
  virtual void observerDidChangeConfiguration(
      ConfigurationObserver& observer,
      const std::shared_ptr<const ConfigurationValue>& configuration, const std::string& type) = 0;
};

// Calls its delegate on its queue, at any time after observing began and any number of times. The
// observer keeps the delegate alive. A call may still be under way when the last reference to the
// observer is dropped.
class ConfigurationObserver {
 public:
  virtual ~ConfigurationObserver() = default;
  virtual void setDelegate(std::shared_ptr<ConfigurationObserverDelegate> delegate,
                           std::shared_ptr<SerialQueue> queue) = 0;
  virtual void startObserving(const std::string& type) = 0;
};

class ConfigurationService {
 public:
  virtual ~ConfigurationService() = default;
  virtual std::shared_ptr<ConfigurationObserver> makeObserver() = 0;
};

}  // namespace tessel
