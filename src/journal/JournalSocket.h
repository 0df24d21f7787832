// Sending an entry to the journal daemon of this machine.

#pragma once

#include <optional>
#include <vector>

#include "journal/ExportFile.h"

namespace tessel {

// Hands one entry to the daemon. An error says why it could not be handed over, a daemon that is
// not there included, which the system's own library does not tell.
std::optional<PlatformError> sendToJournal(const std::vector<RecordedField>& fields);

}  // namespace tessel
