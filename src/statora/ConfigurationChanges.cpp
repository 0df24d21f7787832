// What an observer is told.

#include "statora/ConfigurationChanges.h"

#include <utility>

#include "statora/ConfigurationJson.h"

namespace tessel {

std::optional<ConfigurationChanges::Report> ConfigurationChanges::look(ConfigurationFile seen) {
  if (seen == told_) {
    unconfirmed_.reset();
    return {};
  }
  auto configuration = seen.text ? parseConfiguration(*seen.text) : nullptr;
  if (!configuration && unconfirmed_ != seen) {
    unconfirmed_ = std::move(seen);
    return {};
  }
  unconfirmed_.reset();
  told_ = std::move(seen);
  // Absent for another reason than before is no change.
  if (std::exchange(absenceTold_, !configuration) && !configuration) return {};
  return Report{std::move(configuration)};
}

}  // namespace tessel
