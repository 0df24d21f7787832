// Deferral by file, battery and CPU pressure.

#include "linux/DeferralConditions.h"

#include <sys/stat.h>

#include <charconv>
#include <filesystem>
#include <system_error>
#include <utility>
#include <vector>

#include "os/Files.h"

namespace tessel {

namespace {

constexpr size_t kMaxFactSize = 4096;  // sysfs and procfs files of this kind fit a page
constexpr int kLowBatteryPercent = 20;
constexpr double kHighPressurePercent = 80;

// The fact in a one-line file; empty where there is none.
std::string fact(const std::string& path) {
  std::string text = readSmallFile(path, kMaxFactSize).value_or("");
  while (text.ends_with('\n')) text.pop_back();
  return text;
}

template <typename T>
std::optional<T> number(std::string_view text) {
  T value{};
  const auto [stopped, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (error != std::errc() || stopped != text.data() + text.size()) return {};
  return value;
}

std::vector<std::string> entriesOf(const std::string& directory) {
  std::vector<std::string> paths;
  std::error_code error;
  std::filesystem::directory_iterator entry(directory, error);
  const std::filesystem::directory_iterator end;
  for (; !error && entry != end; entry.increment(error)) paths.push_back(entry->path().string());
  return paths;
}

// A battery that feeds the machine; those of mice and headsets have the scope "Device".
bool feedsTheMachine(const std::string& supply) {
  return fact(supply + "/type") == "Battery" && fact(supply + "/scope") != "Device" &&
         fact(supply + "/present") != "0";
}

// The number behind "avg10=" in the line of `text` that begins with "some ".
std::optional<double> someAverage10(std::string_view text) {
  constexpr std::string_view kBefore = "some avg10=";
  const size_t at = text.starts_with(kBefore) ? 0 : text.find("\nsome avg10=");
  if (at == std::string_view::npos) return {};
  text.remove_prefix(text.find(kBefore, at) + kBefore.size());
  return number<double>(text.substr(0, text.find_first_of(" \n")));
}

}  // namespace

DeferralConditions::DeferralConditions(DeferSources sources, std::string deferFile,
                                       std::string powerSupplyDirectory, std::string pressureFile)
    : sources_(sources),
      deferFile_(std::move(deferFile)),
      powerSupplyDirectory_(std::move(powerSupplyDirectory)),
      pressureFile_(std::move(pressureFile)) {}

std::optional<std::string> DeferralConditions::reason() const {
  if (sources_.file && deferFileExists()) return deferFile_ + " exists";
  if (sources_.battery && batteryIsLow()) return "the battery is low";
  if (sources_.pressure && cpuIsUnderPressure()) return "the CPU is under pressure";
  return {};
}

bool DeferralConditions::deferFileExists() const {
  struct stat facts {};
  return ::lstat(deferFile_.c_str(), &facts) == 0;
}

// A machine with several batteries drains one after another: it is low when all of them are.
bool DeferralConditions::batteryIsLow() const {
  bool discharging = false;
  for (const std::string& supply : entriesOf(powerSupplyDirectory_)) {
    if (!feedsTheMachine(supply)) continue;
    const std::optional<int> percent = number<int>(fact(supply + "/capacity"));
    if (!percent || *percent >= kLowBatteryPercent) return false;
    discharging = discharging || fact(supply + "/status") == "Discharging";
  }
  return discharging;
}

bool DeferralConditions::cpuIsUnderPressure() const {
  const std::optional<std::string> text = readSmallFile(pressureFile_, kMaxFactSize);
  return text && someAverage10(*text).value_or(0) > kHighPressurePercent;
}

}  // namespace tessel
