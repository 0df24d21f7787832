// Any bytes as the metadata of a bundle. An input that begins with 'd' names a desktop file, one
// that begins with 'n' names a metadata file, and any other is the content of a metadata file.

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <string_view>

#include "linux/AppBundles.h"

namespace {

namespace fs = std::filesystem;

const fs::path& directory() {
  static const auto& made = *new fs::path([] {
    std::string name = (fs::temp_directory_path() / "bundle.XXXXXX").string();
    if (::mkdtemp(name.data()) == nullptr) std::abort();
    return name;
  }());
  return made;
}

// Makes a file, unless its name is one that no file can have.
void makeFile(const fs::path& path, std::string_view text) {
  const int file = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
  if (file < 0) return;
  if (::write(file, text.data(), text.size()) != static_cast<ssize_t>(text.size())) std::abort();
  ::close(file);
}

std::string fileName(std::string_view text, std::string_view suffix) {
  std::string name(text.substr(0, 200));
  std::replace(name.begin(), name.end(), '/', '_');
  std::replace(name.begin(), name.end(), '\0', '_');
  return name.append(suffix);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  const fs::path root = directory() / "b";
  const fs::path metainfo = root / "usr/share/metainfo";
  fs::remove_all(root);
  fs::create_directories(metainfo);
  if (text.starts_with('d')) {
    makeFile(root / fileName(text.substr(1), ".desktop"), "");
  } else if (text.starts_with('n')) {
    makeFile(metainfo / fileName(text.substr(1), ".metainfo.xml"),
             "<component><id>com.vantor.Clock</id></component>");
  } else {
    makeFile(metainfo / "a.metainfo.xml", text);
  }
  static auto& mounts = *new tessel::MountTable;
  const auto identifier = tessel::AppBundles(mounts).bundleIdentifier(root.string());
  if (!identifier) return 0;
  constexpr std::string_view kAllowed =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789._-";
  if (identifier->empty() || identifier->size() > 255 ||
      identifier->find_first_not_of(kAllowed) != std::string::npos)
    std::abort();
  return 0;
}
