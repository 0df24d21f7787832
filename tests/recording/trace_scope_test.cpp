// The C++ classes of trace.h: points by chained calls, intervals that end with their scope.

#include "TraceTest.h"

namespace {

using tessel::trace::Interval;
using tessel::trace::Point;
using TraceScope = TraceTest;

TEST_F(TraceScope, PointSaysWhatItsCallsSay) {
  const tessel_attribute attribute = {"View", "month"};
  ASSERT_EQ(tessel::trace::event(Point("com.vantor.Calendar", "View", "Open")
                                     .string1("period", "week")
                                     .string2("mode", "day")
                                     .number1("count", 3u)
                                     .number2("load", 2.5f)
                                     .attributes(&attribute, 1)
                                     .telemetry()),
            0);
  const JournalEntry entry = only();
  EXPECT_EQ(entry["TESSEL_STRING1_VALUE"], "week");
  EXPECT_EQ(entry["TESSEL_STRING2_NAME"], "mode");
  EXPECT_EQ(entry["TESSEL_NUMBER1_VALUE"], "3");
  EXPECT_EQ(entry["TESSEL_NUMBER2_VALUE"], "2.5");
  EXPECT_EQ(entry["TESSEL_ATTRIBUTE"], "View=month");
  EXPECT_EQ(entry["TESSEL_TELEMETRY"], "1");
}

TEST_F(TraceScope, IntervalEndsWithItsScope) {
  {
    Interval load(Point("com.vantor.Calendar", "View", "Load").number1("rows", -1L));
    EXPECT_EQ(only()["TESSEL_KIND"], "begin");
    load.point().string1("result", "hit");
  }
  const JournalEntry entry = only();
  EXPECT_EQ(entry["TESSEL_KIND"], "end");
  EXPECT_EQ(entry["TESSEL_NUMBER1_VALUE"], "-1");
  EXPECT_EQ(entry["TESSEL_STRING1_VALUE"], "hit");
  EXPECT_NE(entry["TESSEL_DURATION"], JournalEntry::kNone);
}

TEST_F(TraceScope, AnIntervalThatWasEndedDoesNotEndAgain) {
  {
    Interval scroll(Point("com.vantor.Calendar", "View", "Scroll"));
    EXPECT_EQ(scroll.endAnimation(60), 0);
    EXPECT_EQ(scroll.end(), ECANCELED);
  }
  const std::vector<JournalEntry> entries = journal.take();
  ASSERT_EQ(entries.size(), 2u);
  EXPECT_EQ(entries[1]["TESSEL_FRAME_RATE"], "60.0");
}

}  // namespace
