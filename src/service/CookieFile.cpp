// The marker's three operations and their messages.

#include "service/CookieFile.h"

#include "platform/Log.h"

namespace tessel {

bool CookieFile::cookieFileExists() {
  const FileExistence found = files_.existence(cookieFilePath);
  if (found.exists && found.isDirectory)
    tesselReporterLog().debug("Cookie file exists but is directory");
  return found.exists;
}

void CookieFile::clearCookieFile() {
  if (!cookieFileExists()) return;
  const RemovalResult result = files_.remove(cookieFilePath);
  if (result.removed) {
    tesselReporterLog().debug("Cleared cookie file");
  } else {
    tesselReporterLog().error("Could not clear cookie file: %@",
                              result.error.value_or("Unknown error"));
  }
}

bool CookieFile::createCookieFile() {
  if (cookieFileExists()) return false;
  if (!files_.createFile(cookieFilePath)) {
    tesselReporterLog().debug("Could not create cookie file");
    return false;
  }
  tesselReporterLog().debug("Created cookie file");
  return true;
}

}  // namespace tessel
