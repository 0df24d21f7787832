// Measuring, colouring and laying out.

#include "tesselctl/showing/Terminal.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <unicode/uchar.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <numeric>

#include "os/Files.h"
#include "platform/Invariant.h"
#include "platform/Text.h"

namespace tessel::ctl {

namespace {

// A narrower terminal counts as one of 40 columns: on less, tables would be all ellipses.
constexpr size_t kNarrowest = 40;
constexpr size_t kWidest = 9999;      // no screen is wider, so a larger $COLUMNS is a mistake
constexpr size_t kGap = 2;            // between columns
constexpr size_t kLeastShrunken = 8;  // columns; with fewer, the ends of a text say nothing
constexpr size_t kBarWidth = 30;
constexpr std::chrono::seconds kPatience{1};               // before a bar is drawn
constexpr std::chrono::milliseconds kRedrawInterval{100};  // as often as eyes follow
constexpr std::string_view kEllipsis = "\u2026";

// A terminal gives a mark no column of its own and an East Asian character two. Which is which
// changes with each version of Unicode, so the tables are those of the Unicode library. Characters
// of "ambiguous" width count as one: only East Asian terminals give them two.
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

// How many of `widths`, from the first on, fit `width` columns.
size_t fitting(const std::vector<size_t>& widths, size_t width) {
  size_t count = 0;
  for (size_t used = 0; count < widths.size() && used + widths[count] <= width; ++count)
    used += widths[count];
  return count;
}

// `text` in at most `width` columns: its beginning, an ellipsis, `tailWidth` columns of its end.
std::string abridged(std::string_view text, size_t width, size_t tailWidth) {
  if (displayWidth(text) <= width) return std::string(text);
  if (width == 0) return {};
  std::vector<std::string_view> characters;
  std::vector<size_t> widths;
  forEachCharacter(text, [&](const Character& character) {
    characters.push_back(character.bytes);
    widths.push_back(widthOf(character.point));
  });
  // The ellipsis takes one column. A mark of no width behind the cut stays with its letter, since
  // fitting() takes all that fits; one at the start of the tail may lose its letter.
  const size_t head = fitting(widths, width - 1 - tailWidth);
  std::reverse(widths.begin(), widths.end());
  const size_t tail = fitting(widths, tailWidth);
  std::string out;
  for (size_t at = 0; at < head; ++at) out += characters[at];
  out += kEllipsis;
  for (size_t at = characters.size() - tail; at < characters.size(); ++at) out += characters[at];
  return out;
}

// Empty if the variable is not set.
std::string_view environmentText(const char* name) {
  const char* value = std::getenv(name);
  return value == nullptr ? std::string_view() : value;
}

// Whether the terminal obeys escape sequences. A dumb one would show them as text.
bool obeysSequences() {
  const std::string_view kind = environmentText("TERM");
  return !kind.empty() && kind != "dumb";
}

bool coloursWanted(ColourChoice choice, bool interactive) {
  // The option comes last from the user, so it outranks the environment. Other programs take any
  // value of $NO_COLOR for "no", but not an empty one. So do we.
  if (choice != ColourChoice::automatic) return choice == ColourChoice::always;
  return interactive && environmentText("NO_COLOR").empty() && obeysSequences();
}

// Columns of the terminal; 0 if nobody knows. A shell exports $COLUMNS only if its user wants so.
size_t columnsOf(int fd) {
  const std::string_view text = environmentText("COLUMNS");
  size_t columns = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), columns);
  const bool whole = error == std::errc() && end == text.data() + text.size();
  if (whole && columns >= 1 && columns <= kWidest) return columns;
  winsize size{};
  return ioctl(fd, TIOCGWINSZ, &size) == 0 ? size.ws_col : 0;
}

// The reader of a pipe may leave early, as `head` does. He has what he wanted, so we say nothing.
// _Exit() keeps exit() from writing the rest of the buffer once more.
[[noreturn]] void endBecauseOfOutput(int error) {
  if (error != EPIPE) {
    const std::string line = "tesselctl: standard output: " + errorWords(error) + "\n";
    std::fwrite(line.data(), 1, line.size(), stderr);
  }
  std::_Exit(1);
}

// Colours by their place in the terminal's palette, not by value: whoever set up the terminal chose
// that palette so that it can be read on its background.
std::string_view sequenceOf(Colour colour) {
  switch (colour) {
    case Colour::good:
      return "\x1b[32m";
    case Colour::bad:
      return "\x1b[31m";
    case Colour::caution:
      return "\x1b[33m";
    case Colour::faint:
      return "\x1b[2m";
    case Colour::strong:
      return "\x1b[1m";
    case Colour::plain:
      break;
  }
  return "";
}

