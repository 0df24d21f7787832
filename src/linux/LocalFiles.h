// LocalFiles: the marker file's few needs of the file system. Stateless; any thread.

#pragma once

#include "platform/System.h"

namespace tessel {

class LocalFiles final : public FileManager {
 public:
  FileExistence existence(const std::string& path) override;
  bool createFile(const std::string& path) override;
  // A directory goes with all that is in it, but what is mounted below it stays, and so do the
  // directories above that; neither does more than kMaxRemovalDepth directories in one another. The
  // error names the first item that could not be removed.
  RemovalResult remove(const std::string& path) override;

  // A directory in this many others is not looked into: each level holds a descriptor.
  static constexpr int kMaxRemovalDepth = 128;
};

}  // namespace tessel
