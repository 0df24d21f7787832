// The trace objects that the extraction service delivers, one class per kind.
//
//   TesselSupportObject -> TesselObject -> TesselEvent
//                                       -> TesselInterval -> TesselAnimationInterval
//
// Objects are immutable and shared by reference count; any thread may read them. Their strings are
// borrowed from the string pool of the extraction, which each object keeps alive. A string property
// may be absent.
//
// Reporting asks an object for its tesselType(), canGenerateStatoraPayload() and statoraPayload().

#pragma once

#include <array>
#include <memory>
#include <optional>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/Values.h"

namespace tessel {

class ProcessIdentity;

// The most derived class of this tree that an object belongs to.
enum class TesselClass { supportObject, object, event, interval, animationInterval };

class TesselSupportObject {
 public:
  TesselSupportObject() = default;
  TesselSupportObject(const TesselSupportObject&) = delete;
  TesselSupportObject& operator=(const TesselSupportObject&) = delete;
  virtual ~TesselSupportObject() = default;

  // True for the object's own class and for every class above it in the tree. An animation
  // interval is also an interval, an object and a support object.
  //
  // Filter and counters ask this several times for every object. So it is a comparison in place,
  // and not a dynamic_cast, which looks the class up in the type information.
  bool isKindOf(TesselClass wanted) const {
    if (class_ == wanted) return true;
    switch (wanted) {
      case TesselClass::supportObject:
        return true;
      case TesselClass::object:
        return class_ != TesselClass::supportObject;
      case TesselClass::interval:
        return class_ == TesselClass::animationInterval;
      case TesselClass::event:
      case TesselClass::animationInterval:
        return false;
    }
    return false;
  }

  virtual bool canGenerateStatoraPayload() const { return false; }
  // The analytics payload, or nothing for a class that has none.
  virtual std::optional<Payload> statoraPayload(ProcessIdentity& identity) const;

 protected:
  explicit TesselSupportObject(TesselClass tesselClass) : class_(tesselClass) {}

 private:
  const TesselClass class_ = TesselClass::supportObject;
};

// An argument and the label that the writer gave it. A value without a label is never sent.
struct LabelledString {
  StringRef label;
  StringRef value;
};
struct LabelledNumber {
  StringRef label;
  std::optional<Number> value;
};

// What every trace point carries. Strings are borrowed from `pool`.
struct TracePointFields {
  std::shared_ptr<const StringPool> pool;
  StringRef subsystem;
  StringRef category;
  StringRef name;
  std::array<LabelledString, 2> strings;
  std::array<LabelledNumber, 2> numbers;
  float durationSeconds = 0;  // seconds
  bool telemetryEnabled = false;
  bool statesDuration = false;  // the writer stated the duration; else it was measured, or is none
};

inline constexpr size_t kLabelledStrings = std::tuple_size_v<decltype(TracePointFields::strings)>;
inline constexpr size_t kLabelledNumbers = std::tuple_size_v<decltype(TracePointFields::numbers)>;

class TesselObject : public TesselSupportObject {
 public:
  explicit TesselObject(TracePointFields fields)
      : TesselObject(TesselClass::object, std::move(fields)) {}

  StringRef subsystem() const { return fields_.subsystem; }
  StringRef category() const { return fields_.category; }
  StringRef name() const { return fields_.name; }
  // All labelled arguments; slot 1 of the accessors below is index 0.
  const auto& labelledStrings() const { return fields_.strings; }
  const auto& labelledNumbers() const { return fields_.numbers; }
  StringRef string1Name() const { return fields_.strings[0].label; }
  StringRef string1Value() const { return fields_.strings[0].value; }
  StringRef string2Name() const { return fields_.strings[1].label; }
  StringRef string2Value() const { return fields_.strings[1].value; }
  StringRef number1Name() const { return fields_.numbers[0].label; }
  const std::optional<Number>& number1Value() const { return fields_.numbers[0].value; }
  StringRef number2Name() const { return fields_.numbers[1].label; }
  const std::optional<Number>& number2Value() const { return fields_.numbers[1].value; }
  float durationSeconds() const { return fields_.durationSeconds; }
  bool telemetryEnabled() const { return fields_.telemetryEnabled; }
  bool statesDuration() const { return fields_.statesDuration; }

  // "TesselObject", "Event", "Interval" or "AnimationInterval".
  virtual std::string_view tesselType() const { return "TesselObject"; }
  std::optional<Payload> statoraPayload(ProcessIdentity& identity) const override;

 protected:
  TesselObject(TesselClass tesselClass, TracePointFields fields)
      : TesselSupportObject(tesselClass), fields_(std::move(fields)) {}

 private:
  const TracePointFields fields_;
};

// The process that emitted an event. Either may be absent.
struct EmittingProcess {
  StringRef imagePath;  // of the executable
  StringRef name;
};

class TesselEvent final : public TesselObject {
 public:
  TesselEvent(TracePointFields fields, EmittingProcess process)
      : TesselObject(TesselClass::event, std::move(fields)), process_(process) {}

  StringRef processImagePath() const { return process_.imagePath; }
  StringRef processName() const { return process_.name; }

  std::string_view tesselType() const override { return "Event"; }
  bool canGenerateStatoraPayload() const override { return true; }
  std::optional<Payload> statoraPayload(ProcessIdentity& identity) const override;

 private:
  const EmittingProcess process_;
};

// What an interval carries beyond a trace point. One process may begin an interval and another may
// end it.
struct IntervalFields {
  EmittingProcess beginEvent;
  EmittingProcess endEvent;
  // Extra attributes, at most one entry per key.
  std::vector<std::pair<StringRef, StringRef>> attributes;
};

class TesselInterval : public TesselObject {
 public:
  TesselInterval(TracePointFields fields, IntervalFields interval)
      : TesselInterval(TesselClass::interval, std::move(fields), std::move(interval)) {}

  const EmittingProcess& beginEvent() const { return interval_.beginEvent; }
  const EmittingProcess& endEvent() const { return interval_.endEvent; }
  // The value of the attribute `key`; absent if the interval has no such attribute.
  StringRef attribute(std::string_view key) const;

  std::string_view tesselType() const override { return "Interval"; }
  bool canGenerateStatoraPayload() const override { return true; }
  std::optional<Payload> statoraPayload(ProcessIdentity& identity) const override;

 protected:
  TesselInterval(TesselClass tesselClass, TracePointFields fields, IntervalFields interval)
      : TesselObject(tesselClass, std::move(fields)), interval_(std::move(interval)) {}

 private:
  const IntervalFields interval_;
};

class TesselAnimationInterval final : public TesselInterval {
 public:
  TesselAnimationInterval(TracePointFields fields, IntervalFields interval, float frameRate)
      : TesselInterval(TesselClass::animationInterval, std::move(fields), std::move(interval)),
        frameRate_(frameRate) {}

  // Frames per second.
  float frameRate() const { return frameRate_; }

  std::string_view tesselType() const override { return "AnimationInterval"; }
  std::optional<Payload> statoraPayload(ProcessIdentity& identity) const override;

 private:
  const float frameRate_;
};

}  // namespace tessel
