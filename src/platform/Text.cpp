// The walk through UTF-8, and the escapes.
//
// The walk decodes by hand. The C library decodes by the locale of the process, and a service must
// not depend on that. The Unicode library is no choice, because most rooms use nothing but the
// standard library. Decoding by hand takes one small function, sequenceOf().

#include "platform/Text.h"

#include <algorithm>

namespace tessel {

namespace {

constexpr std::string_view kReplacementCharacter = "\xef\xbf\xbd";

// Which bytes may follow a lead byte. `length` is 0 if no sequence begins with that byte.
struct Sequence {
  size_t length = 0;
  unsigned lowestSecond = 0x80;
  unsigned highestSecond = 0xbf;
};

// Only the second byte needs bounds of its own. After E0 and F0 they exclude sequences that are
// longer than need be, after ED surrogates, after F4 code points beyond Unicode. Any continuation
// byte may follow it. C0 and C1 could only encode ASCII in two bytes, so they begin no sequence.
Sequence sequenceOf(unsigned lead) {
  if (lead >= 0xc2 && lead <= 0xdf) return {2};
  if (lead >= 0xe0 && lead <= 0xef)
    return {3, lead == 0xe0 ? 0xa0U : 0x80U, lead == 0xed ? 0x9fU : 0xbfU};
  if (lead >= 0xf0 && lead <= 0xf4)
    return {4, lead == 0xf0 ? 0x90U : 0x80U, lead == 0xf4 ? 0x8fU : 0xbfU};
  return {};
}

unsigned byteAt(std::string_view text, size_t at) { return static_cast<unsigned char>(text[at]); }

// [U+200B], with at least four digits as Unicode writes them.
void appendNumber(std::string& out, char32_t point) {
  constexpr std::string_view kDigits = "0123456789ABCDEF";
  out += "[U+";
  for (int shift = 20; shift >= 0; shift -= 4) {
    if (shift < 16 || point >> shift != 0) out += kDigits[(point >> shift) & 0xf];
  }
  out += "]";
}

void appendHex(std::string& out, char32_t number, int digits) {
  constexpr std::string_view kDigits = "0123456789abcdef";
  for (int shift = 4 * (digits - 1); shift >= 0; shift -= 4)
    out += kDigits[(number >> shift) & 0xf];
}

void appendByteEscapes(std::string& out, std::string_view bytes) {
  for (size_t at = 0; at < bytes.size(); ++at) appendHex(out += "\\x", byteAt(bytes, at), 2);
}

struct Range {
  char32_t first;
  char32_t last;
};

// The characters that Unicode lets a font leave out, those that format their neighbours, and the
// blanks that look like U+0020 or like nothing. No library may be asked in this room, so they stand
// here.
constexpr Range kUnseen[] = {
    {0x00a0, 0x00a0},   {0x00ad, 0x00ad},   {0x034f, 0x034f},   {0x061c, 0x061c},
    {0x115f, 0x1160},   {0x1680, 0x1680},   {0x17b4, 0x17b5},   {0x180b, 0x180f},
    {0x2000, 0x200f},   {0x2028, 0x202f},   {0x205f, 0x206f},   {0x2800, 0x2800},
    {0x3000, 0x3000},   {0x3164, 0x3164},   {0xfe00, 0xfe0f},   {0xfeff, 0xfeff},
    {0xffa0, 0xffa0},   {0xfff0, 0xfffb},   {0x13430, 0x1343f}, {0x1bca0, 0x1bca3},
    {0x1d173, 0x1d17a}, {0xe0000, 0xe0fff},
};

std::string_view markupFor(char32_t point) {
  switch (point) {
    case '&':
      return "&amp;";
    case '<':
      return "&lt;";
    case '>':
      return "&gt;";
    case '"':
      return "&quot;";
    case '\'':
      return "&#39;";
    default:
      return {};
  }
}

}  // namespace

Character firstCharacter(std::string_view rest) {
  const unsigned lead = byteAt(rest, 0);
  if (lead < 0x80) return {rest.substr(0, 1), lead, true};
  const Sequence sequence = sequenceOf(lead);
  if (sequence.length == 0) return {rest.substr(0, 1)};
  // An invalid part ends before the first byte that cannot continue it, because that byte may begin
  // a good character. So a text that was cut within a character and joined to another text loses
  // only the character that was cut.
  char32_t point = lead & (0x7fU >> sequence.length);
  for (size_t at = 1; at < sequence.length; ++at) {
    const unsigned low = at == 1 ? sequence.lowestSecond : 0x80;
    const unsigned high = at == 1 ? sequence.highestSecond : 0xbf;
    if (at == rest.size() || byteAt(rest, at) < low || byteAt(rest, at) > high)
      return {rest.substr(0, at)};
    point = point << 6 | (byteAt(rest, at) & 0x3f);
  }
  return {rest.substr(0, sequence.length), point, true};
}

// Terminals obey the C1 controls in UTF-8, too: U+009B begins a sequence just as ESC [ does. Behind
// U+202E a terminal shows the rest of the line backwards, so that a recorded name could pass itself
// off as another one or hide the verdict beside it. Two names that look the same may differ by a
// character that nobody sees, and a whole sentence can hide in characters of the tags block.
bool isObeyed(char32_t point) {
  if (isControl(point)) return true;
  // Almost every character is below the first range.
  if (point < kUnseen[0].first) return false;
  return std::ranges::any_of(
      kUnseen, [point](const Range& range) { return point >= range.first && point <= range.last; });
}

void appendUnicodeEscape(std::string& out, char32_t point) { appendHex(out += "\\u", point, 4); }

bool isValidUtf8(std::string_view text) {
  while (!text.empty()) {
    const Character character = firstCharacter(text);
    if (!character.valid) return false;
    text.remove_prefix(character.bytes.size());
  }
  return true;
}

std::string replaceInvalidUtf8(std::string_view text) {
  std::string out;
  appendEscaped(
      out, text, [](const Character& character) { return character.valid; },
      [&](const Character&) { out += kReplacementCharacter; });
  return out;
}

namespace {

// A terminal and a page must hide the same characters, or a name could pass on one of them. So
// this is the one place that says which characters are replaced, and `replace(out, character)` says
// only by what.
template <typename Replace>
std::string withoutObeyed(std::string_view text, Replace&& replace) {
  std::string out;
  out.reserve(text.size());
  appendEscaped(
      out, text,
      [](const Character& character) { return character.valid && !isObeyed(character.point); },
      [&](const Character& character) { replace(out, character); });
  return out;
}

}  // namespace

// A backslash stays as it is, because escaped text is for people. A reader who must tell a recorded
// backslash from one of ours takes the JSON output.
std::string terminalText(std::string_view text) {
  return withoutObeyed(text, [](std::string& out, const Character& character) {
    if (!character.valid || isControl(character.point))
      appendByteEscapes(out, character.bytes);
    else if (character.point > 0xffff)
      appendHex(out += "\\U", character.point, 8);
    else
      appendUnicodeEscape(out, character.point);
  });
}

// Logs keep characters that reorder a line: the languages that are written from right to left need
// them, and a log line decides nothing about the line beside it.
std::string plainText(std::string_view text, std::string_view lineFeed) {
  std::string out;
  out.reserve(text.size());
  appendEscaped(
      out, text,
      [](const Character& character) {
        return character.valid && (!isControl(character.point) || character.point == '\t');
      },
      [&](const Character& character) {
        if (character.point == '\n')
          out += lineFeed;
        else
          appendByteEscapes(out, character.bytes);
      });
  return out;
}

// Three quarters of the room go to the end of the text. Most of these texts are paths, and the end
// of a path says more than its beginning. The cut may fall within an escape such as \x0a, which is
// harmless: its parts are plain ASCII.
std::string shortPlainText(std::string_view text, size_t maximum) {
  constexpr std::string_view kLeftOut = "...";
  std::string plain = plainText(text, "\\x0a");
  if (plain.size() <= maximum) return plain;
  // Both cuts move away from the middle to the edge of a character: both ends stay valid UTF-8.
  const auto insideCharacter = [&](size_t at) { return (byteAt(plain, at) & 0xc0) == 0x80; };
  size_t head = maximum / 4;
  size_t tail = plain.size() - (maximum - head - kLeftOut.size());
  while (insideCharacter(head)) --head;
  while (tail < plain.size() && insideCharacter(tail)) ++tail;
  return plain.substr(0, head).append(kLeftOut).append(plain, tail);
}

// A control below U+0020 has a picture in Unicode, at U+2400 plus its number. The others have none,
// so we show their numbers.
std::string visibleText(std::string_view text) {
  constexpr char32_t kControlPictures = 0x2400;
  return withoutObeyed(text, [](std::string& out, const Character& character) {
    if (!character.valid) {
      out += kReplacementCharacter;
    } else if (character.point < 0x20) {
      const char32_t picture = kControlPictures + character.point;
      out += {'\xe2', '\x90', static_cast<char>(0x80 | (picture & 0x3f))};
    } else {
      appendNumber(out, character.point);
    }
  });
}

std::string htmlText(std::string_view text) {
  const std::string visible = visibleText(text);
  std::string out;
  out.reserve(visible.size());
  appendEscaped(
      out, visible, [](const Character& character) { return markupFor(character.point).empty(); },
      [&](const Character& character) { out += markupFor(character.point); });
  return out;
}

std::string_view trimmed(std::string_view text, std::string_view blanks) {
  const size_t begin = text.find_first_not_of(blanks);
  if (begin == std::string_view::npos) return {};
  return text.substr(begin, text.find_last_not_of(blanks) - begin + 1);
}

// The separator is always a comma. Scripts and tests compare this text, so the locale of the caller
// must not change it. At -O2 GCC 12 takes the insertion of a text here for an overrun, so we insert
// a character.
std::string grouped(uint64_t number) {
  std::string digits = std::to_string(number);
  for (size_t at = digits.size(); at > 3; at -= 3) digits.insert(at - 3, 1, ',');
  return digits;
}

std::string counted(uint64_t number, std::string_view singular, std::string_view plural) {
  return grouped(number).append(" ").append(number == 1 ? singular : plural);
}

}  // namespace tessel
