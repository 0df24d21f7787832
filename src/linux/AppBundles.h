// AppBundles: the identifier of an application's directory.
//
// The identifier is the AppStream component id in the one metadata file of the directory's
// usr/share/metainfo (*.metainfo.xml, *.appdata.xml). If there is no such file, it is the name of
// the one *.desktop file at the directory's root, provided that the name has reverse-DNS form. A
// directory with several files of a kind has no identifier. If the metadata file is over 1 MiB, is
// not well-formed or has no valid id, there is no identifier either, even beside a desktop file.
//
// Strangers made these files. Links to files are followed, only regular files are opened, and
// entities of an XML file are not expanded. Stateless; any thread.

#pragma once

#include <optional>
#include <string>

#include "platform/System.h"

namespace tessel {

class AppBundles final : public BundleReader {
 public:
  std::optional<std::string> bundleIdentifier(const std::string& directory) override;
};

}  // namespace tessel
