// What the commands share: the launch configuration of the service, and how failures are said.

#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "linux/LaunchConfiguration.h"
#include "tesselctl/commands/Commands.h"

namespace tessel::ctl {

// The service's launch configuration as this process's environment says it; nothing, after a line
// that says why, where it makes no sense.
std::optional<LaunchConfiguration> launchConfiguration();

// Whether the reason of a failure is that this user may not.
bool speaksOfPermission(const std::string& reason);
// Says that a trace store cannot be read; where that is for want of permission, what to do.
int failToRead(const std::string& reason, const std::optional<std::string>& store);
// Says that a file cannot be written, with what to do where permission is missing. `reason` names
// the file.
int failToWrite(const std::string& reason);

// Where the machine's own journal stands is not one directory: "the journal of this machine".
std::string storeName(const std::optional<std::string>& store);

}  // namespace tessel::ctl
