// Runs entries through an assembler and describes the objects that come out, for tests only.

#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "trace/IntervalAssembler.h"
#include "trace/testing/FakeEntryStream.h"

namespace tessel::testing {

using Lines = std::vector<std::string>;

inline void add(std::string& line, std::string_view label, StringRef text) {
  if (text) line += " " + std::string(label) + "=" + std::string(text.text());
}

// An object in one line; what is absent, zero or false is left out.
inline std::string describe(const TesselObject& object) {
  std::string line(object.tesselType());
  line +=
      " " + std::string(object.subsystem().text()) + "/" + std::string(object.category().text());
  add(line, "name", object.name());
  add(line, "s1", object.string1Name());
  add(line, "s1v", object.string1Value());
  add(line, "s2", object.string2Name());
  add(line, "s2v", object.string2Value());
  add(line, "n1", object.number1Name());
  if (object.number1Value()) line += " n1v=" + numberText(*object.number1Value());
  add(line, "n2", object.number2Name());
  if (object.number2Value()) line += " n2v=" + numberText(*object.number2Value());
  if (object.durationSeconds() != 0) line += " " + numberText(object.durationSeconds()) + "s";
  if (object.telemetryEnabled()) line += " telemetry";
  return line;
}

inline void addProcess(std::string& line, std::string_view label, const EmittingProcess& process) {
  add(line, label, process.imagePath);
  add(line, std::string(label) + "Name", process.name);
}

class AssemblerFixture : public ::testing::Test, protected TraceObjectSink {
 protected:
  Lines runEntries(std::vector<FakeEntry> entries) {
    FakeEntryStream stream(table(), std::move(entries));
    while (stream.next()) assembler().consume(stream.entry());
    return std::exchange(delivered_, {});
  }
  Lines run(const Lines& points) {
    std::vector<FakeEntry> entries;
    for (const std::string& point : points) entries.push_back(tracePoint(point));
    return runEntries(std::move(entries));
  }
  TracePointTable& table() {
    if (!table_) table_ = std::make_unique<TracePointTable>(tableLimits);
    return *table_;
  }
  IntervalAssembler& assembler() {
    if (!assembler_)
      assembler_ = std::make_unique<IntervalAssembler>(table(), writers, sink(), openLimits);
    return *assembler_;
  }

  TracePointTableLimits tableLimits;
  OpenIntervalLimits openLimits;
  Writers writers;
  std::vector<std::shared_ptr<const TesselObject>> kept;
  bool keepObjects = false;

 private:
  TraceObjectSink& sink() { return *this; }
  bool admits(const ObjectOffer&) override { return true; }
  void addTold(const ToldLosses&) override {}
  void deliverEvent(std::shared_ptr<const TesselEvent> event) override {
    std::string line = describe(*event);
    addProcess(line, "exe", {event->processImagePath(), event->processName()});
    remember(std::move(line), event);
  }
  void deliverInterval(std::shared_ptr<const TesselInterval> interval) override {
    remember(describeInterval(*interval), interval);
  }
  void deliverAnimationInterval(std::shared_ptr<const TesselAnimationInterval> interval) override {
    remember(describeInterval(*interval) + " " + numberText(interval->frameRate()) + "fps",
             interval);
  }
  static std::string describeInterval(const TesselInterval& interval) {
    std::string line = describe(interval);
    addProcess(line, "begin", interval.beginEvent());
    addProcess(line, "end", interval.endEvent());
    add(line, "override", interval.attribute("BundleIdOverride"));
    return line;
  }
  void remember(std::string line, std::shared_ptr<const TesselObject> object) {
    delivered_.push_back(std::move(line));
    if (keepObjects) kept.push_back(std::move(object));
  }

  std::unique_ptr<TracePointTable> table_;
  std::unique_ptr<IntervalAssembler> assembler_;
  Lines delivered_;
};

}  // namespace tessel::testing
