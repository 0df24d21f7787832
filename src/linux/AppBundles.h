// AppBundles: the identifier of an application's directory.
//
// The identifier is the AppStream component id in the one metadata file of the directory's
// usr/share/metainfo (*.metainfo.xml, *.appdata.xml). If there is no such file, or it is over
// 1 MiB, is not well-formed or has no valid id, the one *.desktop file at the directory's root
// names the bundle, provided that the name has reverse-DNS form. A directory with several files of
// a kind, or with more than 10,000 entries, has no identifier.
//
// Strangers made these directories. Only mounts of local types are touched, so that a dead server
// cannot hang the caller. Only regular files are opened. A link to a file is followed if it stays
// within the bundle. Entities of an XML file are not expanded. One thread at a time.

#pragma once

#include <optional>
#include <string>

#include "linux/SystemFacts.h"
#include "platform/System.h"

namespace tessel {

class AppBundles final : public BundleReader {
 public:
  explicit AppBundles(MountTable& mounts) : mounts_(mounts) {}
  std::optional<std::string> bundleIdentifier(const std::string& directory) override;

 private:
  MountTable& mounts_;
};

}  // namespace tessel
