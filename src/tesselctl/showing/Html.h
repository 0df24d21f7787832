// Html: markup that is put together piece by piece, and the names and tables on a page.
//
// Only literals of this program become markup, because their type tells them apart: a literal is an
// array of known length. Every other text is escaped on its way in, whoever wrote it, so that
// forgetting to escape is not possible. One thread at a time.

#pragma once

#include <cstdint>
#include <initializer_list>
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
  Html& operator<<(uint64_t count);
  Html& operator<<(const Html& part) {
    text_ += part.text_;
    return *this;
  }
  // A coordinate or a size in a drawing, to a tenth of its unit: less than anybody sees.
  Html& at(double value);
  // A quantity in words, with the number by which rows are sorted in an attribute.
  Html& quantity(float value, std::string_view words);

  const std::string& text() const { return text_; }

 private:
  std::string text_;
};

// Names: the texts on a page that programs or people chose.
//
// Each stands in a <bdi>, so that letters written from right to left leave the text around them in
// order. A long one loses its middle, and the whole of it is in a title. A tally holds 8 MiB of
// names at most, but markup makes some characters seven times as long, and a name may stand in
// several lists. So all titles share 16 MiB, and names beyond have none: the page stays one that a
// browser opens.
class Names {
 public:
  // Characters of a name on the page. Names of up to this length stand in one line of a wide
  // window, and in three of a narrow one.
  static constexpr size_t kLongest = 64;

  Html operator()(std::string_view text, size_t longest = kLongest);
  // "subsystem / category".
  Html operator()(std::string_view subsystem, std::string_view category);
  // "subsystem / category / name".
  Html operator()(std::string_view subsystem, std::string_view category, std::string_view name);

  // How many cut names have no title.
  uint64_t withoutTitle() const { return withoutTitle_; }

 private:
  size_t titleBytes_ = 0;
  uint64_t withoutTitle_ = 0;
};

struct Column {
  enum class Kind { text, number, chart };
  std::string_view title;
  Kind kind = Kind::text;
};

// How a table is used.
enum class TableUse {
  read,    // from top to bottom
  search,  // the page's script adds a filter and makes its headings sort
};

// The beginning of a table, up to its first row. `id` names it for programs and in the page.
Html tableHead(std::string_view id, const Html& caption, std::initializer_list<Column> columns,
               TableUse use = TableUse::read);
Html tableEnd();

}  // namespace tessel::ctl
