// Rollout: reporting on a share of the machines of a fleet.
//
// Each machine decides for itself. It hashes its machine id with the name of a cohort, which puts
// it at a place between 0 and 100 %. A share takes the machines below it. So whoever is in at 5 %
// is in at 20 % as well, and the cohort of another name draws other machines.
//
// The service knows nothing of this: it reads yes or no. Share and cohort stand in a file of their
// own beside that answer, for people and for the fleet. Stateless.

#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "linux/LaunchConfiguration.h"
#include "platform/Error.h"

namespace tessel::ctl {

// Of the machines, in parts of a million, so that "0.0005%" and no less can be said.
inline constexpr uint32_t kWholeFleet = 1'000'000;

struct Rollout {
  uint32_t share = kWholeFleet;
  std::string cohort;

  double percent() const { return share / 1e4; }
  bool operator==(const Rollout&) const = default;
};

// The cohort of a roll-out that names none.
inline constexpr char kDefaultCohort[] = "default";

// "5%" or "0.5%" as parts of a million. Absent if it is no percentage from 0 to 100, or has more
// than four decimals.
std::optional<uint32_t> shareOf(std::string_view text);
// Whether a cohort may have that name: 1 to 64 letters, digits, dots, hyphens and underscores.
bool isCohortName(std::string_view name);

// The id of this machine: 32 hexadecimal digits. Absent if it has none, as in many containers.
std::optional<std::string> machineId();
// Where the machine stands, below kWholeFleet: it belongs to each greater share. This never
// changes, or machines would leave a roll-out in the middle. Absent if `id` is no machine id.
std::optional<uint32_t> placeOf(std::string_view id, std::string_view cohort);

// The file beside the tasking configuration.
std::string rolloutFile(const LaunchConfiguration& launch);
// Absent if there is none, or if it holds something else.
std::optional<Rollout> readRollout(const LaunchConfiguration& launch);
// Replaces the file; removes it if there is no roll-out.
std::optional<PlatformError> writeRollout(const LaunchConfiguration& launch,
                                          const std::optional<Rollout>& rollout);

}  // namespace tessel::ctl
