// The walk from an executable image up to its bundle.
//
// The walk only reads the text of the path. The disk is read once, for the directory that the walk
// found. We resolve no links, so a walk costs no system call, however long the path is.

#include "objects/ProcessIdentity.h"

#include "platform/Log.h"

namespace tessel {

namespace {

// Whoever starts a program chooses how deep its directory lies. The limit bounds what the walk for
// one path costs. A bundle that lies further above its image is not found.
constexpr int kExaminedDirectoriesLimit = 100;

// What an entry of the cache takes beside its text: two records, a node, its share of the buckets.
constexpr size_t kEntryBytes = 128;

std::string_view withoutTrailingSeparators(std::string_view path) {
  const size_t last = path.find_last_not_of('/');
  return last == std::string_view::npos ? std::string_view() : path.substr(0, last + 1);
}

std::string_view lastComponent(std::string_view path) {
  const std::string_view trimmed = withoutTrailingSeparators(path);
  // Without a separator, rfind() answers npos, and npos + 1 is 0.
  return trimmed.substr(trimmed.rfind('/') + 1);
}

// The parent of "/a" is "/". The parent of "a" is empty: its directory depends on where the program
// was started, and the path does not tell that.
std::string_view parent(std::string_view path) {
  const std::string_view trimmed = withoutTrailingSeparators(path);
  const size_t separator = trimmed.rfind('/');
  if (separator == std::string_view::npos) return {};
  const std::string_view above = withoutTrailingSeparators(trimmed.substr(0, separator));
  return above.empty() ? path.substr(0, 1) : above;
}

// The nearest directory above the image that has the image's name and an extension, such as
// "Foo.app" for "Foo". Empty if there is none. The prefix ends with a dot, because neither "Foo"
// nor "Foobar.app" is the bundle of "Foo".
std::string_view bundleDirectoryAbove(std::string_view imagePath) {
  const std::string prefix = std::string(lastComponent(imagePath)) + ".";
  std::string_view directory = parent(imagePath);
  for (int examined = 0; examined < kExaminedDirectoriesLimit; ++examined) {
    // Nothing lies above either of these.
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
  SharedString identifier = search(imagePath.text());
  // Nothing makes room for a new path. If an old one went, a program with many paths could push out
  // those of all others, and they would pay with a lookup for each object.
  const size_t bytes = kEntryBytes + imagePath.text().size() + identifier.textOr("").size();
  if (cacheBytes_ + bytes > kMaxCacheBytes) return identifier;
  cacheBytes_ += bytes;
  // We remember a path without a bundle as well. Otherwise each object of its process would cost
  // another walk.
  bundleIdentifierCache_.emplace(imagePath, identifier);
  return identifier;
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
