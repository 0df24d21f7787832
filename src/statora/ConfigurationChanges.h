// ConfigurationChanges: decides, look by look at a file, what its observer is to be told.
//
// No file, no clock, no thread: the caller looks, and looks again soon after a look that left
// something unconfirmed.

#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/Analytics.h"

namespace tessel {

// What a look found.
struct ConfigurationFile {
  bool exists = false;
  std::optional<std::string> text;  // nothing where it cannot be a configuration

  bool operator==(const ConfigurationFile&) const = default;
};

class ConfigurationChanges {
 public:
  struct Report {
    std::shared_ptr<const ConfigurationValue> configuration;  // null: absent
  };

  // What is to be told after the file was found as `seen`, if anything. A configuration is told at
  // once, its absence when two looks in a row found the same: a file that is just being written or
  // replaced is not a configuration for a moment.
  std::optional<Report> look(ConfigurationFile seen);
  bool unconfirmed() const { return unconfirmed_.has_value(); }

 private:
  ConfigurationFile told_;  // that there is no file is not told at first
  bool absenceTold_ = false;
  std::optional<ConfigurationFile> unconfirmed_;
};

}  // namespace tessel
