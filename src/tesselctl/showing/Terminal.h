// Where output goes: how wide it is, whether it takes colours, and how columns are laid out on it.
//
// Threads: one at a time.

#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace tessel::ctl {

enum class Colour { plain, good, bad, caution, faint, strong };

struct Terminal {
  bool interactive = false;  // a terminal, not a file or a pipe
  bool colours = false;
  size_t width = 80;  // columns

  // `text` in `colour` where colours are wanted.
  std::string paint(Colour colour, std::string_view text) const;
};

// What stands behind a file descriptor. Colours are for terminals, unless $NO_COLOR is set to
// anything but nothing or $TERM is "dumb". What is no terminal is 80 columns wide.
Terminal terminalBehind(int fd);

// Rows in aligned columns. Texts must be fit for a terminal already.
class Table {
 public:
  enum class Align { left, right };
  struct Column {
    std::string title;
    Align align = Align::left;
    bool shrinks = false;  // gives way, from the middle of its texts, where the row is too wide
  };
  struct Cell {
    std::string text;
    Colour colour = Colour::plain;

    Cell(std::string shown, Colour in = Colour::plain) : text(std::move(shown)), colour(in) {}
    Cell(const char* shown) : text(shown) {}
  };

  explicit Table(std::vector<Column> columns) : columns_(std::move(columns)) {}
  // REQUIRES: as many cells as there are columns.
  void add(std::vector<Cell> row) { rows_.push_back(std::move(row)); }
  bool empty() const { return rows_.empty(); }
  // Titles and rows, each line ended, each indented by `indent`.
  std::string render(const Terminal& terminal, size_t indent = 0) const;

 private:
  std::vector<size_t> widths(size_t available) const;

  const std::vector<Column> columns_;
  std::vector<std::vector<Cell>> rows_;
};

// `text` broken between words to `width` columns; lines after the first begin with `indent` spaces.
// A word that is too long stands alone, cut in the middle.
std::string wrapped(std::string_view text, size_t width, size_t indent);

// Writes all of `text` to standard output; ends the process where nobody reads it any more.
void print(std::string_view text);
void printError(std::string_view text);

}  // namespace tessel::ctl
