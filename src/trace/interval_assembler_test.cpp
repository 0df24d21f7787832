// What comes out of which entries: pairing, merging, malformed entries.

#include "trace/IntervalAssembler.h"

#include <gmock/gmock.h>

#include "trace/testing/AssemblerFixture.h"

namespace tessel {
namespace {

using ::testing::ElementsAre;
using testing::FakeEntry;
using ::testing::IsEmpty;
using testing::Lines;
using testing::tracePoint;
using IntervalAssemblerTest = testing::AssemblerFixture;

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

// The journal sorts the fields of an entry, so their order must not matter.
TEST_F(IntervalAssemblerTest, ofEqualFieldsTheGreatestCounts) {
  const struct {
    std::string a, b, delivered;
  } cases[] = {
      {"NAME=Open", "NAME=Close", " name=Open"},
      {"NUMBER1_VALUE=10", "NUMBER1_VALUE=9.5", " n1v=10"},
      {"NUMBER1_VALUE=5", "NUMBER1_VALUE=5.0", " n1v=5.0"},
      {"NUMBER1_VALUE=18446744073709551615", "NUMBER1_VALUE=-1", " n1v=18446744073709551615"},
      {"NUMBER1_VALUE=9007199254740993", "NUMBER1_VALUE=9007199254740992", " n1v=9007199254740993"},
      {"NUMBER1_VALUE=3", "NUMBER1_VALUE=x", " n1v=3"},
      {"DURATION=2", "DURATION=10", " 10.0s"},
      {"TELEMETRY=1", "TELEMETRY=yes", " telemetry"},
      {"ATTRIBUTE=BundleIdOverride=a", "ATTRIBUTE=BundleIdOverride=b", " override=b"},
      {"INTERVAL_ID=7", "INTERVAL_ID=x", ""},
      {"KIND=end", "KIND=begin", ""},
  };
  for (const auto& c : cases) {
    for (const std::string& fields : {c.a + "|" + c.b, c.b + "|" + c.a}) {
      run({"begin|INTERVAL_ID=x" + (c.a.starts_with("NAME") ? "|" + c.a : "")});
      const Lines lines = run({"end|INTERVAL_ID=x|" + fields});
      ASSERT_EQ(lines.size(), 1u) << fields;
      EXPECT_TRUE(lines[0].ends_with("View" + c.delivered)) << fields << ": " << lines[0];
    }
  }
  for (const char* fields : {"DURATION=x|FRAME_RATE=x", "FRAME_RATE=x|DURATION=x"})
    run({"event|" + std::string(fields)});
  EXPECT_EQ(assembler().counts().malformed[static_cast<size_t>(MalformedReason::invalidDuration)],
            2u);
}

}  // namespace
}  // namespace tessel
