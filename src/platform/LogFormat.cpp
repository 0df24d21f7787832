// Formatting of a checked message.

#include "platform/LogFormat.h"

#include <cstdio>

namespace tessel {

void LogArgument::appendTo(std::string& out, std::string_view conversion) const {
  if (const auto* number = std::get_if<double>(&value_)) {
    char buffer[400];
    const int length = conversion == "%.2f" ? std::snprintf(buffer, sizeof buffer, "%.2f", *number)
                                            : std::snprintf(buffer, sizeof buffer, "%f", *number);
    if (length > 0) out.append(buffer, static_cast<size_t>(length));
  } else if (const auto* count = std::get_if<uint64_t>(&value_)) {
    out += std::to_string(*count);
  } else if (const auto* value = std::get_if<int64_t>(&value_)) {
    out += std::to_string(*value);
  } else if (const auto* text = std::get_if<std::string>(&value_)) {
    out += *text;
  } else {
    out += std::get<std::string_view>(value_);
  }
}

std::string formatLogArguments(std::string_view text,
                               std::initializer_list<LogArgument> arguments) {
  std::string out;
  auto argument = arguments.begin();
  size_t from = 0;
  for (size_t at = text.find('%'); at != std::string_view::npos; at = text.find('%', from)) {
    out.append(text, from, at - from);
    const size_t length = detail::conversionAt(text.substr(at)).length;
    (argument++)->appendTo(out, text.substr(at, length));
    from = at + length;
  }
  out.append(text, from);
  return out;
}

}  // namespace tessel
