// The begins that wait: their bounds, who loses his when there are too many, and generations.

#include "trace/OpenIntervals.h"

#include <gmock/gmock.h>

#include "trace/testing/AssemblerFixture.h"

namespace tessel {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using testing::Lines;
using OpenIntervalsTest = testing::AssemblerFixture;

TEST_F(OpenIntervalsTest, theOldestOpenIntervalGoes) {
  openLimits.intervals = 3;
  run({"begin|INTERVAL_ID=1", "begin|INTERVAL_ID=2", "begin|INTERVAL_ID=3"});
  run({"begin|INTERVAL_ID=1", "begin|INTERVAL_ID=4"});  // 1 is young again, so 2 goes
  EXPECT_EQ(assembler().counts().droppedOpenIntervals, 1u);
  EXPECT_THAT(run({"end|INTERVAL_ID=2"}), IsEmpty());
  EXPECT_EQ(run({"end|INTERVAL_ID=1", "end|INTERVAL_ID=3", "end|INTERVAL_ID=4"}).size(), 3u);
}

// The place that an id remembers is then that of another interval.
TEST_F(OpenIntervalsTest, intervalsOfOneIdAndInReusedPlacesMeetTheirOwnEnds) {
  run({"begin|INTERVAL_ID=x|NAME=a", "begin|INTERVAL_ID=x|NAME=b"});
  EXPECT_EQ(run({"end|INTERVAL_ID=x|NAME=a"}).size(), 1u);
  EXPECT_THAT(run({"begin|INTERVAL_ID=y|NAME=a", "end|INTERVAL_ID=x|NAME=a"}), IsEmpty());
  EXPECT_THAT(run({"end|INTERVAL_ID=z|NAME=a"}), IsEmpty());
  EXPECT_EQ(run({"end|INTERVAL_ID=x|NAME=b", "end|INTERVAL_ID=y|NAME=a"}).size(), 2u);
}

TEST_F(OpenIntervalsTest, openAttributesAreBounded) {
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

// Honest begins first, then a flood that exceeds one limit after another.
TEST_F(OpenIntervalsTest, whoHoldsMostLosesHisOldest) {
  const std::string longText(4000, 'x');
  std::string attributes;
  for (int i = 0; i < 32; ++i) attributes += "|ATTRIBUTE=k" + std::to_string(i) + "=v";
  const auto points = [&](const std::string& kind, const std::string& writer, int count,
                          const std::string& fields = "") {
    Lines lines;
    for (int i = 0; i < count; ++i)
      lines.push_back(kind + "|INTERVAL_ID=" + std::to_string(i) + writer + fields);
    return run(lines).size();
  };
  const std::string honest[] = {"|_UID=2|_EXE=/a|_PID=1", "|_UID=1|_EXE=/b|_PID=2",
                                "|_UID=3|_EXE=/a|_PID=3"};
  const std::string flood = "|_UID=1|_EXE=/a|_PID=4";
  openLimits.intervals = 40;
  openLimits.attributes = 128;
  tableLimits.textBytes = 128 * 1024;
  for (const std::string& fields : {std::string(), attributes, "|STRING1_VALUE=" + longText}) {
    for (const std::string& writer : honest) points("begin", writer, 5);
    for (int i = 0; i < 100; ++i) {
      const std::string number = std::to_string(i);
      run({"begin|INTERVAL_ID=" + number + flood + fields + (fields.size() > 2000 ? number : "")});
    }
    for (const std::string& writer : honest) EXPECT_EQ(points("end", writer, 5), 5u) << fields;
    const size_t left = points("end", flood, 100);
    EXPECT_GT(left, 1u);
    EXPECT_LT(left, 30u) << fields;
  }
  EXPECT_GT(table().generation(), 3u);
  Losses losses;
  writers.addLosses(losses);
  ASSERT_EQ(losses.all().size(), 1u);
  EXPECT_EQ(losses.all()[0].where(), "user 1, /a");
  EXPECT_EQ(losses.all()[0].count, assembler().counts().droppedOpenIntervals);
  // With one each, everybody is the one who holds most. Somebody goes, and nothing else happens.
  for (uint32_t user = 10; user < 60; ++user)
    run({"begin|INTERVAL_ID=1|_EXE=/a|_UID=" + std::to_string(user)});
  EXPECT_EQ(assembler().counts().openIntervals, 1u) << "the same key replaces";
  for (int i = 0; i < 3000; ++i) {
    const std::string user = std::to_string(i * 7919 % 50), image = std::to_string(i % 9);
    run({(i % 3 == 0 ? "end|INTERVAL_ID=" : "begin|INTERVAL_ID=") + std::to_string(i % 60) +
         "|_UID=" + user + "|_EXE=/" + image + (i % 5 == 0 ? attributes : "")});
    ASSERT_LE(assembler().counts().openIntervals, 40u);
  }
}

TEST_F(OpenIntervalsTest, intervalsOutliveAGeneration) {
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

TEST_F(OpenIntervalsTest, textOfIntervalsIsBounded) {
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

TEST_F(OpenIntervalsTest, objectsKeepTheirStrings) {
  tableLimits.fields = 64;
  keepObjects = true;
  for (int i = 0; i < 200; ++i) run({"event|STRING1_VALUE=" + std::to_string(i)});
  ASSERT_GT(table().generation(), 1u);
  for (size_t i = 0; i < kept.size(); ++i) {
    EXPECT_EQ(kept[i]->string1Value().text(), std::to_string(i));
  }
}

TEST_F(OpenIntervalsTest, intervalsCloseInAnyOrder) {
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
