// MountTable: facts of the mount table. Read anew for every question; any thread.

#pragma once

#include <string>

#include "platform/System.h"

namespace tessel {

class MountTable final : public Volumes {
 public:
  // `path` names a file in the kernel's mountinfo format.
  explicit MountTable(std::string path = "/proc/self/mountinfo") : path_(std::move(path)) {}

  // Of several mounts at "/" the topmost counts: the last in the table.
  std::optional<std::string> rootFilesystemTypeName() override;

 private:
  const std::string path_;
};

}  // namespace tessel
