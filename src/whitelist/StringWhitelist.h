// The string whitelist: which values of labelled string arguments may leave the machine.
//
// One immutable set per platform and two for a special rule, each built on first use and kept for
// the life of the process. Any thread may ask. Messages go to the service's log.

#pragma once

#include "objects/TesselReporterPlatform.h"
#include "platform/SharedString.h"
#include "platform/System.h"
#include "whitelist/StringSet.h"

namespace tessel {

// False on a build with internal diagnostics. Asks, and logs the answer, each time.
bool shouldUseStringWhitelist(BuildVariant& variant);

// Whether a trace point is a performance-logging operation, for which Quarro has a rule of its own.
bool isPerfLoggingOperation(StringRef subsystem, StringRef category, StringRef name);

// True when `component` is a known component and `action` a known action; false where either is
// absent. They are not interchangeable.
bool perfLoggingOperationStringsPass(StringRef component, StringRef action);

// The two sets of that rule.
const StringSet& perfLoggingComponentSet();
const StringSet& perfLoggingActionSet();

// The platform's set, built on the first request for it. A code outside the table has the empty set
// of the unknown platform.
const StringSet& stringWhitelistForPlatform(TesselReporterPlatform platform);

// Whether `value` is a member of the platform's set; false where it is absent.
bool stringIsWhitelisted(StringRef value, TesselReporterPlatform platform);

}  // namespace tessel
