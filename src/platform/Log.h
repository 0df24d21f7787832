// The system log: message texts that the compiler checks, levels, the sink behind them, and two
// handles. The service itself writes to tesselReporterLog(), and the parts beneath it write their
// warnings to platformLog().
//
// The conversions of a text are %@ (a string or a thing with a description()), %s (text), %llu and
// %lu (unsigned 64-bit), %ld (signed 64-bit), %u (unsigned 32-bit), %f and %.2f (floating point). A
// call whose arguments do not fit its text does not compile. A text is formatted only if its level
// is enabled.
//
// Threads: any. The sink is installed once, before the first thread starts, and never removed.

#pragma once

#include <atomic>
#include <concepts>
#include <cstdint>
#include <initializer_list>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>

#include "platform/Values.h"

namespace tessel {

namespace detail {

enum class LogArgumentKind { text, unsigned32, unsigned64, signed64, floating, none };

template <typename T>
concept Described = requires(const T& thing) {
  { thing.description() } -> std::convertible_to<std::string>;
};

template <typename T>
consteval LogArgumentKind kindOf() {
  using Plain = std::remove_cvref_t<T>;
  constexpr bool isText = Described<Plain> || std::is_same_v<Plain, StringRef> ||
                          std::is_same_v<Plain, SharedString> ||
                          std::is_convertible_v<const Plain&, std::string_view>;
  if constexpr (isText) {
    return LogArgumentKind::text;
  } else if constexpr (std::is_floating_point_v<Plain>) {
    return LogArgumentKind::floating;
  } else if constexpr (!std::is_integral_v<Plain> || std::is_same_v<Plain, bool>) {
    return LogArgumentKind::none;
  } else if constexpr (sizeof(Plain) == 8) {
    return std::is_unsigned<Plain>::value ? LogArgumentKind::unsigned64 : LogArgumentKind::signed64;
  } else {
    return std::is_same_v<Plain, uint32_t> ? LogArgumentKind::unsigned32 : LogArgumentKind::none;
  }
}

struct LogConversion {
  LogArgumentKind kind;
  size_t length;  // with the percent sign; 0 if the conversion is unknown
};

constexpr LogConversion conversionAt(std::string_view rest) {
  constexpr struct {
    std::string_view text;
    LogArgumentKind kind;
  } kConversions[] = {
      {"%@", LogArgumentKind::text},         {"%s", LogArgumentKind::text},
      {"%llu", LogArgumentKind::unsigned64}, {"%lu", LogArgumentKind::unsigned64},
      {"%ld", LogArgumentKind::signed64},    {"%u", LogArgumentKind::unsigned32},
      {"%f", LogArgumentKind::floating},     {"%.2f", LogArgumentKind::floating},
  };
  for (const auto& known : kConversions) {
    if (rest.starts_with(known.text)) return {known.kind, known.text.size()};
  }
  return {LogArgumentKind::none, 0};
}

}  // namespace detail

// A message text whose conversions fit `Args` in number and kind. Anything else does not compile,
// because a consteval function may not throw.
template <typename... Args>
class LogFormat {
 public:
  template <size_t N>
  consteval LogFormat(const char (&text)[N]) : text_(text, N - 1) {
    constexpr detail::LogArgumentKind kinds[] = {detail::kindOf<Args>()...,
                                                 detail::LogArgumentKind::none};
    size_t used = 0;
    for (size_t at = text_.find('%'); at != std::string_view::npos; at = text_.find('%', at)) {
      const detail::LogConversion conversion = detail::conversionAt(text_.substr(at));
      if (conversion.length == 0) throw "unknown conversion in a log message";
      if (used >= sizeof...(Args)) throw "a log message has more conversions than arguments";
      if (kinds[used] != conversion.kind) throw "a log argument does not fit its conversion";
      ++used;
      at += conversion.length;
    }
    if (used != sizeof...(Args)) throw "a log message has fewer conversions than arguments";
  }
  constexpr std::string_view text() const { return text_; }

