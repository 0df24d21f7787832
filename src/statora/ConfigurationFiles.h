// Configurations in files, `<directory>/<configuration type>.json`: reading and changing their
// JSON, deciding what an observer is told, and watching the files.

#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "platform/Analytics.h"
#include "platform/Error.h"
#include "platform/Threads.h"

namespace tessel {

// Lists and dictionaries are kept down to this depth. Code that walks through a value recurses, so
// without a bound a hostile file could exhaust its stack.
inline constexpr size_t kMaxConfigurationDepth = 32;

// The configuration that `text` holds. Null unless it is exactly one JSON value in UTF-8. Numbers
// keep their kind: true and false are boolean numbers, an integer is signed if it fits and unsigned
// otherwise, any other number is a double. Of two members with the same key the last counts.
//
// A list or dictionary below the bound, and a number that no double can hold, become null. One odd
// member must not make its neighbours unreadable, because each has another owner.
std::shared_ptr<const ConfigurationValue> parseConfiguration(std::string_view text);

// The text with `value`, which is JSON, as the member `key`. All else stays byte for byte.
// REQUIRES: the text holds a dictionary by parseConfiguration().
std::string withMember(std::string_view text, std::string_view key, std::string_view value);

// What a look at a file found.
struct ConfigurationFile {
  bool exists = false;
  std::optional<std::string> text;  // absent if the file cannot be a configuration

  bool operator==(const ConfigurationFile&) const = default;
};

// Looks at the file. An error means that this process lacks something (descriptors, memory). It
// says nothing about the file, so it must not be taken for an absence.
std::variant<ConfigurationFile, PlatformError> lookAtConfiguration(const std::string& path);

// Decides, look by look at a file, what its observer is told. It knows no file, clock or thread:
// the caller looks, and looks again at `confirmsAt()`.
class ConfigurationChanges {
 public:
  using Time = std::chrono::steady_clock::time_point;
  struct Report {
    std::shared_ptr<const ConfigurationValue> configuration;  // null: absent
  };

  // How long a file must stay as it is before it counts as holding no configuration.
  static constexpr std::chrono::milliseconds kPatience{250};

  // Takes the result of a look and answers what the observer is told now, if anything. A
  // configuration is told at once. A file that somebody is writing or replacing holds no
  // configuration for a moment. So an absence is told only if the file has not changed for
  // kPatience, or if its writer is `done`: he closed the file, or moved it here under its name.
  std::optional<Report> look(ConfigurationFile seen, Time now, bool done);
  // When an equal look would confirm an absence. Absent if none is in doubt.
  std::optional<Time> confirmsAt() const;

 private:
  struct Doubt {
    ConfigurationFile seen;
    Time since;
  };
  // Begins as "no file", so the absence of a file that never existed is not told.
  ConfigurationFile told_;
  bool absenceTold_ = false;
  std::optional<Doubt> doubt_;
};

// Makes observers of files in one directory.
//
// An observer calls its delegate, on its queue, with the content of the file when observing starts
// and again after each change. It makes no call until the file exists for the first time. A
// configuration is absent if its file went away, is no regular file, cannot be read, is over 1 MiB,
// or has content that parseConfiguration() does not accept. ConfigurationChanges says when the
// delegate is told.
//
// Threads: one at a time calls makeObserver(), setDelegate() and startObserving(). An observer that
// observes has a thread and two file descriptors. Dropping its last reference ends them without
// waiting. A call that is already on the queue still takes place and keeps the observer alive.
class FileConfigurationService final : public ConfigurationService {
 public:
  static constexpr size_t kMaxFileBytes = size_t{1} << 20;

  // `directory` need not exist. REQUIRES: `threads` outlives the observers.
  FileConfigurationService(std::string directory, Threads& threads)
      : directory_(std::move(directory)), threads_(threads) {}

  std::shared_ptr<ConfigurationObserver> makeObserver() override;

 private:
  const std::string directory_;
  Threads& threads_;
};

}  // namespace tessel
