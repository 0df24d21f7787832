// Builders of trace objects and the fed extractor.

#include "objects/testing/TestObjects.h"

namespace tessel::testing {

namespace {

StringRef internText(StringPool& pool, const TestPoint::Text& text) {
  return text ? pool.intern(*text) : StringRef();
}

TracePointFields fieldsOf(const TestPoint& point, const std::shared_ptr<StringPool>& pool) {
  TracePointFields fields;
  fields.strings = pool;
  fields.subsystem = internText(*pool, point.subsystem);
  fields.category = internText(*pool, point.category);
  fields.name = internText(*pool, point.name);
  fields.string1Name = internText(*pool, point.string1Name);
  fields.string1Value = internText(*pool, point.string1Value);
  fields.string2Name = internText(*pool, point.string2Name);
  fields.string2Value = internText(*pool, point.string2Value);
  fields.number1Name = internText(*pool, point.number1Name);
  fields.number1Value = point.number1Value;
  fields.number2Name = internText(*pool, point.number2Name);
  fields.number2Value = point.number2Value;
  fields.durationSeconds = point.durationSeconds;
  fields.telemetryEnabled = point.telemetryEnabled;
  return fields;
}

IntervalFields intervalOf(const TestPoint& point, StringPool& pool) {
  IntervalFields interval;
  interval.beginEvent = {internText(pool, point.beginImagePath),
                         internText(pool, point.beginProcessName)};
  interval.endEvent = {internText(pool, point.endImagePath),
                       internText(pool, point.endProcessName)};
  for (const auto& [key, value] : point.attributes) {
    interval.attributes.emplace_back(pool.intern(key), pool.intern(value));
  }
  return interval;
}

}  // namespace

std::shared_ptr<const TesselObject> makeObject(const TestPoint& point) {
  return std::make_shared<TesselObject>(fieldsOf(point, std::make_shared<StringPool>()));
}

std::shared_ptr<const TesselEvent> makeEvent(const TestPoint& point) {
  auto pool = std::make_shared<StringPool>();
  const EmittingProcess process{internText(*pool, point.beginImagePath),
                                internText(*pool, point.beginProcessName)};
  return std::make_shared<TesselEvent>(fieldsOf(point, pool), process);
}

std::shared_ptr<const TesselInterval> makeInterval(const TestPoint& point) {
  auto pool = std::make_shared<StringPool>();
  auto interval = intervalOf(point, *pool);
  return std::make_shared<TesselInterval>(fieldsOf(point, pool), std::move(interval));
}

std::shared_ptr<const TesselAnimationInterval> makeAnimationInterval(const TestPoint& point) {
  auto pool = std::make_shared<StringPool>();
  auto interval = intervalOf(point, *pool);
  return std::make_shared<TesselAnimationInterval>(fieldsOf(point, pool), std::move(interval),
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
