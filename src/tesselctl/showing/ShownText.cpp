// Escaping and measuring.

#include "tesselctl/showing/ShownText.h"

#include <unicode/uchar.h>

#include <algorithm>
#include <vector>

#include "platform/Payload.h"

namespace tessel::ctl {

namespace {

constexpr std::string_view kEllipsis = "\u2026";

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

std::string terminalJson(std::string_view json) {
  if (isPlainAscii(json)) return std::string(json);
  std::string out;
  out.reserve(json.size());
  forEachCharacter(json, [&](const Character& character) {
    if (character.point < 0x20) {
      out += ' ';
    } else if (isObeyed(character.point)) {
      appendUnicodeEscape(out, character.point);
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

}  // namespace tessel::ctl
