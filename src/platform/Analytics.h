// The analytics service as the service uses it: sending events, their pace, and configurations.

#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "platform/Queues.h"
#include "platform/System.h"
#include "platform/Values.h"

namespace tessel {

// What an event tells of. Where room is short, events of a lower rank are refused first, so that
// the sums of a run still get through when its objects do not.
enum class EventRank : uint8_t {
  object,      // an event of a trace object
  count,       // a count of the summary
  statistics,  // the totals of the run
};

class EventSender {
 public:
  virtual ~EventSender() = default;
  // Sends one event. Never waits for a disk or a network. False if it was not taken. An event that
  // was taken may still be lost later; the sender keeps account of that. Called on the reporting
  // queue only.
  virtual bool sendEvent(std::string_view name, const Payload& payload, EventRank rank) = 0;
  // Bytes that an event whose name and payload have so many bytes takes of what a run may send. Any
  // thread.
  virtual uint64_t spaceOf(size_t textBytes) const { return textBytes; }
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
  // Whether this process lacks what it needs to look at the configuration, such as descriptors.
  // That there was no call then says nothing about the configuration.
  virtual bool blind() const { return false; }
};

class ConfigurationService {
 public:
  virtual ~ConfigurationService() = default;
  virtual std::shared_ptr<ConfigurationObserver> makeObserver() = 0;
};

// Throttle: slows the sending of events down to at most 10 per 125,000 microseconds.
//
// Take a step before every send. Each tenth step closes a quantum and sleeps for what is left of
// its 125,000 microseconds. The other nine cost an increment and a comparison.
// So one step stands for 12,500 microseconds of a run, whichever step it is that sleeps.
//
// One object serves the whole process, and its counters go on from run to run. It has no lock, so
// only one thread at a time may use it.
class Throttle {
 public:
  static constexpr std::chrono::microseconds kTimeOfAStep{12'500};

  Throttle(Clock& clock, Threads& threads) : clock_(clock), threads_(threads) {}

  // Takes one step. Sleeps on the caller's thread if the sends go too fast.
  void throttleReportedEvent();

  // Steps so far.
  uint64_t stepCount() const { return quantaClosed_ * kStepsPerQuantum + eventsInQuantum_; }
  // Ticks of the clock that steps have spent sleeping so far, by the clock itself: a sleep may take
  // longer than it was asked to.
  uint64_t sleptTicks() const { return sleptTicks_; }
  // Number of sleeps so far.
  uint64_t throttledCount() const { return throttledCount_; }
  // Microseconds slept so far.
  uint64_t throttledMicroseconds() const { return throttledMicroseconds_; }

 private:
  static constexpr uint32_t kStepsPerQuantum = 10;

  void setUp();
  void sleepForRestOfQuantum(double elapsedMicroseconds);

  Clock& clock_;
  Threads& threads_;
  std::once_flag firstUse_;
  double microsecondsPerMachUnit_ = 0;
  float quantumMicroseconds_ = 0;
  uint64_t eventsInQuantum_ = 0;
  uint64_t quantumStartTime_ = 0;
  uint64_t quantaClosed_ = 0;
  uint64_t sleptTicks_ = 0;
  uint64_t throttledCount_ = 0;
  uint64_t throttledMicroseconds_ = 0;
};

}  // namespace tessel
