// What comes out of which entries: pairing, merging, malformed entries, and the bounds on memory.

#include "trace/IntervalAssembler.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "trace/testing/FakeEntryStream.h"

namespace tessel {
namespace {

using ::testing::ElementsAre;
using testing::FakeEntry;
using testing::FakeEntryStream;
using ::testing::IsEmpty;
using testing::tracePoint;
using Lines = std::vector<std::string>;

void add(std::string& line, std::string_view label, StringRef text) {
  if (text) line += " " + std::string(label) + "=" + std::string(text.text());
}

// An object in one line; what is absent, zero or false is left out.
std::string describe(const TesselObject& object) {
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

void addProcess(std::string& line, std::string_view label, const EmittingProcess& process) {
  add(line, label, process.imagePath);
  add(line, std::string(label) + "Name", process.name);
}

class Fixture : public ::testing::Test, protected TraceObjectSink {
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
    if (!assembler_) assembler_ = std::make_unique<IntervalAssembler>(table(), sink(), openLimits);
    return *assembler_;
  }

  TracePointTableLimits tableLimits;
  OpenIntervalLimits openLimits;
  std::vector<std::shared_ptr<const TesselObject>> kept;
  bool keepObjects = false;

 private:
  TraceObjectSink& sink() { return *this; }
  bool admits(StringRef, StringRef) override { return true; }
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

using IntervalAssemblerTest = Fixture;

TEST_F(IntervalAssemblerTest, everyFieldReachesTheObject) {
  EXPECT_THAT(
      run({"event|NAME=Open|TELEMETRY=1|STRING1_NAME=period|STRING1_VALUE=week|STRING2_NAME=view|"
           "STRING2_VALUE=|NUMBER1_NAME=count|NUMBER1_VALUE=-3|NUMBER2_NAME=share|"
           "NUMBER2_VALUE=0.5|DURATION=-1.5|INTERVAL_ID=7|_EXE=/opt/Clock|_COMM=Clock|_PID=12"}),
      ElementsAre("Event com.vantor.Calendar/View name=Open s1=period s1v=week s2=view s2v= "
                  "n1=count n1v=-3 n2=share n2v=0.5 -1.5s telemetry exe=/opt/Clock "
                  "exeName=Clock"));
  EXPECT_EQ(assembler().counts().withoutImagePath, 0u);
}

struct PairingCase {
  const char* what;
  Lines points;
  Lines delivered;
};

TEST_F(IntervalAssemblerTest, beginAndEndMatchOnTheirKey) {
  const std::string interval = "Interval com.vantor.Calendar/View";
  const PairingCase cases[] = {
      {"an end alone", {"end"}, {}},
      {"a begin alone", {"begin"}, {}},
      {"a pair without name, id and process", {"begin", "end"}, {interval}},
      {"an end closes once", {"begin", "end", "end"}, {interval}},
      {"another name", {"begin|NAME=a", "end|NAME=b"}, {}},
      {"an absent name is not an empty one", {"begin", "end|NAME="}, {}},
      {"another id", {"begin|INTERVAL_ID=1", "end|INTERVAL_ID=2"}, {}},
      {"a number as it is not usually spelled",
       {"begin|INTERVAL_ID=7", "end|INTERVAL_ID=07", "end|INTERVAL_ID=+7", "end|INTERVAL_ID=7 "},
       {}},
      {"numbers of any length",
       {"begin|INTERVAL_ID=7", "begin|INTERVAL_ID=18446744073709551623", "end|INTERVAL_ID=7",
        "end|INTERVAL_ID=18446744073709551623"},
       {interval, interval}},
      {"an absent id is an id of its own", {"begin|INTERVAL_ID=1", "end"}, {}},
      {"another process", {"begin|_PID=1", "end|_PID=2"}, {}},
      {"another process in process scope",
       {"begin|_PID=1|INTERVAL_SCOPE=process", "end|_PID=2|INTERVAL_SCOPE=process"},
       {}},
      {"process scope is the default",
       {"begin|_PID=1|INTERVAL_SCOPE=process", "end|_PID=1"},
       {interval}},
      {"another process in system scope",
       {"begin|_PID=1|INTERVAL_SCOPE=system", "end|_PID=2|INTERVAL_SCOPE=system"},
       {interval}},
      {"one scope is not the other", {"begin|_PID=1|INTERVAL_SCOPE=system", "end|_PID=1"}, {}},
      {"nested under different ids",
       {"begin|INTERVAL_ID=1|STRING1_VALUE=outer", "begin|INTERVAL_ID=2|STRING1_VALUE=inner",
        "end|INTERVAL_ID=2", "end|INTERVAL_ID=1"},
       {interval + " s1v=inner", interval + " s1v=outer"}},
      {"a second begin replaces the first",
       {"begin|STRING1_VALUE=first", "begin|STRING1_VALUE=second", "end", "end"},
       {interval + " s1v=second"}},
      {"an event has no part in it",
       {"begin", "event", "end"},
       {"Event com.vantor.Calendar/View", interval}},
  };
  for (const PairingCase& c : cases) {
    EXPECT_EQ(run(c.points), c.delivered) << c.what;
    run({"end", "end|NAME=a", "end|INTERVAL_ID=1", "end|INTERVAL_ID=7", "end|_PID=1",
         "end|_PID=1|INTERVAL_SCOPE=system"});
    EXPECT_EQ(assembler().counts().openIntervals, 0u) << c.what;
  }
  EXPECT_EQ(assembler().counts().replacedBegins, 1u);
}

TEST_F(IntervalAssemblerTest, aBootIsPartOfTheKey) {
  EXPECT_THAT(runEntries({tracePoint("begin", 1'000'000, 1), tracePoint("begin", 2'000'000, 2),
                          tracePoint("end", 2'500'000, 2), tracePoint("end", 1'250'000, 1)}),
              ElementsAre("Interval com.vantor.Calendar/View 0.5s",
                          "Interval com.vantor.Calendar/View 0.25s"));
}

TEST_F(IntervalAssemblerTest, theEndWinsAndTheBeginFillsIn) {
  const std::string interval = "Interval com.vantor.Calendar/View";
  const PairingCase cases[] = {
      {"strings one by one",
       {"begin|STRING1_NAME=a|STRING1_VALUE=b|STRING2_VALUE=c",
        "end|STRING1_VALUE=B|STRING2_NAME=D"},
       {interval + " s1=a s1v=B s2=D s2v=c"}},
      {"an empty string is there",
       {"begin|STRING1_VALUE=b", "end|STRING1_VALUE="},
       {interval + " s1v="}},
      {"a number that is none is absent",
       {"begin|NUMBER1_VALUE=5", "end|NUMBER1_VALUE=five"},
       {interval + " n1v=5"}},
      {"telemetry of the begin",
       {"begin|TELEMETRY=1", "end|TELEMETRY=0"},
       {interval + " telemetry"}},
      {"telemetry of the end", {"begin", "end|TELEMETRY=1"}, {interval + " telemetry"}},
      {"telemetry is 1 and nothing else",
       {"begin|TELEMETRY=yes", "end|TELEMETRY=true"},
       {interval}},
      {"a stated duration of the begin", {"begin|DURATION=2", "end"}, {interval + " 2.0s"}},
      {"a stated duration of the end",
       {"begin|DURATION=2", "end|DURATION=3"},
       {interval + " 3.0s"}},
      {"each end its process",
       {"begin|_EXE=/a|_COMM=a", "end|_COMM=b"},
       {interval + " begin=/a beginName=a endName=b"}},
      {"a frame rate on the begin",
       {"begin|FRAME_RATE=60", "end"},
       {"Animation" + interval + " 60.0fps"}},
      {"a frame rate on the end",
       {"begin|FRAME_RATE=60", "end|FRAME_RATE=59.5"},
       {"Animation" + interval + " 59.5fps"}},
      {"attributes of both",
       {"begin|ATTRIBUTE=BundleIdOverride=com.vantor.A|ATTRIBUTE=k=v", "end|ATTRIBUTE=k=w"},
       {interval + " override=com.vantor.A"}},
      {"an attribute of the end",
       {"begin|ATTRIBUTE=BundleIdOverride=a", "end|ATTRIBUTE=BundleIdOverride=x=y"},
       {interval + " override=x=y"}},
  };
  for (const PairingCase& c : cases) EXPECT_EQ(run(c.points), c.delivered) << c.what;
}

TEST_F(IntervalAssemblerTest, durationIsEndLessBegin) {
  EXPECT_THAT(runEntries({tracePoint("begin", 5'000'000), tracePoint("end", 5'000'001)}),
              ElementsAre("Interval com.vantor.Calendar/View 1e-06s"));
  EXPECT_THAT(runEntries({tracePoint("begin", 5'000'000), tracePoint("end", 4'000'000)}),
              ElementsAre("Interval com.vantor.Calendar/View -1.0s"));
}

TEST_F(IntervalAssemblerTest, malformedIsCountedByReason) {
  const std::string atCap(4096, 'x');
  const struct {
    Lines fields;
    std::optional<MalformedReason> reason;
  } cases[] = {
      {{"MESSAGE=hello", "_PID=1", "_EXE=/bin/x"}, std::nullopt},
      {{"TESSEL_SUBSYSTEM=s", "TESSEL_CATEGORY=c"}, MalformedReason::missingKind},
      {{"TESSEL_CATEGORY=" + atCap + "x"}, MalformedReason::valueTooLong},
      {{"TESSEL_NAME=" + atCap + "x", "TESSEL_ATTRIBUTE=a=b"}, std::nullopt},
      {{"TESSEL_KIND=event", "TESSEL_CATEGORY=c"}, MalformedReason::missingSubsystem},
      {{"TESSEL_KIND=event", "TESSEL_SUBSYSTEM=s"}, MalformedReason::missingCategory},
      {{"TESSEL_KIND=Event", "TESSEL_SUBSYSTEM=s"}, MalformedReason::unknownKind},
      {{"TESSEL_KIND="}, MalformedReason::unknownKind},
      {{"TESSEL_KIND=event", "TESSEL_SUBSYSTEM=s", "TESSEL_CATEGORY=" + atCap + "x"},
       MalformedReason::valueTooLong},
      {{"TESSEL_KIND=event", "TESSEL_SUBSYSTEM=s", "TESSEL_CATEGORY=c", "TESSEL_DURATION=1s"},
       MalformedReason::invalidDuration},
      {{"TESSEL_KIND=event", "TESSEL_SUBSYSTEM=s", "TESSEL_CATEGORY=c", "TESSEL_DURATION=1e39"},
       MalformedReason::invalidDuration},
      {{"TESSEL_KIND=event", "TESSEL_SUBSYSTEM=s", "TESSEL_CATEGORY=c", "TESSEL_FRAME_RATE=nan"},
       MalformedReason::invalidFrameRate},
      {{"TESSEL_KIND=begin", "TESSEL_SUBSYSTEM=s", "TESSEL_CATEGORY=c",
        "TESSEL_INTERVAL_SCOPE=all"},
       MalformedReason::unknownScope},
      {{"TESSEL_KIND=begin", "TESSEL_SUBSYSTEM=s", "TESSEL_CATEGORY=c", "TESSEL_ATTRIBUTE=key"},
       MalformedReason::invalidAttribute},
      {{"TESSEL_KIND=begin", "TESSEL_SUBSYSTEM=s", "TESSEL_CATEGORY=" + atCap}, std::nullopt},
      {{"TESSEL_KIND=begin", "TESSEL_SUBSYSTEM=s", "TESSEL_CATEGORY=c", "_EXE=" + atCap + "x"},
       std::nullopt},
      {{"TESSEL_KIND=begin", "TESSEL_SUBSYSTEM=s", "TESSEL_CATEGORY=c", "TESSEL_UNKNOWN=1"},
       std::nullopt},
  };
  std::array<uint64_t, kMalformedReasons> expected{};
  for (const auto& c : cases) {
    EXPECT_THAT(runEntries({FakeEntry{c.fields, {}}}), IsEmpty());
    if (c.reason) ++expected[static_cast<size_t>(*c.reason)];
    EXPECT_EQ(assembler().counts().malformed, expected) << c.fields.back().substr(0, 40);
  }
}

TEST_F(IntervalAssemblerTest, manyAttributesAreMalformed) {
  std::string point = "begin";
  for (int i = 0; i < 32; ++i) point += "|ATTRIBUTE=k" + std::to_string(i) + "=v";
  EXPECT_EQ(run({point, "end"}).size(), 1u);
  EXPECT_THAT(run({point + "|ATTRIBUTE=one=more", "end"}), IsEmpty());
  EXPECT_EQ(assembler().counts().malformed[static_cast<size_t>(MalformedReason::tooManyAttributes)],
            1u);
}

TEST_F(IntervalAssemblerTest, theOldestOpenIntervalGoes) {
  openLimits.intervals = 3;
  run({"begin|INTERVAL_ID=1", "begin|INTERVAL_ID=2", "begin|INTERVAL_ID=3"});
  run({"begin|INTERVAL_ID=1", "begin|INTERVAL_ID=4"});  // 1 is young again, so 2 goes
  EXPECT_EQ(assembler().counts().droppedOpenIntervals, 1u);
  EXPECT_THAT(run({"end|INTERVAL_ID=2"}), IsEmpty());
  EXPECT_EQ(run({"end|INTERVAL_ID=1", "end|INTERVAL_ID=3", "end|INTERVAL_ID=4"}).size(), 3u);
}

TEST_F(IntervalAssemblerTest, openAttributesAreBounded) {
  openLimits.attributes = 3;
  run({"begin|INTERVAL_ID=1|ATTRIBUTE=a=1|ATTRIBUTE=b=2",
       "begin|INTERVAL_ID=2|ATTRIBUTE=a=1|ATTRIBUTE=b=2"});
  EXPECT_EQ(assembler().counts().droppedOpenIntervals, 1u);
  EXPECT_EQ(run({"end|INTERVAL_ID=1", "end|INTERVAL_ID=2"}).size(), 1u);
  run({"begin|INTERVAL_ID=1", "begin|INTERVAL_ID=2|ATTRIBUTE=a=1",
       "begin|INTERVAL_ID=1|ATTRIBUTE=a=1|ATTRIBUTE=b=2|ATTRIBUTE=c=3"});
  EXPECT_EQ(assembler().counts().replacedBegins, 1u);
  EXPECT_EQ(assembler().counts().droppedOpenIntervals, 2u);
}

TEST_F(IntervalAssemblerTest, intervalsOutliveAGeneration) {
  tableLimits.fields = 200;
  run(
      {"begin|INTERVAL_ID=x|NAME=Open|STRING1_VALUE=week|NUMBER1_VALUE=18446744073709551615|"
       "NUMBER2_VALUE=0.25|TELEMETRY=1|FRAME_RATE=60|ATTRIBUTE=BundleIdOverride=b|_EXE=/a|_PID=3",
       "begin|INTERVAL_ID=y|INTERVAL_SCOPE=system|_PID=3"});
  for (int i = 0; i < 1000; ++i) run({"event|NAME=" + std::to_string(i)});
  EXPECT_GT(table().generation(), 3u);
  EXPECT_THAT(
      run({"end|INTERVAL_ID=x|NAME=Open|_PID=3", "end|INTERVAL_ID=y|INTERVAL_SCOPE=system|_PID=4"}),
      ElementsAre("AnimationInterval com.vantor.Calendar/View name=Open s1v=week "
                  "n1v=18446744073709551615 n2v=0.25 telemetry begin=/a override=b 60.0fps",
                  "Interval com.vantor.Calendar/View"));
  EXPECT_EQ(assembler().counts().droppedOpenIntervals, 0u);
}

TEST_F(IntervalAssemblerTest, textOfIntervalsIsBounded) {
  tableLimits.textBytes = 64 * 1024;
  size_t opened = 0;
  for (; table().generation() < 4; ++opened) {
    run({"begin|INTERVAL_ID=" + std::to_string(opened) +
         "|STRING1_VALUE=" + std::to_string(opened) + std::string(4000, 'x')});
    ASSERT_LT(table().strings()->memoryUsed(), 72u * 1024);
  }
  const AssemblyCounts counts = assembler().counts();
  EXPECT_GT(counts.droppedOpenIntervals, 0u);
  EXPECT_EQ(counts.openIntervals + counts.droppedOpenIntervals, opened);
  EXPECT_EQ(run({"end|INTERVAL_ID=" + std::to_string(opened - 1)}).size(), 1u);
  EXPECT_THAT(run({"end|INTERVAL_ID=0"}), IsEmpty());
}

TEST_F(IntervalAssemblerTest, objectsKeepTheirStrings) {
  tableLimits.fields = 64;
  keepObjects = true;
  for (int i = 0; i < 200; ++i) run({"event|STRING1_VALUE=" + std::to_string(i)});
  ASSERT_GT(table().generation(), 1u);
  for (size_t i = 0; i < kept.size(); ++i) {
    EXPECT_EQ(kept[i]->string1Value().text(), std::to_string(i));
  }
}

TEST_F(IntervalAssemblerTest, intervalsCloseInAnyOrder) {
  openLimits.intervals = 5000;
  const int count = 5000;
  for (int i = 0; i < count; ++i) run({"begin|INTERVAL_ID=" + std::to_string(i)});
  for (int i = 0; i < count; ++i) {
    const int id = (i * 1237) % count;
    ASSERT_EQ(run({"end|INTERVAL_ID=" + std::to_string(id)}).size(), 1u) << id;
    ASSERT_THAT(run({"end|INTERVAL_ID=" + std::to_string(id)}), IsEmpty()) << id;
  }
  EXPECT_EQ(assembler().counts().openIntervals, 0u);
}

}  // namespace
}  // namespace tessel
