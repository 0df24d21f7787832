// What is UTF-8, and what of a text reaches a log, a terminal, JSON and markup.

#include "platform/Text.h"

#include <gtest/gtest.h>

#include <optional>
#include <vector>

#include "platform/Json.h"

namespace tessel {
namespace {

constexpr const char* kReplacement = "\xef\xbf\xbd";

std::string jsonOf(std::string_view text, JsonStyle style = {}) {
  std::string out;
  JsonWriter(out, style).value(text);
  return out;
}

TEST(TextTest, InvalidUtf8IsReplacedOnceForAMaximalPart) {
  const struct {
    std::string_view text;
    size_t parts;
  } cases[] = {
      {"\xff", 1},
      {"\xc3", 1},
      {"\xe2\x82", 1},
      {"\xf0\x9f\x98", 1},
      {"\xe2\x82\xe2\x82", 2},
      {"\xc0\xaf", 2},          // ASCII in two bytes
      {"\xe0\x9f\xbf", 3},      // two bytes' worth in three
      {"\xed\xa0\x80", 3},      // a surrogate
      {"\xf0\x8f\xbf\xbf", 4},  // three bytes' worth in four
      {"\xf4\x90\x80\x80", 4},  // beyond U+10FFFF
  };
  for (const auto& [text, parts] : cases) {
    std::string replaced;
    for (size_t part = 0; part < parts; ++part) replaced += kReplacement;
    EXPECT_EQ(replaceInvalidUtf8("a" + std::string(text) + "b"), "a" + replaced + "b");
    EXPECT_EQ(jsonOf(text), "\"" + replaced + "\"");
    EXPECT_FALSE(isValidUtf8("a" + std::string(text)));
  }
  const std::string good = "gr\xc3\xbc\xc3\x9f|\xe0\xa0\x80|\xf0\x90\x80\x80|\xf4\x8f\xbf\xbf";
  EXPECT_TRUE(isValidUtf8(good));
  EXPECT_EQ(replaceInvalidUtf8(good), good);
  EXPECT_EQ(jsonOf(good), "\"" + good + "\"");
}

TEST(TextTest, NothingReachesATerminalThatItObeys) {
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
      {"a\u200bb\u00a0c\ufe0f\U000e0041\U0001f600",
       "a\\u200bb\\u00a0c\\ufe0f\\U000e0041\U0001f600"},
  };
  for (const auto& [text, shown] : cases) EXPECT_EQ(terminalText(text), shown);
  EXPECT_EQ(plainText("a\nb\tc\u2028\u0085\xff", "|"), "a|b\tc\u2028\\xc2\\x85\\xff");
}

TEST(TextTest, ALongTextLosesItsMiddleBetweenCharacters) {
  EXPECT_EQ(shortPlainText("0123456789abcdef", 16), "0123456789abcdef");
  EXPECT_EQ(shortPlainText("0123456789abcdefg", 16), "0123...89abcdefg");
  EXPECT_EQ(shortPlainText("012\u00e945678\u00e99abcdefg", 16), "012...9abcdefg");
}

TEST(TextTest, NothingBecomesMarkup) {
  EXPECT_EQ(htmlText("<a href='x' title=\"y\">&amp;"),
            "&lt;a href=&#39;x&#39; title=&quot;y&quot;&gt;&amp;amp;");
  // NOLINTNEXTLINE(misc-misleading-bidirectional)
  EXPECT_EQ(htmlText("\x1b\xff\u202e\u0085 a\u200bb\u00a0c\ufe0f\U000e0041\u00e9\U0001f600"),
            "\u241b\ufffd[U+202E][U+0085] a[U+200B]b[U+00A0]c[U+FE0F][U+E0041]\u00e9\U0001f600");
}

TEST(TextTest, NumbersAreGrouped) {
  EXPECT_EQ(grouped(0), "0");
  EXPECT_EQ(grouped(999), "999");
  EXPECT_EQ(grouped(1'234'567), "1,234,567");
  EXPECT_EQ(grouped(18'446'744'073'709'551'615u), "18,446,744,073,709,551,615");
  EXPECT_EQ(counted(1, "row", "rows") + counted(0, "row", "rows"), "1 row0 rows");
}

TEST(JsonTest, StringsAreEscapedAndNoFurtherThanNeeded) {
  EXPECT_EQ(jsonOf("a\"b\\c\n\x01"), R"("a\"b\\c\n\u0001")");
  EXPECT_EQ(jsonOf("\b\f\r\t\x1f\x7f"), R"("\b\f\r\t\u001f\u007f")");
  EXPECT_EQ(jsonOf("\u009b\u2028"), "\"\u009b\u2028\"");
  EXPECT_EQ(jsonOf("\n\u009b\u2028", {.forTerminal = true}), R"("\n\u009b\u2028")");
}

TEST(JsonTest, ForeignJsonIsMadeFitForATerminal) {
  std::string out;
  // NOLINTNEXTLINE(misc-misleading-bidirectional)
  JsonWriter(out, {.forTerminal = true}).raw("{\"a\":\n\t\"\u009b\x7f\u202e\"}");
  EXPECT_EQ(out, "{\"a\":  \"\\u009b\\u007f\\u202e\"}");
}

TEST(JsonTest, CommasAndLinesStandWhereTheyBelong) {
  const auto written = [](JsonStyle style) {
    std::string out;
    JsonWriter json(out, style);
    json.object([&] {
      json.member("none", std::optional<int>()).object("empty", [] {});
      json.array("list", std::vector{1, 2}, [&](int item) { json.value(item); });
      json.member("some", std::optional("x")).member("last", false);
    });
    return out;
  };
  EXPECT_EQ(written({}), R"({"empty":{},"list":[1,2],"some":"x","last":false})");
  EXPECT_EQ(written({.indent = 1}),
            "{\n \"empty\": {},\n \"list\": [\n  1,\n  2\n ],\n \"some\": \"x\",\n"
            " \"last\": false\n}");
}

}  // namespace
}  // namespace tessel
