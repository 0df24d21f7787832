// OsReleaseBuildVariant: the build variant by the operating system's own description of itself.
//
// The file is read once, by the constructor; questions are answered from memory. Immutable; any
// thread may ask.

#pragma once

#include <string>

#include "platform/System.h"

namespace tessel {

class OsReleaseBuildVariant final : public BuildVariant {
 public:
  // `path` names a file in the os-release format. Internal where its VARIANT_ID is "internal"; not
  // where the file cannot be read or does not say.
  explicit OsReleaseBuildVariant(const std::string& path);

  // The same for every subsystem.
  bool hasInternalDiagnostics(std::string_view subsystem) override;

 private:
  const bool internal_;
};

}  // namespace tessel
