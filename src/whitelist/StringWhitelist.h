// The string whitelist: which values of labelled string arguments may leave the machine.
//
// One immutable set per platform and two for a special rule, each built on first use and kept for
// the life of the process. Any thread may ask. Messages go to the service's log.

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

// An immutable set of constant texts, which must outlive it. A string brings its hash along, so
// asking hashes and copies nothing; a text is only looked at where the hashes agree.
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
  FlatIndex index_;  // of texts_
};

// False on a build with internal diagnostics. Asks, and logs the answer, each time.
bool shouldUseStringWhitelist(BuildVariant& variant);

// Whether a trace point is a performance-logging operation. Some platforms have a rule of their own
// for those: both strings must be known, the first as a component and the second as an action.
bool isPerfLoggingOperation(StringRef subsystem, StringRef category, StringRef name);
// Whether both are known, each in its role. An absent string is not known.
bool perfLoggingOperationStringsPass(StringRef component, StringRef action);
const StringSet& perfLoggingComponentSet();
const StringSet& perfLoggingActionSet();

// The platform's set; that of the unknown platform is empty. Logs the set's size when it is built.
const StringSet& stringWhitelistForPlatform(TesselReporterPlatform platform);

// Whether `value` is a member of the platform's set; false where it is absent.
bool stringIsWhitelisted(StringRef value, TesselReporterPlatform platform);

}  // namespace tessel
