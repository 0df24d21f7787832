// ProcessIdentity: from the path of an executable image to the identifier of its bundle.
//
// The bundle is the nearest directory above the image, within 100 levels, whose name begins with
// the image's file name and a dot. Every answer, found or not, is kept for the life of the object,
// so a path costs one walk and at most one bundle lookup, ever.
//
// Threads: one at a time.

#pragma once

#include <string>
#include <unordered_map>

#include "platform/SharedString.h"
#include "platform/System.h"

namespace tessel {

class ProcessIdentity {
 public:
  explicit ProcessIdentity(BundleReader& bundles) : bundles_(bundles) {}

  // The bundle identifier for the image at `imagePath`; absent where there is none. Touches the
  // file system only for a path that was not asked for before.
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
  // Image path to identifier; an absent identifier marks a path that has none.
  std::unordered_map<SharedString, SharedString, Hash, Equal> bundleIdentifierCache_;
};

}  // namespace tessel
