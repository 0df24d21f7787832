// Clocks, os-release, mountinfo, ICU and the metadata of applications.
//
// In a container every one of these sources may be missing or strange. So no question here fails:
// each has an answer for "unknown".

#include "linux/SystemFacts.h"

#include <unicode/datefmt.h>
#include <unicode/locid.h>
#include <unicode/timezone.h>

#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <memory>
#include <pugixml.hpp>
#include <sstream>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "os/Files.h"
#include "platform/Text.h"

namespace tessel {

uint64_t SystemClock::continuousTicks() {
  // CLOCK_MONOTONIC stands still while the machine sleeps. With it a run could come a night late.
  timespec time{};
  clock_gettime(CLOCK_BOOTTIME, &time);
  return static_cast<uint64_t>(time.tv_sec) * 1'000'000'000 + static_cast<uint64_t>(time.tv_nsec);
}

Date SystemClock::now() {
  return std::chrono::floor<std::chrono::microseconds>(std::chrono::system_clock::now());
}

void SystemClock::sleepMicroseconds(uint32_t microseconds) {
  std::this_thread::sleep_for(std::chrono::microseconds{microseconds});
}

bool SystemClock::wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) {
  return semaphore.waitFor(timeout);
}

namespace {

constexpr size_t kMaxOsReleaseSize = size_t{64} << 10;  // usual ones have half a kilobyte

std::string_view withoutQuotes(std::string_view value) {
  const bool quoted =
      value.size() >= 2 && (value[0] == '"' || value[0] == '\'') && value.back() == value[0];
  return quoted ? value.substr(1, value.size() - 2) : value;
}

}  // namespace

std::string_view osReleaseValue(std::string_view text, std::string_view name) {
  std::string_view value;
  while (!text.empty()) {
    std::string_view line = text.substr(0, text.find('\n'));
    text.remove_prefix(std::min(line.size() + 1, text.size()));
    if (!line.starts_with(name) || line.substr(name.size(), 1) != "=") continue;
    line.remove_prefix(name.size() + 1);
    const size_t end = line.find_last_not_of(" \t\r");
    value = withoutQuotes(line.substr(0, end == std::string_view::npos ? 0 : end + 1));
  }
  return value;
}

OsReleaseBuildVariant::OsReleaseBuildVariant(const std::string& path)
    : internal_(osReleaseValue(readSmallFile(path, kMaxOsReleaseSize).value_or(""), "VARIANT_ID") ==
                "internal") {}

bool OsReleaseBuildVariant::hasInternalDiagnostics(std::string_view /*subsystem*/) {
  return internal_;
}

namespace {

bool isOctal(char digit) { return digit >= '0' && digit <= '7'; }

// The kernel writes a blank or a backslash in a field as \ooo, so that blanks separate fields.
std::string unescaped(std::string_view field) {
  std::string out;
  for (size_t i = 0; i < field.size(); ++i) {
    if (field[i] == '\\' && i + 3 < field.size() && isOctal(field[i + 1]) &&
        isOctal(field[i + 2]) && isOctal(field[i + 3])) {
      out += static_cast<char>((field[i + 1] - '0') * 64 + (field[i + 2] - '0') * 8 +
                               (field[i + 3] - '0'));
      i += 3;
    } else {
      out += field[i];
    }
  }
  return out;
}

// The file system type in one line, if that line is about "/". A line reads
//   id parent device root MOUNT-POINT options [optional...] - TYPE source options
// The number of optional fields varies, so we skip to the dash.
std::optional<std::string> typeAtRoot(const std::string& line) {
  std::istringstream fields(line);
  std::string field;
  for (int i = 0; i < 5; ++i) fields >> field;
  if (!fields || unescaped(field) != "/") return {};
  while (fields >> field && field != "-") {
  }
  if (!(fields >> field)) return {};
  return unescaped(field);
}

}  // namespace

std::optional<std::string> MountTable::rootFilesystemTypeName() {
  std::ifstream table(path_);
  std::optional<std::string> type;
  for (std::string line; std::getline(table, line);) {
    if (auto found = typeAtRoot(line)) type = std::move(found);
  }
  return type;
}

namespace {

std::string localeForDates() {
  for (const char* variable : {"LC_ALL", "LC_TIME", "LANG"}) {
    const char* value = std::getenv(variable);
    if (value && *value) return value;
  }
  return "C";
}

std::unique_ptr<icu::TimeZone> makeTimeZone(const std::optional<std::string>& name) {
  if (!name) return std::unique_ptr<icu::TimeZone>(icu::TimeZone::detectHostTimeZone());
  return std::unique_ptr<icu::TimeZone>(
      icu::TimeZone::createTimeZone(icu::UnicodeString::fromUTF8(*name)));
}

// If ICU cannot read the name, the locale is bogus and formatting would fail. "C" replaces it.
icu::Locale makeLocale(const std::string& name) {
  const icu::Locale locale = icu::Locale::createCanonical(name.c_str());
  return locale.isBogus() ? icu::Locale::createCanonical("C") : locale;
}

}  // namespace

IcuDates::IcuDates() : IcuDates(localeForDates(), {}) {}

IcuDates::IcuDates(std::string locale, std::optional<std::string> timeZone)
    : locale_(std::move(locale)), timeZone_(std::move(timeZone)) {}

std::string IcuDates::format(Date date) {
  const auto milliseconds =
      std::chrono::floor<std::chrono::milliseconds>(date).time_since_epoch().count();
  const std::unique_ptr<icu::DateFormat> formatter(icu::DateFormat::createDateTimeInstance(
      icu::DateFormat::kShort, icu::DateFormat::kMedium, makeLocale(locale_)));
  // ICU without its data cannot make a formatter. The seconds since 1970 are better than no date.
  if (!formatter) return std::to_string(milliseconds / 1000);
  if (auto zone = makeTimeZone(timeZone_)) formatter->adoptTimeZone(zone.release());
  icu::UnicodeString text;
  formatter->format(static_cast<UDate>(milliseconds), text);
  std::string utf8;
  text.toUTF8String(utf8);
  return utf8;
}

// Reading bundle metadata.
//
// An identifier decides what may be reported, so a doubtful one is worse than none. Two files of a
// kind may contradict each other, and the order of the directory must not choose between them. We
// do not control who wrote these directories, so every size is bounded.

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
