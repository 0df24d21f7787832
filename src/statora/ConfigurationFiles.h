// Configurations in files, `<directory>/<configuration type>.json`: reading their JSON, deciding
// what an observer is told, and watching the files.

#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Analytics.h"

namespace tessel {

// Lists and dictionaries may be nested this deeply. Code that walks through a value recurses, so
// without a bound a hostile file could exhaust its stack.
inline constexpr size_t kMaxConfigurationDepth = 32;

// The configuration that `text` holds. Null unless it is exactly one JSON value in UTF-8, nested no
// deeper than the bound. Numbers keep their kind: true and false are boolean numbers, an integer is
// signed if it fits and unsigned otherwise, any other number is a double. Of two members with the
// same key the last counts.
std::shared_ptr<const ConfigurationValue> parseConfiguration(std::string_view text);

// What a look at a file found.
struct ConfigurationFile {
  bool exists = false;
  std::optional<std::string> text;  // absent if the file cannot be a configuration

  bool operator==(const ConfigurationFile&) const = default;
};

// Decides, look by look at a file, what its observer is told. It knows no file, clock or thread:
// the caller looks, and looks again soon if `unconfirmed()`.
class ConfigurationChanges {
 public:
  struct Report {
    std::shared_ptr<const ConfigurationValue> configuration;  // null: absent
  };

  // Takes the result of a look and answers what the observer is told now, if anything. A
  // configuration is told at once. A file that somebody is writing or replacing holds no
  // configuration for a moment, so an absence is told only after two equal looks in a row.
  std::optional<Report> look(ConfigurationFile seen);
  bool unconfirmed() const { return unconfirmed_.has_value(); }

 private:
  // Begins as "no file", so the absence of a file that never existed is not told.
  ConfigurationFile told_;
  bool absenceTold_ = false;
  std::optional<ConfigurationFile> unconfirmed_;
};

// Makes observers of files in one directory.
//
// An observer calls its delegate, on its queue, with the content of the file when observing starts
// and again after each change. It makes no call until the file exists for the first time. A
// configuration is absent if its file went away, is no regular file, cannot be read, is over 1 MiB,
// or has content that parseConfiguration() does not accept. The absence must last for a quarter of
// a second before the delegate is told.
//
// Threads: one at a time calls makeObserver(), setDelegate() and startObserving(). An observer that
// observes has a thread and two file descriptors. Dropping its last reference ends them without
// waiting. A call that is already on the queue still takes place and keeps the observer alive.
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
