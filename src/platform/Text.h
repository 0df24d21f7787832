// Text: a walk through UTF-8, and the escapes that make a text of unknown origin fit to be shown.
//
// Programs record any text they like, and strangers may write into the files that we read. So each
// such text is escaped on its way out: to a terminal, a log or markup by the functions below, into
// JSON by Json.h. All of them use the same walk, so they agree on what a character is.
//
// Stateless; any thread.

#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace tessel {

// A well-formed UTF-8 sequence, or bytes that belong to none.
struct Character {
  std::string_view bytes;
  char32_t point = 0xfffd;  // code point; U+FFFD for bytes that are not valid
  bool valid = false;
};

// The character that `rest` begins with. Invalid bytes come in maximal parts: as many bytes as
// could begin a well-formed sequence, but at least one. REQUIRES: rest is not empty.
Character firstCharacter(std::string_view rest);

// Calls `visit(const Character&)` on each character of `text`, first to last.
template <typename Visit>
void forEachCharacter(std::string_view text, Visit&& visit) {
  while (!text.empty()) {
    const Character character = firstCharacter(text);
    visit(character);
    text.remove_prefix(character.bytes.size());
  }
}

// Appends `text` to `out`. If `isPlain(const Character&)` refuses a character, then
// `escape(const Character&)` must append its replacement. Runs of plain characters are copied
// whole.
template <typename IsPlain, typename Escape>
void appendEscaped(std::string& out, std::string_view text, IsPlain&& isPlain, Escape&& escape) {
  size_t plain = 0;  // bytes of `text` that are plain and not yet copied
  size_t copied = 0;
  forEachCharacter(text, [&](const Character& character) {
    if (isPlain(character)) {
      plain += character.bytes.size();
      return;
    }
    out.append(text, copied, plain);
    escape(character);
    copied += plain + character.bytes.size();
    plain = 0;
  });
  out.append(text, copied, plain);
}

// The C0 controls, DEL, and the C1 controls.
constexpr bool isControl(char32_t point) { return point < 0x20 || (point >= 0x7f && point < 0xa0); }
// Whether a terminal obeys the character, or shows its neighbours in another order or line.
bool isObeyed(char32_t point);
// Appends \uNNNN. REQUIRES: point <= 0xffff.
void appendUnicodeEscape(std::string& out, char32_t point);

bool isValidUtf8(std::string_view text);
// `text` with one U+FFFD for each maximal invalid part.
std::string replaceInvalidUtf8(std::string_view text);

// For a terminal: one line that moves no cursor, sets no colour and keeps its order. Controls
// and invalid bytes become \xNN, characters that reorder or break a line become \uNNNN.
std::string terminalText(std::string_view text);

// For a log: as terminalText(), but tabs and characters that reorder or break a line stay, and a
// line feed becomes `lineFeed`.
std::string plainText(std::string_view text, std::string_view lineFeed);

// plainText() with line feeds as \x0a, shortened to at most `maximum` bytes: "..." takes the place
// of the middle of a longer text. REQUIRES: maximum >= 16.
std::string shortPlainText(std::string_view text, size_t maximum);

// `text` with every character in sight: two texts that differ also look different, unless their
// letters look alike. A control below U+0020 becomes its picture (U+2400 and up). Any other
// character that shows nothing of its own, or that reorders its neighbours, becomes its number,
// such as [U+200B]. Invalid bytes become U+FFFD.
std::string visibleText(std::string_view text);

// For markup: visibleText() as the content of an element or of a quoted attribute.
std::string htmlText(std::string_view text);

// `text` without the blanks at its ends.
std::string_view trimmed(std::string_view text, std::string_view blanks = " \t\r\n");

// "1,234,567".
std::string grouped(uint64_t number);
// "1 event", "2 events", "1,000 events".
std::string counted(uint64_t number, std::string_view singular, std::string_view plural);

}  // namespace tessel
