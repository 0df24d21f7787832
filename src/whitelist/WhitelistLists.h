// The known values of labelled string arguments, one list per role.
//
// A list is constant data: a call builds and copies nothing. No text stands in two lists. Two lists
// contain a text more than once, so a count of the lines is not the size of the set. Any thread may
// ask.

#pragma once

#include <span>
#include <string_view>

namespace tessel {

using StringList = std::span<const std::string_view>;
// One of the functions below.
using StringListSource = StringList (*)();

// The desktop's user-interface components on which a performance-logging operation acts. Five texts
// stand there twice or more.
StringList perfLoggingComponentNames();
// The desktop's user-interface operations and animation phases. "Open" stands there more than once.
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

// A list as people see it.
struct StringListRow {
  std::string_view name;   // as a command line shows it; stays, since scripts read it
  std::string_view words;  // what its values are
  StringListSource list;
};
// All lists. Each list above has one row.
std::span<const StringListRow> stringLists();

}  // namespace tessel
