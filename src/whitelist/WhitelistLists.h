// The known values of labelled string arguments, one list per role.
//
// Each list is constant data in its own order; getting one builds and copies nothing. No text
// stands in two lists. Any thread may ask.

#pragma once

#include <span>
#include <string_view>

namespace tessel {

using StringList = std::span<const std::string_view>;
// One of the functions below.
using StringListSource = StringList (*)();

// Desktop user-interface components on which a performance-logged operation acts. Repeats some.
StringList perfLoggingComponentNames();
// Desktop user-interface operations and animation phases. Repeats one.
StringList perfLoggingActionNames();
// Bundle identifiers of the desktop's own applications, agents, utilities and plug-ins.
StringList desktopBundleIdentifiers();
// File-system formats and scan outcomes.
StringList fileSystemScanValues();
StringList commonWhitelistValues();
// Surfaces and origins from which a launch or a transition starts.
StringList launchSourceValues();
// Camera actions, then the mode codes a,b,c,d.
StringList cameraValues();
// Activity types of the share sheet.
StringList shareActivityTypes();
// Bundle identifiers of application extensions: the platform's own, then those of others.
StringList extensionBundleIdentifiers();
StringList periodViewValues();
StringList sizeValues();
// Providers, then protocols.
StringList mailAccountKindValues();
StringList generationSourceValues();

}  // namespace tessel
