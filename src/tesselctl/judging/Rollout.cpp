// The draw is SipHash-2-4 with the machine id as its key and the cohort as its text. The ids of
// cloned or numbered machines may differ in one digit only, and a sum or a checksum would put such
// neighbours side by side. SipHash scatters them, and another program can compute it as well.

#include "tesselctl/judging/Rollout.h"

#include <systemd/sd-id128.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <nlohmann/json.hpp>

#include "journal/JournalHash.h"
#include "os/Files.h"
#include "platform/Json.h"

namespace tessel::ctl {

namespace {

constexpr char kFileName[] = "rollout.json";
// A thousand times what we write. A larger file is not ours, and reading it would only cost
// memory.
constexpr size_t kMaxFileBytes = size_t{64} << 10;
constexpr size_t kMaxNameBytes = 64;
// A place is one of a million, so four decimals of a percentage name each of them.
constexpr size_t kDecimals = 4;
constexpr unsigned kReadableByAll = 0644;

bool isDigit(char byte) { return byte >= '0' && byte <= '9'; }

}  // namespace

std::optional<uint32_t> shareOf(std::string_view text) {
  if (!text.ends_with('%')) return {};
  text.remove_suffix(1);
  const size_t point = std::min(text.find('.'), text.size());
  std::string decimals(text.substr(std::min(point + 1, text.size())));
  // "5.%" is more likely a typing mistake than a percentage.
  if (point == 0 || point > 3 || (point < text.size() && decimals.empty()) ||
      decimals.size() > kDecimals)
    return {};
  decimals.resize(kDecimals, '0');
  const std::string digits = std::string(text.substr(0, point)) + decimals;
  if (!std::all_of(digits.begin(), digits.end(), isDigit)) return {};
  uint32_t parts = 0;
  std::from_chars(digits.data(), digits.data() + digits.size(), parts);
  // 150% is no share, and taking it for the whole fleet would switch on what somebody mistyped.
  if (parts > kWholeFleet) return {};
  return parts;
}

// The name becomes a label of a metric and a word of a command line, so it holds nothing that
// either would have to quote.
bool isCohortName(std::string_view name) {
  return !name.empty() && name.size() <= kMaxNameBytes &&
         std::all_of(name.begin(), name.end(), [](char byte) {
           return isDigit(byte) || (byte >= 'a' && byte <= 'z') || (byte >= 'A' && byte <= 'Z') ||
                  byte == '.' || byte == '-' || byte == '_';
         });
}

std::optional<std::string> machineId() {
  sd_id128_t id{};
  if (sd_id128_get_machine(&id) < 0) return {};
  char text[SD_ID128_STRING_MAX];
  return sd_id128_to_string(id, text);
}

std::optional<uint32_t> placeOf(std::string_view id, std::string_view cohort) {
  sd_id128_t parsed{};
  if (sd_id128_from_string(std::string(id).c_str(), &parsed) < 0) return {};
  Id128 key{};
  std::copy(std::begin(parsed.bytes), std::end(parsed.bytes), key.begin());
  const auto* const bytes = reinterpret_cast<const uint8_t*>(cohort.data());
  const uint64_t drawn = sipHash24({bytes, cohort.size()}, key);
  // The upper half times the number of places, without its lower half: each place has the same
  // number of hashes, but for one in four thousand.
  return static_cast<uint32_t>((drawn >> 32) * kWholeFleet >> 32);
}

std::string rolloutFile(const LaunchConfiguration& launch) {
  return launch.configurationDirectory + "/" + kFileName;
}

std::optional<Rollout> readRollout(const LaunchConfiguration& launch) {
  const auto text = readSmallFile(rolloutFile(launch), kMaxFileBytes);
  const auto json = nlohmann::json::parse(text.value_or(""), nullptr, false);
  if (!json.is_object() || !json.contains("share") || !json.contains("cohort")) return {};
  if (!json.at("share").is_string() || !json.at("cohort").is_string()) return {};
  const auto share = shareOf(json.at("share").get<std::string>());
  Rollout rollout{share.value_or(0), json.at("cohort").get<std::string>()};
  if (!share || !isCohortName(rollout.cohort)) return {};
  return rollout;
}

std::optional<PlatformError> writeRollout(const LaunchConfiguration& launch,
                                          const std::optional<Rollout>& rollout) {
  const std::string file = rolloutFile(launch);
  if (!rollout) {
    if (::unlink(file.c_str()) == 0 || errno == ENOENT) return {};
    return fileError(file, errno);
  }
  // Written as it is given on a command line. A fraction of binary digits would not be exact.
  std::string decimals = std::to_string(rollout->share % 10'000 + 10'000).substr(1);
  decimals.erase(decimals.find_last_not_of('0') + 1);
  const std::string share =
      std::to_string(rollout->share / 10'000) + (decimals.empty() ? "" : "." + decimals) + "%";
  std::string text;
  JsonWriter json(text);
  json.object([&] { json.member("share", share).member("cohort", rollout->cohort); });
  return replaceFileDurably(file, text + "\n", kReadableByAll);
}

}  // namespace tessel::ctl