// The last column gets no padding: a line that is copied from a terminal should end with its text.
std::string fitted(std::string_view text, size_t width, Table::Align align, bool last) {
  // A character of two columns may leave one column over, so the padding comes from what was taken.
  std::string shown = shortened(text, width);
  const size_t taken = displayWidth(shown);
  const std::string padding(width - std::min(taken, width), ' ');
  if (align == Table::Align::right) return padding + shown;
  return last ? shown : shown + padding;
}

}  // namespace

std::string Terminal::paint(Colour colour, std::string_view text) const {
  if (!colours || colour == Colour::plain || text.empty()) return std::string(text);
  return std::string(sequenceOf(colour)).append(text).append("\x1b[0m");
}

std::string Terminal::number(uint64_t number) const {
  return interactive ? grouped(number) : std::to_string(number);
}

Terminal terminalBehind(int fd, ColourChoice choice) {
  constexpr size_t kUsual = 80;  // of a terminal that does not know its size, such as a serial line
  Terminal terminal;
  terminal.interactive = isatty(fd) == 1;
  terminal.colours = coloursWanted(choice, terminal.interactive);
  if (terminal.interactive) {
    const size_t columns = columnsOf(fd);
    terminal.width = columns == 0 ? kUsual : std::max(columns, kNarrowest);
  }
  return terminal;
}

std::string fieldsLine(const std::vector<std::string>& fields) {
  std::string line;
  for (const std::string& field : fields) line.append(field).append("\t");
  line.back() = '\n';
  return line;
}

// Most texts are ASCII and need no tables; a table measures each of its cells.
size_t displayWidth(std::string_view text) {
  const auto isPlain = [](char byte) { return byte >= 0x20 && byte < 0x7f; };
  if (std::all_of(text.begin(), text.end(), isPlain)) return text.size();
  size_t width = 0;
  forEachCharacter(text, [&](const Character& character) { width += widthOf(character.point); });
  return width;
}

std::string shortened(std::string_view text, size_t width) {
  return abridged(text, width, width == 0 ? 0 : (width - 1) / 2);
}

std::string cutOff(std::string_view text, size_t width) { return abridged(text, width, 0); }

std::vector<size_t> Table::widths(size_t available) const {
  std::vector<size_t> widths;
  for (size_t column = 0; column < columns_.size(); ++column) {
    size_t widest = displayWidth(columns_[column].title);
    for (const auto& row : rows_) widest = std::max(widest, displayWidth(row[column].text));
    widths.push_back(widest);
  }
  // We take one column of the terminal at a time from the widest column of the table. So wide
  // columns end up equal, and narrow ones keep their width. The row stays too wide if none can give
  // more.
  const size_t gaps = kGap * (columns_.size() - 1);
  size_t total = std::accumulate(widths.begin(), widths.end(), gaps);
  while (total > available) {
    size_t widest = columns_.size();
    for (size_t column = 0; column < columns_.size(); ++column) {
      const bool better = widest == columns_.size() || widths[column] > widths[widest];
      if (columns_[column].shrinks && better) widest = column;
    }
    if (widest == columns_.size() || widths[widest] <= kLeastShrunken) break;
    --widths[widest];
    --total;
  }
  return widths;
}

void Table::add(std::vector<Cell> row) {
  // Widths and cells are looked up by column; a short row would be read beyond its end.
  TESSEL_INVARIANT(row.size() == columns_.size());
  rows_.push_back(std::move(row));
}

// Without a terminal nobody sees columns. Padding to the longest cell of a row of names would cost
// a program kilobytes in each line, and spaces do not tell it where a field ends.
std::string Table::render(const Terminal& terminal, size_t indent) const {
  if (terminal.interactive) return renderAligned(terminal, indent);
  std::vector<std::string> fields;
  for (const Column& column : columns_) fields.push_back(column.title);
  std::string out = fieldsLine(fields);
  for (const auto& row : rows_) {
    fields.clear();
    for (const Cell& cell : row) fields.push_back(terminal.paint(cell.colour, cell.text));
    out += fieldsLine(fields);
  }
  return out;
}

