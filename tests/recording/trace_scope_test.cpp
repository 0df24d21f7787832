// The C++ side: points by chain, intervals by scope.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "FakeJournal.h"
#include "tessel/trace.h"

namespace {

using tessel::trace::Interval;
using tessel::trace::Point;

TEST(TraceScope, PointSaysWhatItsCallsSay) {
  FakeJournal journal;
  const tessel_attribute attribute = {"View", "month"};
  ASSERT_EQ(tessel::trace::event(Point("com.vantor.Calendar", "View", "Open")
                                     .string1("period", "week")
                                     .string2("mode", "day")
                                     .number1("count", 3u)
                                     .number2("load", 2.5f)
                                     .attributes(&attribute, 1)
                                     .telemetry()),
            0);
  const std::vector<JournalEntry> entries = journal.take();
  ASSERT_EQ(entries.size(), 1u);
  EXPECT_EQ(entries[0]["TESSEL_STRING1_VALUE"], "week");
  EXPECT_EQ(entries[0]["TESSEL_STRING2_NAME"], "mode");
  EXPECT_EQ(entries[0]["TESSEL_NUMBER1_VALUE"], "3");
  EXPECT_EQ(entries[0]["TESSEL_NUMBER2_VALUE"], "2.5");
  EXPECT_EQ(entries[0]["TESSEL_ATTRIBUTE"], "View=month");
  EXPECT_EQ(entries[0]["TESSEL_TELEMETRY"], "1");
}

TEST(TraceScope, IntervalEndsWithItsScope) {
  FakeJournal journal;
  {
    Interval load(Point("com.vantor.Calendar", "View", "Load").number1("rows", -1L));
    EXPECT_EQ(journal.take().size(), 1u);
    load.point().string1("result", "hit");
  }
  const std::vector<JournalEntry> entries = journal.take();
  ASSERT_EQ(entries.size(), 1u);
  EXPECT_EQ(entries[0]["TESSEL_KIND"], "end");
  EXPECT_EQ(entries[0]["TESSEL_NUMBER1_VALUE"], "-1");
  EXPECT_EQ(entries[0]["TESSEL_STRING1_VALUE"], "hit");
  EXPECT_TRUE(entries[0].has("TESSEL_DURATION"));
}

TEST(TraceScope, AnIntervalThatWasEndedDoesNotEndAgain) {
  FakeJournal journal;
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
