// Punctuation, string escapes and digits of JSON.

#include "platform/Json.h"

#include <charconv>
#include <cmath>

#include "platform/Text.h"

namespace tessel {

namespace {

// The letter of JSON's short escape, such as 'n' for a line feed. '\0' if there is none.
char shortEscape(char32_t point) {
  switch (point) {
    case '"':
    case '\\':
      return static_cast<char>(point);
    case '\b':
      return 'b';
    case '\f':
      return 'f';
    case '\n':
      return 'n';
    case '\r':
      return 'r';
    case '\t':
      return 't';
    default:
      return '\0';
  }
}

// JSON requires escapes for the C0 controls. DEL is escaped with them, because every other reader
// takes it for a control too. JSON allows the C1 controls and characters that nobody sees as they
// are. For a terminal they are escaped as well: a parser reads the same string either way, and
// `tesselctl --json` on a screen is as safe as the tables.
bool isEscaped(char32_t point, bool forTerminal) {
  return point < 0x20 || point == 0x7f || (forTerminal && isObeyed(point));
}

// JSON has escapes of four digits, so a character beyond U+FFFF takes the two of a surrogate pair.
void appendEscape(std::string& out, char32_t point) {
  if (point > 0xffff) {
    appendUnicodeEscape(out, 0xd800 + ((point - 0x10000) >> 10));
    point = 0xdc00 + (point & 0x3ff);
  }
  appendUnicodeEscape(out, point);
}

template <typename Value>
std::string_view digits(char (&buffer)[32], Value value) {  // of a double up to 24
  return {buffer, std::to_chars(buffer, std::end(buffer), value).ptr};
}

}  // namespace

void appendJsonString(std::string& out, std::string_view text, bool forTerminal) {
  out += '"';
  // Nearly every text is plain ASCII to its end, so this loop copies it without decoding. Decoding
  // each character would be most of the cost of a record.
  size_t plain = 0;
  while (plain < text.size() && text[plain] >= 0x20 && text[plain] < 0x7f && text[plain] != '"' &&
         text[plain] != '\\') {
    ++plain;
  }
  out.append(text, 0, plain);
  text.remove_prefix(plain);
  appendEscaped(
      out, text,
      [=](const Character& character) {
        return character.valid && character.point != '"' && character.point != '\\' &&
               !isEscaped(character.point, forTerminal);
      },
      [&](const Character& character) {
        if (!character.valid)
          out += "\xef\xbf\xbd";
        else if (const char letter = shortEscape(character.point); letter != '\0')
          (out += '\\') += letter;
        else
          appendEscape(out, character.point);
      });
  out += '"';
}

// In valid JSON a bare C0 control can only stand between tokens, where a space means the same. Any
// other unseen character can only stand in a string, where an escape means the same.
JsonWriter& JsonWriter::raw(std::string_view json) {
  separate();
  if (!style_.forTerminal) {
    out_ += json;
    return *this;
  }
  appendEscaped(
      out_, json, [](const Character& character) { return !isObeyed(character.point); },
      [this](const Character& character) {
        if (character.point < 0x20)
          out_ += ' ';
        else
          appendEscape(out_, character.point);
      });
  return *this;
}

JsonWriter& JsonWriter::key(std::string_view name) {
  string(name);
  out_ += style_.indent == 0 ? ":" : ": ";
  place_ = Place::key;
  return *this;
}

void JsonWriter::open(char bracket) {
  separate();
  out_ += bracket;
  ++depth_;
  place_ = Place::opening;
}

void JsonWriter::close(char bracket) {
  --depth_;
  if (place_ == Place::value) newLine();
  out_ += bracket;
  place_ = Place::value;
}

// Called before each key and value. Only what was written last decides whether a comma is needed,
// so no stack of open brackets is kept.
void JsonWriter::separate() {
  if (place_ == Place::value) out_ += ',';
  if (place_ == Place::value || place_ == Place::opening) newLine();
  place_ = Place::value;
}

void JsonWriter::newLine() {
  if (style_.indent != 0) out_.append(1, '\n').append(depth_ * style_.indent, ' ');
}

void JsonWriter::string(std::string_view text) {
  separate();
  appendJsonString(out_, text, style_.forTerminal);
}

void JsonWriter::number(int64_t value) {
  char buffer[32];
  separate();
  out_ += digits(buffer, value);
}

void JsonWriter::number(uint64_t value) {
  char buffer[32];
  separate();
  out_ += digits(buffer, value);
}

// A float is not widened: the shortest digits of 0.1f are "0.1", those of the same number as a
// double are "0.10000000149011612", which nobody recorded.
void JsonWriter::number(float value) {
  char buffer[32];
  fraction(std::isfinite(value), digits(buffer, value));
}

void JsonWriter::number(double value) {
  char buffer[32];
  fraction(std::isfinite(value), digits(buffer, value));
}

// The shortest digits of 5.0 are "5". A reader would take them for an integer, and a backend that
// has met both kinds under one name may refuse one of them.
void JsonWriter::fraction(bool finite, std::string_view shortest) {
  if (!finite) {
    raw("null");
    return;
  }
  separate();
  out_ += shortest;
  if (shortest.find_first_of(".e") == std::string_view::npos) out_ += ".0";
}

}  // namespace tessel
