// The rules and the sets of the string whitelist.
//
// We never destroy a set: a run may still ask it while another thread ends the process.

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

// Lists repeat some texts. A repeated text is found in the index and is not added again, so size()
// counts each text once.
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
  return sameString(subsystem, kPerfLoggingOperation[0]) &&
         sameString(category, kPerfLoggingOperation[1]) &&
         sameString(name, kPerfLoggingOperation[2]);
}

bool perfLoggingOperationStringsPass(StringRef component, StringRef action) {
  // Each role has its own set, so that a component's name does not pass as an action. We check
  // presence first: a trace point that lacks a string fails without building a set.
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
  // We build a set only when it is first asked for: building logs its size, and the log shall name
  // only sets that are in use. Atomic pointers keep the later calls free of the lock.
  static std::array<std::atomic<const StringSet*>, kPlatformProfiles> sets;
  static std::mutex building;

  const PlatformProfile& profile = profileOf(platform);
  std::atomic<const StringSet*>& built = sets[static_cast<size_t>(profile.platform)];
  const StringSet* set = built.load(std::memory_order_acquire);
  if (set == nullptr) [[unlikely]] {
    const std::lock_guard lock(building);
    // Another thread may have built the set while we waited for the lock. A second set would leak,
    // and the log would name its size twice.
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
