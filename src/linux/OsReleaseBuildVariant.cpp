// Reading VARIANT_ID.

#include "linux/OsReleaseBuildVariant.h"

#include <algorithm>

#include "os/Files.h"

namespace tessel {

namespace {

constexpr size_t kMaxOsReleaseSize = size_t{64} << 10;

std::string_view withoutQuotes(std::string_view value) {
  const bool quoted =
      value.size() >= 2 && (value[0] == '"' || value[0] == '\'') && value.back() == value[0];
  return quoted ? value.substr(1, value.size() - 2) : value;
}

// The value of the last assignment to VARIANT_ID, as a shell would have it; empty without one.
std::string_view variantId(std::string_view text) {
  constexpr std::string_view kAssignment = "VARIANT_ID=";
  std::string_view value;
  while (!text.empty()) {
    std::string_view line = text.substr(0, text.find('\n'));
    text.remove_prefix(std::min(line.size() + 1, text.size()));
    const size_t end = line.find_last_not_of(" \t\r");
    line = line.substr(0, end == std::string_view::npos ? 0 : end + 1);
    if (line.starts_with(kAssignment)) value = withoutQuotes(line.substr(kAssignment.size()));
  }
  return value;
}

}  // namespace

OsReleaseBuildVariant::OsReleaseBuildVariant(const std::string& path)
    : internal_(variantId(readSmallFile(path, kMaxOsReleaseSize).value_or("")) == "internal") {}

bool OsReleaseBuildVariant::hasInternalDiagnostics(std::string_view /*subsystem*/) {
  return internal_;
}

}  // namespace tessel
