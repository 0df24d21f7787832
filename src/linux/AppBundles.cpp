// Walking to a bundle and reading its metadata.
//
// An identifier names a program in what is reported, so a doubtful one is worse than none. Two
// files of a kind may contradict each other, and the order of the directory must not choose between
// them. Strangers wrote these directories, and may change them while we look. So every size is
// bounded, and what was looked at is held by a descriptor until it is read.

#include "linux/AppBundles.h"

#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <memory>
#include <pugixml.hpp>
#include <string_view>
#include <system_error>
#include <utility>
#include <vector>

#include "os/Files.h"
#include "os/UniqueFd.h"
#include "platform/Text.h"

namespace tessel {

namespace {

constexpr size_t kMaxMetadataSize = size_t{1} << 20;  // usual ones have a few kilobytes
constexpr size_t kMaxIdentifierLength = 255;          // of a D-Bus name
constexpr size_t kMaxDirectoryEntries = 10'000;       // a root with more is no application's
// Components of all paths of a look-up. Links can make them as many as their owner likes.
constexpr size_t kMaxSteps = 10'000;
constexpr int kMaxLinks = 40;  // of one path, as for the kernel; a link may lead to itself

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

// A file or directory that a walk has reached. The descriptor is an O_PATH one: it holds the inode
// and opens nothing, so a device or a pipe under it stays as it is.
struct Place {
  UniqueFd fd;
  std::string path;  // absolute, without links
  struct stat facts {};
};

// Walks along paths component by component and follows links itself. The kernel would resolve a
// path in one call, but then a link that someone made a moment ago could lead onto a dead mount,
// which blocks for ever. openat2() can forbid other mounts as a whole, yet a bundle may well lie
// under several local ones, and we would have to tell them apart here all the same.
class Walk {
 public:
  explicit Walk(MountTable& mounts) : mounts_(mounts) {}

  // Absent if "/" is not local.
  std::optional<Place> root();
  // The place at `path` below `from`. Absent if nothing is there, if the way leads over a mount
  // that is not local, or if it leaves `from`.
  std::optional<Place> to(const Place& from, std::string path);
  // Whether the walk used up its steps, so that it may have missed what is there.
  bool exhausted() const { return steps_ > kMaxSteps; }

 private:
  std::optional<Place> step(const Place& at, const std::string& name);

