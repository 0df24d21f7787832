// The system log: levels, the sink behind it, and the one ambient handle, tesselReporterLog().
//
// Message texts are given as they stand, with %@ for a string or a thing with a description(), and
// %llu %lu (unsigned 64-bit), %ld (signed 64-bit), %u (unsigned 32-bit), %f %.2f (floating point),
// %s (text). They are checked against the arguments when the call is compiled and formatted only
// where the level is enabled.
//
// Threads: any. The sink is installed once, before the first thread starts, and never removed.

#pragma once

#include <atomic>
#include <string>
#include <string_view>

#include "platform/LogFormat.h"

namespace tessel {

enum class LogLevel { error = 0, debug = 1 };

// Where lines go. write() may be called from any thread at any time.
class LogSink {
 public:
  virtual ~LogSink() = default;
  virtual void write(LogLevel level, std::string_view subsystem, std::string_view category,
                     std::string_view text) = 0;
};

// Sends lines up to and including `level` to `sink`; a null sink discards. The sink is not owned
// and must outlive every thread that logs.
void setLogSink(LogSink* sink, LogLevel level);

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
  void error(LogFormat<std::type_identity_t<Args>...> format, const Args&... args) const {
    if (isEnabled(LogLevel::error))
      write(LogLevel::error, formatLog(format.text(), LogArgument(args)...));
  }

 private:
  void write(LogLevel level, const std::string& text) const;

  std::string_view subsystem_;
  std::string_view category_;
};

// Subsystem "com.vantor.TesselSupport", category "tessel_reporter".
const LogHandle& tesselReporterLog();

namespace detail {
// One above the highest enabled level; 0 where nothing is enabled.
extern std::atomic<int> enabledLogLevels;
}  // namespace detail

inline bool LogHandle::isEnabled(LogLevel level) const {
  return static_cast<int>(level) < detail::enabledLogLevels.load(std::memory_order_relaxed);
}

}  // namespace tessel
