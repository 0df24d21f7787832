// Asking for the root volume's filesystem type.

#include "service/BootVolume.h"

#include "platform/Log.h"
#include "platform/Text.h"

namespace tessel {

SharedString bootFilesystemType(Volumes& volumes) {
  const std::optional<std::string> name = volumes.rootFilesystemTypeName();
  if (!name || !isValidUtf8(*name)) {
    tesselReporterLog().debug("Could not determine filesystem type");
    return {};
  }
  tesselReporterLog().debug("Filesystem for '/': %@", *name);
  return SharedString(*name);
}

}  // namespace tessel