std::string Table::renderAligned(const Terminal& terminal, size_t indent) const {
  const std::vector<size_t> wide = widths(terminal.width - std::min(indent, terminal.width));
  const auto line = [&](auto&& cellAt) {
    std::string out(indent, ' ');
    for (size_t column = 0; column < columns_.size(); ++column) {
      const bool last = column + 1 == columns_.size();
      const Cell cell = cellAt(column);
      out += terminal.paint(cell.colour,
                            fitted(cell.text, wide[column], columns_[column].align, last));
      if (!last) out.append(kGap, ' ');
    }
    return out.erase(out.find_last_not_of(' ') + 1) + "\n";
  };
  std::string out =
      line([&](size_t column) { return Cell(columns_[column].title, Colour::faint); });
  for (const auto& row : rows_) out += line([&](size_t column) { return row[column]; });
  return out;
}

namespace {

// `used` columns of the first line are taken already.
std::string wrappedBehind(size_t used, std::string_view text, size_t width, size_t indent) {
  std::string out;
  while (!text.empty()) {
    const size_t end = std::min(text.find(' '), text.size());
    const std::string word = shortened(text.substr(0, end), width - std::min(indent, width));
    const size_t wordWidth = displayWidth(word);
    if (!out.empty() && used + 1 + wordWidth > width) {
      out.append("\n").append(indent, ' ');
      used = indent;
    } else if (!out.empty()) {
      out += ' ';
      ++used;
    }
    out += word;
    used += wordWidth;
    text.remove_prefix(std::min(end + 1, text.size()));
  }
  return out;
}

}  // namespace

std::string wrapped(std::string_view text, size_t width, size_t indent) {
  return wrappedBehind(0, text, width, indent);
}

std::string wrappedBeside(std::string_view text, size_t width, size_t indent, size_t beyond) {
  return wrappedBehind(indent + beyond, text, std::max(width, indent + 12), indent);
}

// A shell may start us with a standard descriptor closed (`>&-`). The next file that we open would
// take its number, and our output would go into that file. So we fill the gap with a file that
// refuses to be written. Writing beyond RLIMIT_FSIZE kills a process unless it ignores SIGXFSZ;
// ignored, it is an error like any other, which we can name.
void prepareOutput() {
  for (const int fd : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
    if (::fcntl(fd, F_GETFD) < 0) ::open("/dev/null", O_RDONLY);
  }
  std::signal(SIGXFSZ, SIG_IGN);
}

void print(std::string_view text) {
  if (std::fwrite(text.data(), 1, text.size(), stdout) != text.size()) endBecauseOfOutput(errno);
}

void flushOutput() {
  if (std::fflush(stdout) != 0) endBecauseOfOutput(errno);
}

void flushWhileWaiting() {
  flushOutput();
  pollfd output{STDOUT_FILENO, 0, 0};
  if (::poll(&output, 1, 0) > 0 && (output.revents & (POLLERR | POLLHUP)) != 0)
    endBecauseOfOutput(EPIPE);
}

// Standard output is flushed first: both may be the same terminal, where order matters.
void printError(std::string_view text) {
  flushOutput();
  std::fwrite(text.data(), 1, text.size(), stderr);
}

ProgressBar::ProgressBar(bool wanted)
    : wanted_(wanted),
      terminal_(terminalBehind(STDERR_FILENO)),
      nextLook_(std::chrono::steady_clock::now() + kPatience) {}

void ProgressBar::update(double part, uint64_t entries) {
  if (!wanted_ || !terminal_.interactive || !obeysSequences()) return;
  const auto now = std::chrono::steady_clock::now();
  if (now < nextLook_) return;
  nextLook_ = now + kRedrawInterval;
  const double done = std::clamp(part, 0.0, 1.0);
  const auto filled = static_cast<size_t>(std::lround(done * static_cast<double>(kBarWidth)));
  std::string line = "\r[" + std::string(filled, '#') + std::string(kBarWidth - filled, '-') + "] ";
  line += std::to_string(std::lround(done * 100)) + " %  " + counted(entries, "entry", "entries");
  printError(cutOff(line, terminal_.width) + "\x1b[K");
  visible_ = true;
}

void ProgressBar::clear() {
  if (visible_) printError("\r\x1b[K");
  visible_ = false;
}

std::string pathText(std::string_view subsystem, std::string_view category, std::string_view name) {
  std::string path = (subsystem.empty() ? "-" : terminalText(subsystem)) + " / " +
                     (category.empty() ? "-" : terminalText(category));
  if (!name.empty()) path += " / " + terminalText(name);
  return path;
}

}  // namespace tessel::ctl
