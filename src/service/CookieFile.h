// CookieFile: the run marker, an empty file that exists exactly while a run is reporting.
//
// Only its existence counts: found at the start of a run it says that an earlier run died half-way.

#pragma once

#include <string>

#include "platform/System.h"

namespace tessel {

inline constexpr char cookieFilePath[] = "/var/tmp/tessel_reporter_running";

class CookieFile {
 public:
  explicit CookieFile(FileManager& files) : files_(files) {}

  // True where anything stands at the path, a directory included.
  bool cookieFileExists();
  // Removes whatever stands at the path; an error is logged.
  void clearCookieFile();
  // True only where this call made the file.
  bool createCookieFile();

 private:
  FileManager& files_;
};

}  // namespace tessel