  MountTable& mounts_;
  size_t steps_ = 0;
};

std::optional<Place> Walk::root() {
  Place place{UniqueFd(::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC)), "/"};
  if (!place.fd.valid() || !mounts_.isLocal(place.fd.get())) return {};
  return place;
}

// The table is asked before the step, because a step onto some mounts already calls the server. Its
// answer may be out of date: somebody mounts, or renames a directory above us. Then the id of the
// mount tells, before anything calls the file system: O_PATH opens nothing, and fstat() comes last.
std::optional<Place> Walk::step(const Place& at, const std::string& name) {
  Place next{{}, (at.path == "/" ? "" : at.path) + '/' + name};
  // A name with a zero byte would be another name for the kernel than for the table.
  if (next.path.size() > PATH_MAX || name.find('\0') != std::string::npos) return {};
  if (!mounts_.mayStepOnto(next.path)) return {};
  next.fd = UniqueFd(::openat(at.fd.get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (!next.fd.valid() || !mounts_.isLocal(next.fd.get())) return {};
  if (::fstat(next.fd.get(), &next.facts) != 0) return {};
  return next;
}

std::optional<std::string> linkTarget(const Place& link) {
  char target[PATH_MAX];
  const ssize_t length = ::readlinkat(link.fd.get(), "", target, sizeof target);
  if (length <= 0) return {};
  return std::string(target, static_cast<size_t>(length));
}

std::optional<Place> Walk::to(const Place& from, std::string path) {
  std::optional<Place> reached;  // absent while the walk stands at `from`
  int links = 0;
  while (path.size() <= PATH_MAX && ++steps_ <= kMaxSteps) {
    const size_t begin = std::min(path.find_first_not_of('/'), path.size());
    const size_t end = std::min(path.find('/', begin), path.size());
    const std::string name = path.substr(begin, end - begin);
    path.erase(0, end);
    if (name.empty()) return reached;
    if (name == ".") continue;
    if (name == "..") {
      // The parent's path has no links, so we walk it anew. Going up by ".." could meet a mount.
      if (!reached && from.path == "/") continue;
      if (!reached) return {};
      const size_t parent = reached->path.rfind('/');
      path.insert(
          0, reached->path.substr(0, parent).erase(0, from.path == "/" ? 0 : from.path.size()));
      reached.reset();
      continue;
    }
    auto next = step(reached ? *reached : from, name);
    if (!next) return {};
    if (!S_ISLNK(next->facts.st_mode)) {
      reached = std::move(next);
      continue;
    }
    const auto target = linkTarget(*next);
    if (!target || ++links > kMaxLinks) return {};
    if (target->starts_with('/')) {
      if (from.path != "/") return {};
      reached.reset();
    }
    path.insert(0, *target);
  }
  return {};
}

// What a bundle has of one kind of file.
struct OneFile {
  std::optional<Place> file;
  std::string name;
  bool unclear = false;  // there are several files, or we could not look at all entries
};

struct CloseStream {
  void operator()(DIR* directory) const { ::closedir(directory); }
};

// The one file that stands in `place` under a name with one of `suffixes`. `path` is the way from
// the bundle to the place.
OneFile oneFile(Walk& walk, const Place& bundle, const std::string& path, const Place& place,
                const std::vector<std::string_view>& suffixes) {
  OneFile one;
  const int fd = ::openat(place.fd.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  const std::unique_ptr<DIR, CloseStream> directory(fd < 0 ? nullptr : ::fdopendir(fd));
  if (!directory) return one;
  for (size_t seen = 0; !one.unclear;) {
    errno = 0;
    const dirent* entry = ::readdir(directory.get());
    one.unclear = entry == nullptr && errno != 0;
    if (!entry) break;
    const std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    if (++seen > kMaxDirectoryEntries) one.unclear = true;
    if (hasSuffix(name, suffixes)) {
      // From the bundle and not from here: a link may lead to anywhere within the bundle.
      auto file = walk.to(bundle, path + name);
      if (!file || !S_ISREG(file->facts.st_mode)) continue;
      one.unclear |= one.file.has_value();
      one.file = std::move(file);
      one.name = name;
    }
  }
  one.unclear |= walk.exhausted();
  return one;
}

// The parser accepts a document with several root elements, which is not well-formed XML.
bool hasOneRoot(const pugi::xml_document& document) {
  const auto isElement = [](const pugi::xml_node& node) {
    return node.type() == pugi::node_element;
  };
  return std::count_if(document.begin(), document.end(), isElement) == 1;
}

// Absent if the file says nothing usable. The descriptor leads to the inode that was looked at, so
// nobody can put a device under its name in the meantime.
std::optional<std::string> componentId(const Place& file) {
  const std::optional<std::string> text =
      readSmallFile("/proc/self/fd/" + std::to_string(file.fd.get()), kMaxMetadataSize);
  pugi::xml_document document;
  if (!text || !document.load_buffer(text->data(), text->size()) || !hasOneRoot(document))
    return {};
  const std::string_view id = trimmed(document.child("component").child("id").child_value());
  if (!isComponentId(id)) return {};
  return std::string(id);
}

}  // namespace

std::optional<std::string> AppBundles::bundleIdentifier(const std::string& directory) {
  Walk walk(mounts_);
  const auto root = walk.root();
  std::error_code error;  // of a working directory that was removed; the path is empty then
  const auto path = std::filesystem::absolute(directory, error);
  const auto bundle = root ? walk.to(*root, path.native()) : std::nullopt;
  if (!bundle) return {};
  constexpr const char* kMetadataPath = "usr/share/metainfo/";
  if (const auto metainfo = walk.to(*bundle, kMetadataPath)) {
    const OneFile metadata =
        oneFile(walk, *bundle, kMetadataPath, *metainfo, {".metainfo.xml", ".appdata.xml"});
    if (metadata.unclear) return {};
    if (const auto id = metadata.file ? componentId(*metadata.file) : std::nullopt) return id;
  }
  const OneFile desktop = oneFile(walk, *bundle, "", *bundle, {".desktop"});
  if (desktop.unclear || !desktop.file) return {};
  const std::string stem = std::filesystem::path(desktop.name).stem().native();
  if (!isReverseDns(stem)) return {};
  return stem;
}

}  // namespace tessel
