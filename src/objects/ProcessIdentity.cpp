// The walk from an executable image up to its bundle.
//
// The walk is on the text of the path alone; the disk is asked once, about the one directory found.
// Links are not resolved: a bundle is named after the path under which its image was started.

#include "objects/ProcessIdentity.h"

#include "platform/Log.h"

namespace tessel {

namespace {

// A writer chooses the path, and a path of 4096 bytes can have 2048 directories. Real bundles lie a
// few levels above their image.
constexpr int kExaminedDirectoriesLimit = 100;

std::string_view withoutTrailingSeparators(std::string_view path) {
  const size_t last = path.find_last_not_of('/');
  return last == std::string_view::npos ? std::string_view() : path.substr(0, last + 1);
}

std::string_view lastComponent(std::string_view path) {
  const std::string_view trimmed = withoutTrailingSeparators(path);
  // Without a separator, rfind() answers npos, and npos + 1 is 0.
  return trimmed.substr(trimmed.rfind('/') + 1);
}

// "/" for a path directly below the root. Empty for a single relative component, which has no
// parent that we could know.
std::string_view parent(std::string_view path) {
  const std::string_view trimmed = withoutTrailingSeparators(path);
  const size_t separator = trimmed.rfind('/');
  if (separator == std::string_view::npos) return {};
  const std::string_view above = withoutTrailingSeparators(trimmed.substr(0, separator));
  return above.empty() ? path.substr(0, 1) : above;
}

// The nearest directory above the image that is named after it, "Foo.app" for "Foo"; empty if there
// is none. A directory called "Foo" alone is no bundle, hence the dot.
std::string_view bundleDirectoryAbove(std::string_view imagePath) {
  const std::string prefix = std::string(lastComponent(imagePath)) + ".";
  std::string_view directory = parent(imagePath);
  for (int examined = 0; examined < kExaminedDirectoriesLimit; ++examined) {
    // The parent of "/" is "/", so going on would only use up the limit.
    if (directory.empty() || directory == "/") return {};
    if (lastComponent(directory).starts_with(prefix)) return directory;
    directory = parent(directory);
  }
  return {};
}

}  // namespace

SharedString ProcessIdentity::bundleIdentifierForImagePath(StringRef imagePath) {
  if (!imagePath.present()) return {};
  const auto known = bundleIdentifierCache_.find(imagePath);
  if (known != bundleIdentifierCache_.end()) return known->second;
  // A path without a bundle is kept as well. Most processes have none, and each of their objects
  // would otherwise cost a walk and a look at the disk.
  return bundleIdentifierCache_.emplace(imagePath, search(imagePath.text())).first->second;
}

SharedString ProcessIdentity::search(std::string_view imagePath) {
  const std::string_view directory = bundleDirectoryAbove(imagePath);
  if (directory.empty()) return {};
  const auto identifier = bundles_.bundleIdentifier(std::string(directory));
  if (!identifier) return {};
  tesselReporterLog().debug("Found bundle ID: \"%@\" for path:\"%@\"", *identifier, imagePath);
  return SharedString(*identifier);
}

}  // namespace tessel
