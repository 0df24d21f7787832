// ProcessIdentity: finds the bundle identifier of an executable image.
//
// The bundle of an image is the nearest directory above it, within 100 levels, whose name begins
// with the image's file name and a dot. "Foo.app" is the bundle directory of ".../Foo.app/Foo".
//
// The object remembers every answer, also that a path has no bundle. A path therefore costs one
// walk and at most one bundle lookup. The price: if a bundle is installed or removed later, the
// answer for a path that was asked before stays the old one.
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
};

}  // namespace tessel
