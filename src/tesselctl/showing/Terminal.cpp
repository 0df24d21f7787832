// Widths, colours, tables.

#include "tesselctl/showing/Terminal.h"

#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <numeric>

#include "tesselctl/showing/ShownText.h"

namespace tessel::ctl {

namespace {

constexpr size_t kNarrowest = 40;
constexpr size_t kGap = 2;            // between columns
constexpr size_t kLeastShrunken = 8;  // columns that a shrinking text keeps

bool coloursWanted() {
  const char* refused = std::getenv("NO_COLOR");
  if (refused != nullptr && *refused != '\0') return false;
  const char* kind = std::getenv("TERM");
  return kind != nullptr && *kind != '\0' && std::string_view(kind) != "dumb";
}

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

std::string fitted(std::string_view text, size_t width, Table::Align align, bool last) {
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

Terminal terminalBehind(int fd) {
  Terminal terminal;
  terminal.interactive = isatty(fd) == 1;
  if (!terminal.interactive) return terminal;
  terminal.colours = coloursWanted();
  winsize size{};
  if (ioctl(fd, TIOCGWINSZ, &size) == 0 && size.ws_col != 0) {
    terminal.width = std::max<size_t>(size.ws_col, kNarrowest);
  }
  return terminal;
}

std::vector<size_t> Table::widths(size_t available) const {
  std::vector<size_t> widths;
  for (size_t column = 0; column < columns_.size(); ++column) {
    size_t widest = displayWidth(columns_[column].title);
    for (const auto& row : rows_) widest = std::max(widest, displayWidth(row[column].text));
    widths.push_back(widest);
  }
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

std::string Table::render(const Terminal& terminal, size_t indent) const {
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

std::string wrapped(std::string_view text, size_t width, size_t indent) {
  std::string out;
  size_t used = 0;
  while (!text.empty()) {
    const size_t end = std::min(text.find(' '), text.size());
    const std::string word = shortened(text.substr(0, end), width - std::min(indent, width));
    const size_t wordWidth = displayWidth(word);
    if (used > 0 && used + 1 + wordWidth > width) {
      out.append("\n").append(indent, ' ');
      used = indent;
    } else if (used > 0) {
      out += ' ';
      ++used;
    }
    out += word;
    used += wordWidth;
    text.remove_prefix(std::min(end + 1, text.size()));
  }
  return out;
}

void print(std::string_view text) {
  if (std::fwrite(text.data(), 1, text.size(), stdout) != text.size()) std::_Exit(1);
}

void printError(std::string_view text) {
  std::fflush(stdout);
  std::fwrite(text.data(), 1, text.size(), stderr);
}

}  // namespace tessel::ctl
