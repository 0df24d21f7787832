// The installed sink, the service's handle, and the formatting of checked texts.
//
// The sink is global on purpose. Almost every part logs, so a reference to the sink in each
// constructor would say nothing about that part.

#include "platform/Log.h"

#include <algorithm>
#include <cstdio>

namespace tessel {

void LogArgument::appendTo(std::string& out, std::string_view conversion) const {
  if (const auto* number = std::get_if<double>(&value_)) {
    // "%f" prints the largest double with 309 digits before the point and 6 behind it.
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

// No bounds are checked here: LogFormat has counted the conversions when the call was compiled.
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

namespace {
std::atomic<LogSink*> installedSink{nullptr};
}

namespace detail {
std::atomic<int> enabledLogLevels{0};
}

void setLogSink(LogSink* sink, LogLevel level) {
  // The sink comes first, so that an enabled level has its sink. isEnabled() must be cheap and
  // reads the level without ordering, so write() still checks that there is a sink.
  installedSink.store(sink, std::memory_order_release);
  const LogLevel enabled = std::max(level, LogLevel::warning);
  detail::enabledLogLevels.store(sink ? static_cast<int>(enabled) + 1 : 0,
                                 std::memory_order_release);
}

void LogHandle::write(LogLevel level, const std::string& text) const {
  if (LogSink* sink = installedSink.load(std::memory_order_acquire)) {
    sink->write(level, subsystem_, category_, text);
  }
}

const LogHandle& tesselReporterLog() {
  static constexpr LogHandle handle("com.vantor.TesselSupport", "tessel_reporter");
  return handle;
}

const LogHandle& platformLog() {
  static constexpr LogHandle handle("com.vantor.TesselSupport", "tessel_reporter.platform");
  return handle;
}

}  // namespace tessel
