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

#pragma once

#include <memory>
#include <string>

#include "platform/Analytics.h"

namespace tessel {

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
