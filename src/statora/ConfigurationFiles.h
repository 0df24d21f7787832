// Configurations in files: their JSON, what an observer is told, and the observers.

#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Analytics.h"

namespace tessel {

// Reading a configuration from its JSON text.

// Deepest nesting of lists and dictionaries that is read.
inline constexpr size_t kMaxConfigurationDepth = 32;

// The configuration that `text` holds; null where it is not one JSON value in UTF-8 with nothing
// after it, or is nested too deeply. Numbers keep their kind: true and false are boolean numbers,
// an integer is signed where that holds it and else unsigned, any other is a double. Of two members
// with the same key the last counts.
std::shared_ptr<const ConfigurationValue> parseConfiguration(std::string_view text);

// ConfigurationChanges: decides, look by look at a file, what its observer is to be told.
//
// No file, no clock, no thread: the caller looks, and looks again soon after a look that left
// something unconfirmed.

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

// FileConfigurationService: configurations in files, `<directory>/<configuration type>.json`.
//
// An observer calls its delegate, on its queue, once with what the file holds when observing
// starts, and again whenever that becomes something else. No file, no call. A file that goes away,
// or is no configuration (not JSON, over 1 MiB, nested too deeply, not a regular file, not
// readable) is an absent configuration; it is called absent only when it is still so a quarter of
// a second later, so that a file that is just being written or replaced is never taken for one.
//
// The directory is watched with inotify. What that does not tell of (the directory made later, or
// it or a link on the way to the file replaced, a file system without notifications) is found by a
// look each quarter of a second.
//
// Threads: makeObserver(), setDelegate() and startObserving() from any one thread at a time. While
// it observes, an observer has a thread and two file descriptors of its own; they go, without
// anybody waiting for it, when the last reference to the observer is dropped. A call that is on the
// queue by then still takes place and keeps the observer until it has.

class FileConfigurationService final : public ConfigurationService {
 public:
  static constexpr size_t kMaxFileBytes = size_t{1} << 20;

  // `directory` need not exist.
  explicit FileConfigurationService(std::string directory) : directory_(std::move(directory)) {}

  std::shared_ptr<ConfigurationObserver> makeObserver() override;

 private:
  const std::string directory_;
};

}  // namespace tessel
