// Making trace objects and delivering them, for tests only.

#pragma once

#include <string>
#include <vector>

#include "objects/TesselSupportObjectExtractor.h"

namespace tessel::testing {

// Describes a trace point in plain strings. An empty optional is an absent string.
struct TestPoint {
  using Text = std::optional<std::string>;
  Text subsystem = "com.vantor.Calendar";
  Text category = "View";
  Text name = "Open";
  std::array<std::pair<Text, Text>, kLabelledStrings> strings;  // label and value
  std::array<std::pair<Text, std::optional<Number>>, kLabelledNumbers> numbers;
  float durationSeconds = 0;
  bool telemetryEnabled = true;
  Text beginImagePath, beginProcessName;  // the event's own where it is one
  Text endImagePath, endProcessName;
  std::vector<std::pair<std::string, std::string>> attributes;
  float frameRate = 60;
};

std::shared_ptr<const TesselObject> makeObject(const TestPoint& point);
std::shared_ptr<const TesselEvent> makeEvent(const TestPoint& point);
std::shared_ptr<const TesselInterval> makeInterval(const TestPoint& point);
std::shared_ptr<const TesselAnimationInterval> makeAnimationInterval(const TestPoint& point);

// An extractor that delivers what it is fed. `duringProcessing` runs inside the processing call,
// after the objects; a stop that came before it leaves the objects undelivered.
struct FakeExtractor final : TesselSupportObjectExtractor {
  void setIntervalCompletionProcessingBlock(IntervalCallback callback) override;
  void setAnimationIntervalCompletionProcessingBlock(AnimationIntervalCallback callback) override;
  void setEmitEventProcessingBlock(EventCallback callback) override;
  void setBuildAnimationCompositeIntervalTimelines(bool build) override;
  bool processLogArchiveWithPath(const std::optional<std::string>& path, Date startDate,
                                 Date endDate, std::optional<PlatformError>& errorOut) override;
  void stopProcessing() override;
  uint64_t processedEventCount() const override { return eventCount; }
  std::optional<StoreReading> reading() const override { return found; }

  std::vector<std::shared_ptr<const TesselObject>> objects;
  std::optional<PlatformError> failure;
  std::function<void()> beforeProcessing, duringProcessing;
  uint64_t eventCount = 0;
  std::optional<StoreReading> found;

  std::vector<std::string> calls;  // in order: setters, option, "process", "stop"
  std::optional<std::string> processedPath;
  Date startDate, endDate;
  bool stopped = false;

 private:
  IntervalCallback interval_;
  AnimationIntervalCallback animation_;
  EventCallback event_;
};

}  // namespace tessel::testing
