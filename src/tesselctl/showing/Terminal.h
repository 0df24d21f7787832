// Standard output, as a terminal or as lines for other programs.
//
// A terminal gets aligned columns that fit its width. Where there is no terminal, `grep`, `cut` and
// `sort` read the output. So a row is one line there, its fields stand between tabs, numbers are
// plain digits, and nothing is cut or wrapped.
//
// Texts must be fit for a terminal already (see platform/Text.h): they are measured and cut here,
// never escaped. Escaped text holds no tab and no line feed, so the tabs and line feeds of a line
// are always ours. One thread at a time.

#pragma once

#include <chrono>
#include <cstdint>
#include <limits>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Json.h"

namespace tessel::ctl {

enum class Colour { plain, good, bad, caution, faint, strong };

struct Terminal {
  // The width of a line that nobody has to fit on a screen.
  static constexpr size_t kUnlimited = std::numeric_limits<size_t>::max();

  bool interactive = false;  // a terminal, not a file or a pipe
  bool colours = false;
  size_t width = kUnlimited;  // columns

  // `text` in `colour`, or plain if colours are not wanted.
  std::string paint(Colour colour, std::string_view text) const;
  // A number in a row: "1,234" on a terminal, else "1234", which programs can sort and add up.
  std::string number(uint64_t number) const;
  // `columns` on a terminal. Elsewhere no limit, since nothing is cut there.
  size_t limit(size_t columns) const { return interactive ? columns : kUnlimited; }
};

enum class ColourChoice { automatic, always, never };

// What stands behind a file descriptor. A terminal is as wide as $COLUMNS says, or else as it says
// itself. Other values of $COLUMNS than whole numbers from 1 to 9999 are ignored. `automatic` gives
// colours to a terminal, unless $NO_COLOR is set and not empty, or $TERM is "dumb" or absent.
Terminal terminalBehind(int fd, ColourChoice choice = ColourChoice::automatic);

// The fields of a row with tabs between them and a line feed behind them. REQUIRES: a field.
std::string fieldsLine(const std::vector<std::string>& fields);

// Columns that `text` takes.
size_t displayWidth(std::string_view text);
// `text` in at most `width` columns. A text that is too long loses its middle to an ellipsis, since
// names that begin alike differ at their ends.
std::string shortened(std::string_view text, size_t width);
// The same, but a text that is too long loses its end.
std::string cutOff(std::string_view text, size_t width);

// Rows in aligned columns, or with tabs between where there is no terminal.
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
  // Titles and rows. Each line ends with a line feed. On a terminal it begins with `indent` spaces.
  std::string render(const Terminal& terminal, size_t indent = 0) const;

 private:
  std::string renderAligned(const Terminal& terminal, size_t indent) const;
  std::vector<size_t> widths(size_t available) const;

  const std::vector<Column> columns_;
  std::vector<std::vector<Cell>> rows_;
};

// `text` broken between words to `width` columns; lines after the first begin with `indent` spaces.
// A word that is longer than a line stands alone and loses its middle.
std::string wrapped(std::string_view text, size_t width, size_t indent);
// "com.vantor.Calendar / View / Open", fit for a terminal; without a name "com.vantor.Calendar /
// View".
std::string pathText(std::string_view subsystem, std::string_view category, std::string_view name);
// The same beside a label of `indent` columns, which the caller writes before the first line. On a
// terminal too narrow for that, lines are 12 columns wide behind the label. A label that is longer
// reaches `beyond` columns further on the first line.
std::string wrappedBeside(std::string_view text, size_t width, size_t indent, size_t beyond = 0);

// One JSON object on a line of its own. `write(JsonWriter&)` writes its members.
template <typename Write>
std::string objectLine(Write&& write) {
  std::string line;
  JsonWriter json(line, {.forTerminal = true});
  json.object([&] { write(json); });
  return line + "\n";
}

// Makes standard output fit to report its errors. Called once, before anything is opened.
void prepareOutput();
// They end the process if standard output takes no more: with a line on stderr and status 1, or
// without a word if the reader of a pipe left. Whoever prints must have nothing left to tidy up.
// print() may keep the text in a buffer; flushOutput() writes it.
void print(std::string_view text);
void flushOutput();
// flushOutput() for a command that waits for more to print. It also ends the process if the reader
// of a pipe left by now: the next write would notice, but it may be hours away.
void flushWhileWaiting();
void printError(std::string_view text);

// ProgressBar: shows on standard error how far long work is. It appears if standard error is a
// terminal that can erase a line, and the work takes more than a second. It is gone without a trace
// once it is destroyed.
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
