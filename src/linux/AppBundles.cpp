// Reading bundle metadata.
//
// An identifier decides what may be reported, so a doubtful one is worse than none. Two files of a
// kind may contradict each other, and the order of the directory must not choose between them. We
// do not control who wrote these directories, so every size is bounded.

#include "linux/AppBundles.h"

#include <algorithm>
#include <filesystem>
#include <pugixml.hpp>
#include <string_view>
#include <system_error>
#include <vector>

#include "os/Files.h"
#include "platform/Text.h"

namespace tessel {

namespace {

constexpr size_t kMaxMetadataSize = size_t{1} << 20;  // usual ones have a few kilobytes
constexpr size_t kMaxIdentifierLength = 255;          // of a D-Bus name
constexpr size_t kMaxDirectoryEntries = 10'000;       // a root with more is no application's

bool isLetter(char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }
bool isDigit(char c) { return c >= '0' && c <= '9'; }
bool isIdentifierCharacter(char c) { return isLetter(c) || isDigit(c) || c == '-' || c == '_'; }

// The characters that AppStream allows in a component id.
bool isComponentId(std::string_view id) {
  return !id.empty() && id.size() <= kMaxIdentifierLength &&
         std::all_of(id.begin(), id.end(),
                     [](char c) { return c == '.' || isIdentifierCharacter(c); });
}

bool isLabel(std::string_view label) {
  return !label.empty() && !isDigit(label[0]) &&
         std::all_of(label.begin(), label.end(), isIdentifierCharacter);
}

// Two labels or more, as in a D-Bus name. A single word is no identifier, because two vendors may
// choose the same word.
bool isReverseDns(std::string_view name) {
  if (name.size() > kMaxIdentifierLength || name.find('.') == std::string_view::npos) return false;
  for (;;) {
    const size_t dot = name.find('.');
    if (!isLabel(name.substr(0, dot))) return false;
    if (dot == std::string_view::npos) return true;
    name.remove_prefix(dot + 1);
  }
}

bool hasSuffix(std::string_view name, const std::vector<std::string_view>& suffixes) {
  return !name.starts_with('.') &&
         std::any_of(suffixes.begin(), suffixes.end(),
                     [&](std::string_view suffix) { return name.ends_with(suffix); });
}

// The files in `directory` with one of `suffixes`. It stops at the second one, because the caller
// accepts only a single file. It also stops after kMaxDirectoryEntries, so it may miss files there.
std::vector<std::filesystem::path> filesWithSuffix(const std::filesystem::path& directory,
                                                   const std::vector<std::string_view>& suffixes) {
  std::vector<std::filesystem::path> found;
  std::error_code error;
  std::filesystem::directory_iterator entry(directory, error);
  const std::filesystem::directory_iterator end;
  for (size_t seen = 0; !error && entry != end && seen < kMaxDirectoryEntries; ++seen) {
    std::error_code unknown;
    if (hasSuffix(entry->path().filename().native(), suffixes) && entry->is_regular_file(unknown)) {
      found.push_back(entry->path());
      if (found.size() == 2) break;
    }
    entry.increment(error);
  }
  return found;
}

// The parser accepts a document with several root elements, which is not well-formed XML.
bool hasOneRoot(const pugi::xml_document& document) {
  const auto isElement = [](const pugi::xml_node& node) {
    return node.type() == pugi::node_element;
  };
  return std::count_if(document.begin(), document.end(), isElement) == 1;
}

std::optional<std::string> componentId(const std::filesystem::path& file) {
  const std::optional<std::string> text = readSmallFile(file.string(), kMaxMetadataSize);
  pugi::xml_document document;
  if (!text || !document.load_buffer(text->data(), text->size()) || !hasOneRoot(document))
    return {};
  const std::string_view id = trimmed(document.child("component").child("id").child_value());
  if (!isComponentId(id)) return {};
  return std::string(id);
}

}  // namespace

std::optional<std::string> AppBundles::bundleIdentifier(const std::string& directory) {
  const std::filesystem::path root(directory);
  const auto metadata =
      filesWithSuffix(root / "usr/share/metainfo", {".metainfo.xml", ".appdata.xml"});
  if (metadata.size() == 1) return componentId(metadata[0]);
  if (!metadata.empty()) return {};
  const auto desktopFiles = filesWithSuffix(root, {".desktop"});
  if (desktopFiles.size() != 1) return {};
  const std::string stem = desktopFiles[0].stem().string();
  if (!isReverseDns(stem)) return {};
  return stem;
}

}  // namespace tessel
