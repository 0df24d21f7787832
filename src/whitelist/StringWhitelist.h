// The string whitelist: which values of labelled string arguments may leave the machine.
//
// Each platform has one immutable set. The rule for performance logging has two more. A set is
// built when it is first used and lives as long as the process. Any thread may ask. Messages go to
// the service's log.

#pragma once

#include <cstddef>
#include <span>
#include <string_view>
#include <vector>

#include "platform/FlatIndex.h"
#include "platform/System.h"
#include "platform/Values.h"
#include "whitelist/PlatformProfile.h"

namespace tessel {

// An immutable set of constant texts. The set only refers to the texts, so they must outlive it.
// A StringRef carries its hash, so a lookup neither hashes nor copies. It compares texts only if
// their hashes are equal.
class StringSet {
 public:
  // The union of all lists; a text that occurs more than once is one element.
  explicit StringSet(std::span<const StringListSource> lists);

  // Exact, case-sensitive membership; an absent string is a member of no set.
  bool contains(StringRef value) const;
  size_t size() const { return texts_.size(); }

 private:
  void add(std::string_view text);

  std::vector<std::string_view> texts_;
  FlatIndex index_;  // finds the position in texts_
};

// False on a build with internal diagnostics. Each call asks `variant` anew and logs the answer.
bool shouldUseStringWhitelist(BuildVariant& variant);

// Whether a trace point is a performance-logging operation. A platform whose profile has
// hasPerfLoggingRule treats these differently: the first string must be a known component and the
// second a known action.
inline constexpr std::string_view kPerfLoggingOperation[] = {"com.vantor.PerformanceAnalysis",
                                                             "PerfLogging", "PerfLoggingOperation"};
bool isPerfLoggingOperation(StringRef subsystem, StringRef category, StringRef name);
// Whether `component` is a known component and `action` a known action. An absent string is
// neither.
bool perfLoggingOperationStringsPass(StringRef component, StringRef action);
const StringSet& perfLoggingComponentSet();
const StringSet& perfLoggingActionSet();

// The platform's set. The unknown platform and Lumet have an empty set. Logs the size of the set
// when it is built, and on every call if the profile has logsEveryWhitelistLookup.
const StringSet& stringWhitelistForPlatform(TesselReporterPlatform platform);

// Whether the platform's set contains `value`. False if `value` is absent.
bool stringIsWhitelisted(StringRef value, TesselReporterPlatform platform);

}  // namespace tessel
