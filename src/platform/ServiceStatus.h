// ServiceStatus: tells the service manager what the process is doing and that it gets on.

#pragma once

#include <string_view>

namespace tessel {

// Any thread may call.
class ServiceStatus {
 public:
  virtual ~ServiceStatus() = default;
  // What the process is doing now, in a few words for a human: "reading the trace store".
  virtual void say(std::string_view words) = 0;
  // Work moved on by a step. Cheap enough for every trace object: most calls only read a clock. A
  // process that works and does not call it for as long as its watchdog allows is taken for hung.
  virtual void progress() = 0;
};

}  // namespace tessel
