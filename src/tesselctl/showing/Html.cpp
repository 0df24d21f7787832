// Names and tables of a page.

#include "tesselctl/showing/Html.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>

namespace tessel::ctl {

namespace {

constexpr size_t kMaxTitleBytes = size_t{16} << 20;

// `visible` with an ellipsis in the place of its middle if it has more than `longest`
// characters. Names that begin alike differ at their ends, so the end keeps more. We count
// characters and not columns: combining marks take no column, and thousands of them fit over one
// letter.
std::string withoutMiddle(std::string_view visible, size_t longest) {
  const size_t head = longest * 3 / 8;
  const size_t tail = longest - head - 1;
  if (visible.size() <= longest) return std::string(visible);
  size_t characters = 0;
  forEachCharacter(visible, [&](const Character&) { ++characters; });
  if (characters <= longest) return std::string(visible);
  std::string out;
  size_t at = 0;
  forEachCharacter(visible, [&](const Character& character) {
    if (at == head) out += "\u2026";
    if (at < head || at >= characters - tail) out += character.bytes;
    ++at;
  });
  return out;
}

// `shown` with a place for a line break behind each dot and underscore. A browser that finds none
// breaks words in their middle.
Html breakable(std::string_view shown) {
  Html html;
  while (!shown.empty()) {
    // Names are long words of parts with dots between. A break behind a dot leaves parts that can
    // be read.
    const size_t end = std::min(shown.find_first_of("._"), shown.size() - 1) + 1;
    html << shown.substr(0, end);
    shown.remove_prefix(end);
    if (!shown.empty()) html << "<wbr>";
  }
  return html;
}

// The shortest digits that name `value`.
template <typename Number>
void appendNumber(std::string& out, Number value) {
  // to_chars() knows no locale: a decimal comma would break each attribute of a drawing.
  std::array<char, 32> digits{};
  const auto end = std::to_chars(digits.data(), digits.data() + digits.size(), value).ptr;
  out.append(digits.data(), end);
}

}  // namespace

Html& Html::operator<<(uint64_t count) {
  text_.append("<data value=\"").append(std::to_string(count)).append("\">");
  text_.append(grouped(count)).append("</data>");
  return *this;
}

Html& Html::at(double value) {
  appendNumber(text_, std::round(value * 10) / 10);
  return *this;
}

Html& Html::quantity(float value, std::string_view words) {
  text_ += "<data value=\"";
  appendNumber(text_, value);
  return *this << "\">" << words << "</data>";
}

Html Names::operator()(std::string_view text, size_t longest) {
  if (text.empty()) return Html() << "<span class=\"soft\">(empty)</span>";
  // Cut before it is made visible, a name of invisible characters would grow to eight times the
  // length.
  const std::string visible = visibleText(text);
  const std::string shown = withoutMiddle(visible, longest);
  Html html;
  if (shown.size() == visible.size()) return html << "<bdi>" << breakable(shown) << "</bdi>";
  Html title;
  title << visible;
  if (titleBytes_ + title.text().size() > kMaxTitleBytes) {
    ++withoutTitle_;
    return html << "<bdi>" << breakable(shown) << "</bdi>";
  }
  titleBytes_ += title.text().size();
  return html << "<bdi title=\"" << title << "\">" << breakable(shown) << "</bdi>";
}

Html Names::operator()(std::string_view subsystem, std::string_view category) {
  Html html;
  return html << (*this)(subsystem) << " <span class=\"soft\">/ " << (*this)(category) << "</span>";
}

Html Names::operator()(std::string_view subsystem, std::string_view category,
                       std::string_view name) {
  Html html;
  return html << (*this)(subsystem) << " <span class=\"soft\">/ " << (*this)(category) << " / "
              << (*this)(name) << "</span>";
}

Html tableHead(std::string_view id, const Html& caption, std::initializer_list<Column> columns,
               TableUse use) {
  Html html;
  html << "<table id=\"" << id << "\"";
  if (use == TableUse::search) html << " class=\"search\"";
  html << "><caption>" << caption << "</caption>\n<thead><tr>";
  for (const Column& column : columns) {
    if (column.kind == Column::Kind::number)
      html << "<th scope=\"col\" class=\"n\">" << column.title << "</th>";
    else if (column.kind == Column::Kind::chart)
      html << "<th scope=\"col\" class=\"chart\">" << column.title << "</th>";
    else
      html << "<th scope=\"col\">" << column.title << "</th>";
  }
  return html << "</tr></thead>\n<tbody>\n";
}

Html tableEnd() { return Html() << "</tbody></table>\n"; }

}  // namespace tessel::ctl
