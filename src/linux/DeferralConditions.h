// DeferralConditions: whether now is a bad time for a run.
//
// Each question is answered from files at the moment it is asked. A file that is missing, cannot be
// read or makes no sense never defers. Immutable; any thread may ask.

#pragma once

#include <optional>
#include <string>

#include "linux/LaunchConfiguration.h"

namespace tessel {

class DeferralConditions {
 public:
  // `deferFile` defers by being there. The other two are the kernel's, elsewhere in tests.
  DeferralConditions(DeferSources sources, std::string deferFile,
                     std::string powerSupplyDirectory = "/sys/class/power_supply",
                     std::string pressureFile = "/proc/pressure/cpu");

  // Why a run should wait, in words; nothing where it need not.
  std::optional<std::string> reason() const;

 private:
  bool deferFileExists() const;
  bool batteryIsLow() const;
  bool cpuIsUnderPressure() const;

  const DeferSources sources_;
  const std::string deferFile_;
  const std::string powerSupplyDirectory_;
  const std::string pressureFile_;
};

}  // namespace tessel
