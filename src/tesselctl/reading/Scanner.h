// Scanner: reads what it is asked for from the front of a short text. One thread at a time.

#pragma once

#include <charconv>
#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace tessel::ctl {

class Scanner {
 public:
  explicit Scanner(std::string_view text) : rest_(text) {}

  bool done() const { return rest_.empty(); }
  char peek() const { return rest_.empty() ? '\0' : rest_.front(); }
  bool skip(char wanted) {
    if (peek() != wanted) return false;
    rest_.remove_prefix(1);
    return true;
  }
  void skipSpaces() {
    while (skip(' ')) {
    }
  }
  // A decimal number of `fewest` to `most` digits. Nobody asks for more than 12 digits, which
  // always fit 64 bits.
  std::optional<int64_t> number(size_t fewest, size_t most) {
    size_t digits = 0;
    while (digits < rest_.size() && digits < most && isDigit(rest_[digits])) ++digits;
    int64_t value = 0;
    if (digits < fewest ||
        std::from_chars(rest_.data(), rest_.data() + digits, value).ec != std::errc())
      return {};
    rest_.remove_prefix(digits);
    return value;
  }
  // The part of a second behind a point. Digits beyond std::chrono::microseconds are read and
  // dropped, since other tools print nanoseconds.
  std::optional<std::chrono::microseconds> fraction() {
    std::chrono::microseconds value{0};
    std::chrono::microseconds unit{100'000};
    if (!isDigit(peek())) return {};
    for (; isDigit(peek()); rest_.remove_prefix(1), unit /= 10) value += unit * (peek() - '0');
    return value;
  }
  // Letters, in lower case.
  std::string word() {
    std::string found;
    for (; isLetter(peek()); rest_.remove_prefix(1)) found += static_cast<char>(peek() | 0x20);
    return found;
  }
  std::string_view rest() const { return rest_; }

 private:
  static bool isLetter(char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }
  static bool isDigit(char character) { return character >= '0' && character <= '9'; }

  std::string_view rest_;
};

}  // namespace tessel::ctl
