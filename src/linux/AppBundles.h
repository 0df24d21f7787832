// AppBundles: the identifier of an application's directory.
//
// A directory's identifier is the AppStream component id in the one metadata file of its
// usr/share/metainfo (*.metainfo.xml, *.appdata.xml). Without such a file it is the name of the one
// *.desktop file at its root, where that is in reverse-DNS form. Several files of a kind name no
// bundle, and neither does a metadata file that is over 1 MiB, is not well-formed, or has no valid
// component id: a desktop file beside it then does not count.
//
// What is read was put there by strangers: links to files are followed, anything but a regular file
// is left alone, and entities of an XML file are not expanded. Stateless; any thread.

#pragma once

#include "platform/System.h"

namespace tessel {

class AppBundles final : public BundleReader {
 public:
  std::optional<std::string> bundleIdentifier(const std::string& directory) override;
};

}  // namespace tessel