 private:
  std::string_view text_;
};

// One argument, ready to be formatted. An absent string reads "(null)".
class LogArgument {
 public:
  template <typename T>
  LogArgument(const T& value) {
    if constexpr (std::is_floating_point_v<T>) {
      value_ = static_cast<double>(value);
    } else if constexpr (std::is_integral_v<T> && std::is_signed_v<T>) {
      value_ = static_cast<int64_t>(value);
    } else if constexpr (std::is_integral_v<T>) {
      value_ = static_cast<uint64_t>(value);
    } else if constexpr (detail::Described<T>) {
      value_ = std::string(value.description());
    } else if constexpr (std::is_same_v<T, StringRef> || std::is_same_v<T, SharedString>) {
      value_ = value.textOr("(null)");
    } else {
      value_ = std::string_view(value);
    }
  }
  void appendTo(std::string& out, std::string_view conversion) const;

 private:
  std::variant<std::string_view, std::string, uint64_t, int64_t, double> value_;
};

// REQUIRES: `text` was checked by LogFormat against the same arguments.
std::string formatLogArguments(std::string_view text, std::initializer_list<LogArgument> arguments);

template <typename... Args>
std::string formatLog(std::string_view text, Args&&... arguments) {
  return formatLogArguments(text, {std::forward<Args>(arguments)...});
}

enum class LogLevel { error = 0, warning = 1, debug = 2 };

// Where lines go. Any thread may call write() at any time.
class LogSink {
 public:
  virtual ~LogSink() = default;
  virtual void write(LogLevel level, std::string_view subsystem, std::string_view category,
                     std::string_view text) = 0;
};

// Sends the lines of `level` and of more important ones to `sink`. Errors and warnings are sent at
// every level, because an administrator must learn of a loss without asking for more lines first. A
// null sink discards all. The caller keeps the sink until the last thread that logs has ended.
void setLogSink(LogSink* sink, LogLevel level);

// Names the program that logs. Each program has one handle, whose category is its name in the log.
class LogHandle {
 public:
  constexpr LogHandle(std::string_view subsystem, std::string_view category)
      : subsystem_(subsystem), category_(category) {}

  bool isEnabled(LogLevel level) const;

  template <typename... Args>
  void debug(LogFormat<std::type_identity_t<Args>...> format, const Args&... args) const {
    if (isEnabled(LogLevel::debug)) [[unlikely]]
      write(LogLevel::debug, formatLog(format.text(), LogArgument(args)...));
  }
  template <typename... Args>
  void warning(LogFormat<std::type_identity_t<Args>...> format, const Args&... args) const {
    if (isEnabled(LogLevel::warning))
      write(LogLevel::warning, formatLog(format.text(), LogArgument(args)...));
  }
  template <typename... Args>
  void error(LogFormat<std::type_identity_t<Args>...> format, const Args&... args) const {
    if (isEnabled(LogLevel::error))
      write(LogLevel::error, formatLog(format.text(), LogArgument(args)...));
  }

 private:
  void write(LogLevel level, const std::string& text) const;

  std::string_view subsystem_;
  std::string_view category_;
};

// The service's handle: subsystem "com.vantor.TesselSupport", category "tessel_reporter".
const LogHandle& tesselReporterLog();

// The platform's handle: the same subsystem, category "tessel_reporter.platform". It is for
// warnings: what costs a writer, a row or a run is one line per run and reason. It is apart from
// the service's handle, whose lines are fixed texts that other programs may look for.
//
// Each warning has an identifier by which `journalctl -x` explains it. The table is
// kCatalogedMessages in linux/LogSinks.cpp; a test looks for each text there.
const LogHandle& platformLog();

namespace detail {
// One above the highest enabled level; 0 if nothing is enabled.
extern std::atomic<int> enabledLogLevels;
}  // namespace detail

inline bool LogHandle::isEnabled(LogLevel level) const {
  return static_cast<int>(level) < detail::enabledLogLevels.load(std::memory_order_relaxed);
}

}  // namespace tessel
