// Any strings and numbers as the arguments of log messages. No control character of theirs may
// reach a terminal.

#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>

#include "platform/Log.h"
#include "platform/Text.h"

namespace {

using namespace tessel;

// Takes the leading bytes of the input as a T.
template <typename T>
T take(std::string_view& rest) {
  T value{};
  const size_t length = std::min(rest.size(), sizeof value);
  std::memcpy(&value, rest.data(), length);
  rest.remove_prefix(length);
  return value;
}

bool isPlain(std::string_view text) {
  for (size_t i = 0; i < text.size(); ++i) {
    const auto byte = static_cast<uint8_t>(text[i]);
    if ((byte < 0x20 && text[i] != '\t' && text[i] != '\n') || byte == 0x7f) return false;
    // U+0080 to U+009F are control characters, too.
    if (byte == 0xc2 && i + 1 < text.size() && static_cast<uint8_t>(text[i + 1]) < 0xa0)
      return false;
  }
  return isValidUtf8(text);
}

// Formats a message text of the input, if its conversions fit the three arguments that we have.
void formatFreely(std::string_view text, std::string_view word, uint64_t number, double real) {
  using detail::LogArgumentKind;
  size_t words = 0;
  for (size_t at = text.find('%'); at != std::string_view::npos; at = text.find('%', at)) {
    const auto [kind, length] = detail::conversionAt(text.substr(at));
    if (length == 0) return;
    constexpr LogArgumentKind kOrder[] = {LogArgumentKind::text, LogArgumentKind::unsigned64,
                                          LogArgumentKind::floating};
    if (words == std::size(kOrder) || kind != kOrder[words]) return;
    ++words;
    at += length;
  }
  const std::string out = formatLogArguments(text, {word, number, real});
  if (!isPlain(plainText(out, "\n    "))) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::string_view rest(reinterpret_cast<const char*>(data), size);
  const auto number = take<uint64_t>(rest);
  const auto real = take<double>(rest);
  const std::string_view word = rest.substr(0, rest.find('|'));
  const std::string line =
      formatLogArguments("%@/%s: %llu %f %.2f", {word, std::string(word), number, real, real});
  if (!line.starts_with(std::string(word) + "/")) std::abort();
  if (line.find(": " + std::to_string(number)) == std::string::npos) std::abort();
  const std::string shown = plainText(line, "\\x0a");
  if (!isPlain(shown) || shown.find('\n') != std::string::npos) std::abort();
  if (plainText(shown, "\\x0a") != shown) std::abort();
  formatFreely(rest.substr(word.size()), word, number, real);
  return 0;
}
