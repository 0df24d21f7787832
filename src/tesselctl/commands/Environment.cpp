// Reading the environment and saying what failed.

#include "tesselctl/commands/Environment.h"

#include <cerrno>

#include "os/Files.h"
#include "platform/Text.h"
#include "tesselctl/commands/Commands.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

int fail(ExitStatus status, const std::string& message) {
  printError("tesselctl: " + terminalText(message) + "\n");
  return status;
}

bool speaksOfPermission(const std::string& reason) {
  return reason.find(errorWords(EACCES)) != std::string::npos ||
         reason.find(errorWords(EPERM)) != std::string::npos ||
         reason.find(errorWords(EROFS)) != std::string::npos;
}

std::optional<LaunchConfiguration> launchConfiguration() {
  auto read = readLaunchConfiguration(processEnvironment());
  if (const auto* error = std::get_if<LaunchError>(&read)) {
    fail(kUsage, error->line());
    return {};
  }
  return std::get<LaunchConfiguration>(std::move(read));
}

int failToRead(const std::string& reason, const std::optional<std::string>& store) {
  if (!speaksOfPermission(reason)) return fail(kBad, reason);
  fail(kNoAccess, reason);
  printError(store ? "Run tesselctl as a user who may read the store.\n"
                   : "Join the group:  sudo usermod --append --groups systemd-journal $USER\n"
                     "and log in again, or run tesselctl as root.\n");
  return kNoAccess;
}

int failToWrite(const std::string& reason) {
  if (!speaksOfPermission(reason)) return fail(kBad, reason);
  fail(kNoAccess, reason);
  printError("Run tesselctl as root, or as the user that the directory belongs to.\n");
  return kNoAccess;
}

std::string storeName(const std::optional<std::string>& store) {
  return store ? terminalText(*store) : "the journal of this machine";
}

}  // namespace tessel::ctl
