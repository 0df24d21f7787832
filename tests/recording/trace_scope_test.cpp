// The C++ classes of trace.h: intervals that end with their scope. What each call of a point says,
// the conformance tests show.

#include "TraceTest.h"

namespace {

using tessel::trace::Interval;
using tessel::trace::Point;
using TraceScope = TraceTest;

TEST_F(TraceScope, IntervalEndsWithItsScope) {
  {
    Interval load(
        Point("com.vantor.Calendar", "View", "Load").number1("rows", -1L).number2("load", 2.5f));
    EXPECT_EQ(only()["TESSEL_KIND"], "begin");
    load.point().string1("result", "hit").number1("rows", 3u);
  }
  const JournalEntry entry = only();
  EXPECT_EQ(entry["TESSEL_KIND"], "end");
  EXPECT_EQ(entry["TESSEL_NUMBER1_VALUE"], "3");
  EXPECT_EQ(entry["TESSEL_NUMBER2_VALUE"], "2.5");
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
