// The lock of forwarders: at most one works on the spool of a state directory.

#pragma once

#include <string>
#include <variant>

#include "os/UniqueFd.h"
#include "statora/Sqlite.h"

namespace tessel {

// The code with which takeForwarderLock() says that another process has the lock. SQLite has no
// negative codes.
inline constexpr int kHeldByAnotherForwarder = -1;

// Takes the lock. It stays until the descriptor is closed or the process ends, however it ends. A
// process that has the lock already gets it again. The reason of a failure names the other process.
std::variant<UniqueFd, SqliteStatus> takeForwarderLock(const std::string& stateDirectory);

}  // namespace tessel
