// The installed sink and the process-wide handle.

#include "platform/Log.h"

namespace tessel {

namespace {
std::atomic<LogSink*> installedSink{nullptr};
}

namespace detail {
std::atomic<int> enabledLogLevels{0};
}

void setLogSink(LogSink* sink, LogLevel level) {
  installedSink.store(sink, std::memory_order_release);
  detail::enabledLogLevels.store(sink ? static_cast<int>(level) + 1 : 0, std::memory_order_release);
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

}  // namespace tessel
