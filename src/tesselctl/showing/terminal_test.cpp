// Columns of text, tables and lines on a terminal.

#include "tesselctl/showing/Terminal.h"

#include <gtest/gtest.h>

namespace tessel::ctl {
namespace {

TEST(TerminalTest, WidthsCountColumnsAndNotBytes) {
  EXPECT_EQ(displayWidth("caf\u00e9"), 4u);
  EXPECT_EQ(displayWidth("\u65e5\u672c"), 4u);
  EXPECT_EQ(displayWidth("e\u0301"), 1u);
  EXPECT_EQ(shortened("com.vantor.Calendar", 11), "com.v\u2026endar");
  EXPECT_EQ(shortened("\u65e5\u672c\u8a9e\u65e5\u672c\u8a9e", 6), "\u65e5\u2026\u8a9e");
  EXPECT_EQ(cutOff("abcdef", 4), "abc\u2026");
  for (size_t width = 0; width < 12; ++width) {
    for (const char* text :
         {"abcdefghijkl", "\u65e5\u672c\u8a9e\u65e5\u672c\u8a9e", "e\u0301e\u0301e\u0301"}) {
      EXPECT_LE(displayWidth(shortened(text, width)), width);
      EXPECT_LE(displayWidth(cutOff(text, width)), width);
    }
  }
}

TEST(TerminalTest, TablesAlignAndShrinkWhereTheyMay) {
  Table table({{"NAME", Table::Align::left, true}, {"N", Table::Align::right}, {"WHY"}});
  table.add({"com.vantor.Calendar", "7", "because"});
  table.add({"a", "1,000", ""});
  EXPECT_EQ(table.render(Terminal{true, false, 80}, 1),
            " NAME                     N  WHY\n com.vantor.Calendar      7  because\n a            "
            "        1,000\n");
  EXPECT_EQ(table.render(Terminal{true, false, 28}),
            "NAME              N  WHY\ncom.va\u2026endar      7  because\na             1,000\n");
  EXPECT_EQ(table.render(Terminal{}, 1),
            "NAME\tN\tWHY\ncom.vantor.Calendar\t7\tbecause\na\t1,000\t\n");
}

TEST(TerminalTest, LinesBreakBetweenWords) {
  EXPECT_EQ(wrapped("one two three", 7, 2), "one two\n  three");
  EXPECT_EQ(wrapped("incomprehensibilities", 9, 2), "inc\u2026ies");
  EXPECT_EQ(wrapped("", 9, 2), "");
}

}  // namespace
}  // namespace tessel::ctl
