// The two facts about the boot volume that every payload carries.

#pragma once

#include "platform/System.h"
#include "platform/Values.h"

namespace tessel {

inline constexpr char bootDiskType[] = "SSD";

// Filesystem type of the volume at "/"; absent where it cannot be told or is no UTF-8. Said in the
// log either way.
SharedString bootFilesystemType(Volumes& volumes);

}  // namespace tessel
