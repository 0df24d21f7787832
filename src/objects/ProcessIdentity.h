// ProcessIdentity: finds the bundle identifier of an executable image.
//
// The bundle of an image is the nearest directory above it, within 100 levels, whose name begins
// with the image's file name and a dot. "Foo.app" is the bundle directory of ".../Foo.app/Foo".
//
// The object remembers answers, also that a path has no bundle. A remembered path costs one walk
// and at most one bundle lookup. The price: if a bundle is installed or removed later, the answer
// for such a path stays the old one. When kMaxCacheBytes are full, further paths get the right
// answer too, but each time by a walk and a lookup.
//
// Threads: one at a time.

#pragma once

#include <string>
#include <unordered_map>

#include "platform/System.h"
#include "platform/Values.h"

namespace tessel {

class ProcessIdentity {
 public:
  // Room for some 20,000 programs. Whoever runs programs chooses their paths, so there is a bound.
  static constexpr size_t kMaxCacheBytes = size_t{4} << 20;

  explicit ProcessIdentity(BundleReader& bundles) : bundles_(bundles) {}

  // Absent if the image has no bundle or the path is absent. The first call for a path may read
  // the file system; later calls for it do not.
  SharedString bundleIdentifierForImagePath(StringRef imagePath);

 private:
  SharedString search(std::string_view imagePath);

  struct Hash {
    size_t operator()(const SharedString& text) const { return text.hash(); }
  };
  struct Equal {
    bool operator()(const SharedString& a, const SharedString& b) const { return sameString(a, b); }
  };

  BundleReader& bundles_;
  // Image path to identifier. An absent identifier marks a path that has none.
  std::unordered_map<SharedString, SharedString, Hash, Equal> bundleIdentifierCache_;
  size_t cacheBytes_ = 0;
};

}  // namespace tessel
