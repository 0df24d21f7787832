// Escaping and measuring.

#include "tesselctl/showing/ShownText.h"

#include <unicode/uchar.h>
#include <unicode/utf8.h>

#include <algorithm>
#include <array>
#include <charconv>
#include <vector>

#include "platform/Payload.h"
#include "platform/PlainText.h"

namespace tessel::ctl {

namespace {

constexpr std::string_view kEllipsis = "\u2026";

struct Character {
  std::string_view bytes;
  char32_t point = 0;
};

// Calls `visit(Character)` on each character of well-formed UTF-8.
template <typename Visit>
void forEachCharacter(std::string_view text, Visit&& visit) {
  const auto* bytes = reinterpret_cast<const uint8_t*>(text.data());
  for (size_t at = 0; at < text.size();) {
    const size_t begin = at;
    UChar32 point = 0;
    U8_NEXT_OR_FFFD(bytes, at, text.size(), point);
    visit(Character{text.substr(begin, at - begin), static_cast<char32_t>(point)});
  }
}

// Line and paragraph separators, and what changes the direction of the text around it.
bool rearrangesText(char32_t point) {
  return point == 0x2028 || point == 0x2029 || point == 0x061c || point == 0x200e ||
         point == 0x200f || (point >= 0x202a && point <= 0x202e) ||
         (point >= 0x2066 && point <= 0x2069);
}

bool isControl(char32_t point) { return point < 0x20 || (point >= 0x7f && point < 0xa0); }

void appendUnicodeEscape(std::string& out, char32_t point) {
  constexpr std::string_view kDigits = "0123456789abcdef";
  out += "\\u";
  for (int shift = 12; shift >= 0; shift -= 4) out += kDigits[(point >> shift) & 0xf];
}

size_t widthOf(char32_t point) {
  switch (u_charType(static_cast<UChar32>(point))) {
    case U_NON_SPACING_MARK:
    case U_ENCLOSING_MARK:
    case U_FORMAT_CHAR:
      return 0;
    default:
      break;
  }
  const int width = u_getIntPropertyValue(static_cast<UChar32>(point), UCHAR_EAST_ASIAN_WIDTH);
  return width == U_EA_WIDE || width == U_EA_FULLWIDTH ? 2 : 1;
}

bool isPlainAscii(std::string_view text) {
  return std::all_of(text.begin(), text.end(),
                     [](char byte) { return byte >= 0x20 && byte < 0x7f; });
}

// The longest beginning of `characters` that fits `width` columns, as a number of characters.
size_t fitting(const std::vector<size_t>& widths, size_t width) {
  size_t count = 0;
  for (size_t used = 0; count < widths.size() && used + widths[count] <= width; ++count)
    used += widths[count];
  return count;
}

std::string abridged(std::string_view text, size_t width, size_t tailWidth) {
  if (displayWidth(text) <= width) return std::string(text);
  if (width == 0) return {};
  std::vector<std::string_view> characters;
  std::vector<size_t> widths;
  forEachCharacter(text, [&](const Character& character) {
    characters.push_back(character.bytes);
    widths.push_back(widthOf(character.point));
  });
  const size_t head = fitting(widths, width - 1 - tailWidth);
  std::reverse(widths.begin(), widths.end());
  const size_t tail = fitting(widths, tailWidth);
  std::string out;
  for (size_t at = 0; at < head; ++at) out += characters[at];
  out += kEllipsis;
  for (size_t at = characters.size() - tail; at < characters.size(); ++at) out += characters[at];
  return out;
}

}  // namespace

std::string terminalText(std::string_view text) {
  if (isPlainAscii(text)) return std::string(text);
  std::string out;
  forEachCharacter(plainText(text, "\\x0a"), [&](const Character& character) {
    if (character.point == '\t') {
      out += "\\x09";
    } else if (rearrangesText(character.point)) {
      appendUnicodeEscape(out, character.point);
    } else {
      out += character.bytes;
    }
  });
  return out;
}

std::string terminalJson(std::string_view json) {
  if (isPlainAscii(json)) return std::string(json);
  std::string out;
  out.reserve(json.size());
  forEachCharacter(json, [&](const Character& character) {
    if (character.point < 0x20) {
      out += ' ';
    } else if (isControl(character.point) || rearrangesText(character.point)) {
      appendUnicodeEscape(out, character.point);
    } else {
      out += character.bytes;
    }
  });
  return out;
}

std::string htmlText(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  forEachCharacter(replaceInvalidUtf8(text), [&](const Character& character) {
    switch (character.point) {
      case '&':
        out += "&amp;";
        return;
      case '<':
        out += "&lt;";
        return;
      case '>':
        out += "&gt;";
        return;
      case '"':
        out += "&quot;";
        return;
      case '\'':
        out += "&#39;";
        return;
      default:
        break;
    }
    if (character.point < 0x20) {
      out += "&#" + std::to_string(0x2400 + static_cast<uint32_t>(character.point)) + ";";
    } else if (isControl(character.point) || rearrangesText(character.point)) {
      out += "\ufffd";
    } else {
      out += character.bytes;
    }
  });
  return out;
}

size_t displayWidth(std::string_view text) {
  if (isPlainAscii(text)) return text.size();
  size_t width = 0;
  forEachCharacter(text, [&](const Character& character) { width += widthOf(character.point); });
  return width;
}

std::string shortened(std::string_view text, size_t width) {
  return abridged(text, width, width == 0 ? 0 : (width - 1) / 2);
}

std::string cutOff(std::string_view text, size_t width) { return abridged(text, width, 0); }

std::string grouped(uint64_t number) {
  std::string digits = std::to_string(number);
  for (size_t at = digits.size(); at > 3; at -= 3) digits.insert(at - 3, ",");
  return digits;
}

std::string counted(uint64_t number, std::string_view singular, std::string_view plural) {
  return grouped(number).append(" ").append(number == 1 ? singular : plural);
}

}  // namespace tessel::ctl
