// Rules and sets of the string whitelist.
//
// No set is ever destroyed, because a run may still ask while another thread ends the process.

#include "whitelist/StringWhitelist.h"

#include <array>
#include <atomic>
#include <mutex>

#include "platform/Log.h"

namespace tessel {

StringSet::StringSet(std::span<const StringListSource> lists) {
  for (const StringListSource list : lists) {
    for (const std::string_view text : list()) add(text);
  }
}

void StringSet::add(std::string_view text) {
  index_.findOrAdd(
      static_cast<uint32_t>(hashText(text)),
      [&](uint32_t number) { return texts_[number] == text; },
      [&] {
        texts_.push_back(text);
        return static_cast<uint32_t>(texts_.size() - 1);
      });
}

bool StringSet::contains(StringRef value) const {
  if (!value.present()) return false;
  const auto isValue = [&](uint32_t number) { return texts_[number] == value.text(); };
  return index_.find(static_cast<uint32_t>(value.hash()), isValue) != FlatIndex::kNone;
}

bool shouldUseStringWhitelist(BuildVariant& variant) {
  if (variant.hasInternalDiagnostics("com.vantor.tessel")) {
    tesselReporterLog().debug("Not using string whitelist due to os_flavor");
    return false;
  }
  tesselReporterLog().debug("Defaulting to using string whitelist");
  return true;
}

bool isPerfLoggingOperation(StringRef subsystem, StringRef category, StringRef name) {
  return sameString(subsystem, "com.vantor.PerformanceAnalysis") &&
         sameString(category, "PerfLogging") && sameString(name, "PerfLoggingOperation");
}

bool perfLoggingOperationStringsPass(StringRef component, StringRef action) {
  // Each in its own set, because a component's name is no action and says something else there.
  // Presence first: it is cheap, and most such trace points would else build both sets for nothing.
  return component.present() && action.present() && perfLoggingComponentSet().contains(component) &&
         perfLoggingActionSet().contains(action);
}

const StringSet& perfLoggingComponentSet() {
  static constexpr StringListSource kLists[] = {perfLoggingComponentNames};
  static const StringSet& set = *new StringSet(kLists);
  return set;
}

const StringSet& perfLoggingActionSet() {
  static constexpr StringListSource kLists[] = {perfLoggingActionNames};
  static const StringSet& set = *new StringSet(kLists);
  return set;
}

const StringSet& stringWhitelistForPlatform(TesselReporterPlatform platform) {
  // Each set on its own and only when it is asked for, because its size is logged at that moment.
  static std::array<std::atomic<const StringSet*>, kPlatformProfiles> sets;
  static std::mutex building;

  const PlatformProfile& profile = profileOf(platform);
  std::atomic<const StringSet*>& built = sets[static_cast<size_t>(profile.platform)];
  const StringSet* set = built.load(std::memory_order_acquire);
  if (set == nullptr) [[unlikely]] {
    const std::lock_guard lock(building);
    // Another thread may have built it while we waited; the log must name a set only once.
    set = built.load(std::memory_order_relaxed);
    if (set == nullptr) {
      set = new StringSet(profile.whitelist);
      tesselReporterLog().debug("Using string whitelist with %lu elements for %@ platform",
                                set->size(), profile.name);
      built.store(set, std::memory_order_release);
    }
  }
  if (profile.logsEveryWhitelistLookup)
    tesselReporterLog().debug("Using string whitelist with %lu elements", set->size());
  return *set;
}

bool stringIsWhitelisted(StringRef value, TesselReporterPlatform platform) {
  return stringWhitelistForPlatform(platform).contains(value);
}

}  // namespace tessel
