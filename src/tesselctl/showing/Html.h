// Html: markup that is put together piece by piece.
//
// Only literals of this program become markup, because their type tells them apart: a literal is an
// array of known length. Every other text is escaped on its way in, whoever wrote it, so that
// forgetting to escape is not possible. One thread at a time.

#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Text.h"

namespace tessel::ctl {

class Html {
 public:
  template <size_t N>
  Html& operator<<(const char (&markup)[N]) {
    text_.append(markup, N - 1);
    return *this;
  }
  Html& operator<<(std::string_view text) {
    text_ += htmlText(text);
    return *this;
  }
  Html& operator<<(const std::string& text) { return *this << std::string_view(text); }
  // A count: in groups of three digits for people, plain in an attribute for programs.
  Html& operator<<(uint64_t count) {
    text_.append("<data value=\"")
        .append(std::to_string(count))
        .append("\">")
        .append(grouped(count))
        .append("</data>");
    return *this;
  }
  Html& operator<<(const Html& part) {
    text_ += part.text_;
    return *this;
  }
  // A coordinate or a size in a drawing, with two decimals.
  Html& at(double value);

  const std::string& text() const { return text_; }

 private:
  std::string text_;
};

}  // namespace tessel::ctl
