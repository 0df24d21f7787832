// Escaping for terminals, and blanks.

#include "platform/PlainText.h"

#include <algorithm>

#include "platform/Payload.h"

namespace tessel {

namespace {

// Length of the well-formed UTF-8 character that `rest` begins with; 0 where it begins with none.
size_t characterLength(std::string_view rest) {
  for (size_t length = 1; length <= std::min<size_t>(4, rest.size()); ++length) {
    if (isValidUtf8(rest.substr(0, length))) return length;
  }
  return 0;
}

// C0 controls, DEL, and the C1 controls, which some terminals obey in UTF-8, too.
bool isControl(std::string_view character) {
  const auto first = static_cast<unsigned char>(character[0]);
  if (character.size() == 1) return (first < 0x20 && first != '\t') || first == 0x7f;
  return character.size() == 2 && first == 0xc2 && static_cast<unsigned char>(character[1]) < 0xa0;
}

void appendEscaped(std::string& out, std::string_view bytes) {
  constexpr std::string_view kDigits = "0123456789abcdef";
  for (const char byte : bytes) {
    const auto value = static_cast<unsigned char>(byte);
    out += "\\x";
    out += kDigits[value >> 4];
    out += kDigits[value & 0xf];
  }
}

}  // namespace

std::string plainText(std::string_view text, std::string_view lineFeed) {
  std::string out;
  out.reserve(text.size());
  while (!text.empty()) {
    const size_t length = characterLength(text);
    const std::string_view character = text.substr(0, std::max<size_t>(length, 1));
    if (character == "\n") {
      out += lineFeed;
    } else if (length == 0 || isControl(character)) {
      appendEscaped(out, character);
    } else {
      out += character;
    }
    text.remove_prefix(character.size());
  }
  return out;
}

std::string shortPlainText(std::string_view text, size_t maximum) {
  constexpr std::string_view kLeftOut = "...";
  std::string plain = plainText(text, "\\x0a");
  if (plain.size() <= maximum) return plain;
  const auto insideCharacter = [&](size_t at) {
    return (static_cast<unsigned char>(plain[at]) & 0xc0) == 0x80;
  };
  size_t head = maximum / 4;
  size_t tail = plain.size() - (maximum - head - kLeftOut.size());
  while (insideCharacter(head)) --head;
  while (tail < plain.size() && insideCharacter(tail)) ++tail;
  return plain.substr(0, head).append(kLeftOut).append(plain, tail);
}

std::string_view trimmed(std::string_view text, std::string_view blanks) {
  const size_t begin = text.find_first_not_of(blanks);
  if (begin == std::string_view::npos) return {};
  return text.substr(begin, text.find_last_not_of(blanks) - begin + 1);
}

}  // namespace tessel
