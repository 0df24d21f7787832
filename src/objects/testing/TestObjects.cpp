// Builders of trace objects and the fed extractor.

#include "objects/testing/TestObjects.h"

namespace tessel::testing {

namespace {

// The texts of one object, in a pool of its own, as if each came from another extraction.
struct Texts {
  StringRef operator()(const TestPoint::Text& text) const {
    return text ? pool->intern(*text) : StringRef();
  }
  std::shared_ptr<StringPool> pool = std::make_shared<StringPool>();
};

TracePointFields fieldsOf(const TestPoint& point, const Texts& texts) {
  TracePointFields fields;
  fields.pool = texts.pool;
  fields.subsystem = texts(point.subsystem);
  fields.category = texts(point.category);
  fields.name = texts(point.name);
  for (size_t slot = 0; slot < kLabelledStrings; ++slot)
    fields.strings[slot] = {texts(point.strings[slot].first), texts(point.strings[slot].second)};
  for (size_t slot = 0; slot < kLabelledNumbers; ++slot)
    fields.numbers[slot] = {texts(point.numbers[slot].first), point.numbers[slot].second};
  fields.durationSeconds = point.durationSeconds;
  fields.telemetryEnabled = point.telemetryEnabled;
  return fields;
}

EmittingProcess beginOf(const TestPoint& point, const Texts& texts) {
  return {texts(point.beginImagePath), texts(point.beginProcessName)};
}

IntervalFields intervalOf(const TestPoint& point, const Texts& texts) {
  IntervalFields interval{
      beginOf(point, texts), {texts(point.endImagePath), texts(point.endProcessName)}, {}};
  for (const auto& [key, value] : point.attributes)
    interval.attributes.emplace_back(texts(key), texts(value));
  return interval;
}

}  // namespace

std::shared_ptr<const TesselObject> makeObject(const TestPoint& point) {
  return std::make_shared<TesselObject>(fieldsOf(point, {}));
}

std::shared_ptr<const TesselEvent> makeEvent(const TestPoint& point) {
  const Texts texts;
  return std::make_shared<TesselEvent>(fieldsOf(point, texts), beginOf(point, texts));
}

std::shared_ptr<const TesselInterval> makeInterval(const TestPoint& point) {
  const Texts texts;
  return std::make_shared<TesselInterval>(fieldsOf(point, texts), intervalOf(point, texts));
}

std::shared_ptr<const TesselAnimationInterval> makeAnimationInterval(const TestPoint& point) {
  const Texts texts;
  return std::make_shared<TesselAnimationInterval>(fieldsOf(point, texts), intervalOf(point, texts),
                                                   point.frameRate);
}

void FakeExtractor::setIntervalCompletionProcessingBlock(IntervalCallback callback) {
  calls.push_back("interval callback");
  interval_ = std::move(callback);
}

void FakeExtractor::setAnimationIntervalCompletionProcessingBlock(
    AnimationIntervalCallback callback) {
  calls.push_back("animation callback");
  animation_ = std::move(callback);
}

void FakeExtractor::setEmitEventProcessingBlock(EventCallback callback) {
  calls.push_back("event callback");
  event_ = std::move(callback);
}

void FakeExtractor::setBuildAnimationCompositeIntervalTimelines(bool build) {
  calls.push_back(build ? "composite on" : "composite off");
}

bool FakeExtractor::processLogArchiveWithPath(const std::optional<std::string>& path, Date start,
                                              Date end, std::optional<PlatformError>& errorOut) {
  calls.push_back("process");
  processedPath = path;
  startDate = start;
  endDate = end;
  if (beforeProcessing) beforeProcessing();
  for (const auto& object : objects) {
    if (stopped) break;
    if (object->isKindOf(TesselClass::animationInterval)) {
      animation_(std::static_pointer_cast<const TesselAnimationInterval>(object));
    } else if (object->isKindOf(TesselClass::interval)) {
      interval_(std::static_pointer_cast<const TesselInterval>(object));
    } else if (object->isKindOf(TesselClass::event)) {
      event_(std::static_pointer_cast<const TesselEvent>(object));
    }
  }
  if (duringProcessing) duringProcessing();
  errorOut = failure;
  return !failure.has_value();
}

void FakeExtractor::stopProcessing() {
  calls.push_back("stop");
  stopped = true;
}

}  // namespace tessel::testing
