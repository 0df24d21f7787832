// The terminal: how wide it is, whether it takes colours, and how columns, paragraphs, lines of
// JSON and the progress of long work are laid out on it.
//
// Texts must be fit for a terminal already (see platform/Text.h): what is laid out here is measured
// and cut, never escaped. One thread at a time.

#pragma once

#include <chrono>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Json.h"

namespace tessel::ctl {

enum class Colour { plain, good, bad, caution, faint, strong };

struct Terminal {
  bool interactive = false;  // a terminal, not a file or a pipe
  bool colours = false;
  size_t width = 80;  // columns

  // `text` in `colour`, or plain if colours are not wanted.
  std::string paint(Colour colour, std::string_view text) const;
};

// What stands behind a file descriptor. A terminal gets colours, unless $NO_COLOR is set and not
// empty, or $TERM is "dumb". Files and pipes are 80 columns wide.
Terminal terminalBehind(int fd);

// Columns that `text` takes.
size_t displayWidth(std::string_view text);
// `text` in at most `width` columns. A text that is too long loses its middle to an ellipsis, since
// names that begin alike differ at their ends.
std::string shortened(std::string_view text, size_t width);
// The same, but a text that is too long loses its end.
std::string cutOff(std::string_view text, size_t width);

// Rows in aligned columns.
class Table {
 public:
  enum class Align { left, right };
  struct Column {
    std::string title;
    Align align = Align::left;
    bool shrinks = false;  // its texts are shortened if the row is too wide
  };
  struct Cell {
    std::string text;
    Colour colour = Colour::plain;

    Cell(std::string shown, Colour in = Colour::plain) : text(std::move(shown)), colour(in) {}
    Cell(const char* shown) : text(shown) {}
  };

  explicit Table(std::vector<Column> columns) : columns_(std::move(columns)) {}
  // REQUIRES: as many cells as there are columns.
  void add(std::vector<Cell> row);
  bool empty() const { return rows_.empty(); }
  // Titles and rows. Each line ends with a line feed and begins with `indent` spaces.
  std::string render(const Terminal& terminal, size_t indent = 0) const;

 private:
  std::vector<size_t> widths(size_t available) const;

  const std::vector<Column> columns_;
  std::vector<std::vector<Cell>> rows_;
};

// `text` broken between words to `width` columns; lines after the first begin with `indent` spaces.
// A word that is longer than a line stands alone and loses its middle.
std::string wrapped(std::string_view text, size_t width, size_t indent);
// The same beside a label of `indent` columns, which the caller writes before the first line. On a
// terminal too narrow for that, lines are 12 columns wide behind the label.
std::string wrappedBeside(std::string_view text, size_t width, size_t indent);

// One JSON object on a line of its own. `write(JsonWriter&)` writes its members.
template <typename Write>
std::string objectLine(Write&& write) {
  std::string line;
  JsonWriter json(line, {.forTerminal = true});
  json.object([&] { write(json); });
  return line + "\n";
}

// Writes all of `text` to standard output. Ends the process if nobody reads it any more.
void print(std::string_view text);
void printError(std::string_view text);

// ProgressBar: shows on standard error how far long work is. It appears if standard error is a
// terminal and the work takes more than a second, and is gone without a trace once it is destroyed.
class ProgressBar {
 public:
  // `wanted` is false if something else is written to the terminal meanwhile.
  explicit ProgressBar(bool wanted);
  ProgressBar(const ProgressBar&) = delete;
  ProgressBar& operator=(const ProgressBar&) = delete;
  ~ProgressBar() { clear(); }

  // `part` of the work, from 0 to 1, is done, with `entries` read.
  void update(double part, uint64_t entries);
  void clear();

 private:
  const bool wanted_;
  const Terminal terminal_;
  std::chrono::steady_clock::time_point nextLook_;
  bool visible_ = false;
};

}  // namespace tessel::ctl
