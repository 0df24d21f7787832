// Cursors and ids as text.

#include "journal/EntryStream.h"

#include <charconv>
#include <cstddef>

namespace tessel {

namespace {

std::string hexadecimal(uint64_t value) {
  // 64 bits have at most 16 digits, so to_chars() cannot fail.
  char buffer[16];
  const auto [end, error] = std::to_chars(buffer, buffer + sizeof buffer, value, 16);
  return {buffer, end};
}

bool readPart(EntryHeader& header, char part, std::string_view value) {
  switch (part) {
    case 's':
    case 'b': {
      const auto id = parseId128(value);
      if (id) (part == 's' ? header.sequenceId : header.bootId) = *id;
      return id.has_value();
    }
    case 'i':
      return parseNumber(value, 16, header.sequenceNumber);
    case 'm':
      return parseNumber(value, 16, header.monotonic);
    case 't':
      return parseNumber(value, 16, header.realtime);
    case 'x':
      return parseNumber(value, 16, header.contentHash);
    default:
      return false;
  }
}

}  // namespace

bool parseNumber(std::string_view text, int base, uint64_t& out) {
  // from_chars() also accepts a number with other text behind it, so we compare where it stopped.
  const char* end = text.data() + text.size();
  const auto [at, error] = std::from_chars(text.data(), end, out, base);
  return error == std::errc() && at == end;
}

std::string textOf(const Id128& id) {
  constexpr std::string_view kDigits = "0123456789abcdef";
  std::string text;
  for (const uint8_t byte : id) {
    text += kDigits[byte >> 4];
    text += kDigits[byte & 15];
  }
  return text;
}

std::optional<Id128> parseId128(std::string_view text) {
  Id128 id{};
  size_t digits = 0;
  for (const char c : text) {
    if (c == '-' && text.size() == 36) continue;  // the kernel writes boot ids with dashes
    uint64_t digit = 0;
    if (digits == 2 * id.size() || !parseNumber({&c, 1}, 16, digit)) return std::nullopt;
    id[digits / 2] = static_cast<uint8_t>(id[digits / 2] * 16 + digit);
    ++digits;
  }
  if (digits != 2 * id.size()) return std::nullopt;
  return id;
}

std::string cursorOf(const EntryHeader& header) {
  return "s=" + textOf(header.sequenceId) + ";i=" + hexadecimal(header.sequenceNumber) +
         ";b=" + textOf(header.bootId) + ";m=" + hexadecimal(header.monotonic) +
         ";t=" + hexadecimal(header.realtime) + ";x=" + hexadecimal(header.contentHash);
}

// The parts must come in journalctl's order, each once. Otherwise text in a log value would sooner
// pass for a cursor, and the recorder would continue a wrong sequence.
std::optional<EntryHeader> parseCursor(std::string_view cursor) {
  constexpr std::string_view kParts = "sibmtx";
  EntryHeader header;
  size_t found = 0;
  while (!cursor.empty()) {
    const std::string_view part = cursor.substr(0, cursor.find(';'));
    cursor.remove_prefix(part.size() + (part.size() < cursor.size() ? 1 : 0));
    if (part.size() < 2 || part[1] != '=') return std::nullopt;
    if (found == kParts.size() || part[0] != kParts[found++]) return std::nullopt;
    if (!readPart(header, part[0], part.substr(2))) return std::nullopt;
  }
  if (found != kParts.size()) return std::nullopt;
  return header;
}

}  // namespace tessel
