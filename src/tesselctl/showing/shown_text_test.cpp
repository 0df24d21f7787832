// Texts of unknown origin on terminals, in JSON and in HTML; columns.

#include "tesselctl/showing/ShownText.h"

#include <gtest/gtest.h>

#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {
namespace {

TEST(ShownTextTest, NothingReachesATerminalThatItObeys) {
  const struct {
    const char* text;
    const char* shown;
  } cases[] = {
      {"plain caf\u00e9", "plain caf\u00e9"},
      {"\x1b[31m", "\\x1b[31m"},
      {"\u009b", "\\xc2\\x9b"},
      {"a\nb\tc\r", "a\\x0ab\\x09c\\x0d"},
      {"\x7f", "\\x7f"},
      {"\xff\xc3", "\\xff\\xc3"},
      // NOLINTNEXTLINE(misc-misleading-bidirectional): what must not reach a terminal
      {"\u202eabc\u2066", "\\u202eabc\\u2066"},
      {"\u2028", "\\u2028"},
  };
  for (const auto& [text, shown] : cases) EXPECT_EQ(terminalText(text), shown);
  // NOLINTNEXTLINE(misc-misleading-bidirectional)
  EXPECT_EQ(terminalJson("{\"a\":\n\t\"\u009b\x7f\u202e\"}"),
            "{\"a\":  \"\\u009b\\u007f\\u202e\"}");
}

TEST(ShownTextTest, NothingBecomesMarkup) {
  EXPECT_EQ(htmlText("<a href='x' title=\"y\">&amp;"),
            "&lt;a href=&#39;x&#39; title=&quot;y&quot;&gt;&amp;amp;");
  // NOLINTNEXTLINE(misc-misleading-bidirectional)
  EXPECT_EQ(htmlText("\x1b\xff\u202e\u0085"), "&#9243;\ufffd\ufffd\ufffd");
}

TEST(ShownTextTest, WidthsCountColumnsAndNotBytes) {
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

TEST(ShownTextTest, NumbersAreGrouped) {
  EXPECT_EQ(grouped(0), "0");
  EXPECT_EQ(grouped(999), "999");
  EXPECT_EQ(grouped(1'234'567), "1,234,567");
  EXPECT_EQ(grouped(18'446'744'073'709'551'615u), "18,446,744,073,709,551,615");
  EXPECT_EQ(counted(1, "row", "rows") + counted(0, "row", "rows"), "1 row0 rows");
}

TEST(TerminalTest, TablesAlignAndGiveWayWhereTheyAreTold) {
  Table table({{"NAME", Table::Align::left, true}, {"N", Table::Align::right}, {"WHY"}});
  table.add({"com.vantor.Calendar", "7", "because"});
  table.add({"a", "1,000", ""});
  EXPECT_EQ(table.render(Terminal{false, false, 80}, 1),
            " NAME                     N  WHY\n com.vantor.Calendar      7  because\n a            "
            "        1,000\n");
  EXPECT_EQ(table.render(Terminal{false, false, 28}),
            "NAME              N  WHY\ncom.va\u2026endar      7  because\na             1,000\n");
}

TEST(TerminalTest, LinesBreakBetweenWords) {
  EXPECT_EQ(wrapped("one two three", 7, 2), "one two\n  three");
  EXPECT_EQ(wrapped("incomprehensibilities", 9, 2), "inc\u2026ies");
  EXPECT_EQ(wrapped("", 9, 2), "");
}

}  // namespace
}  // namespace tessel::ctl
