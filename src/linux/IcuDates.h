// IcuDates: dates as people of this machine's locale and time zone write them. Any thread.

#pragma once

#include <optional>
#include <string>

#include "platform/System.h"

namespace tessel {

class IcuDates final : public DateFormatter {
 public:
  // The locale of the environment for dates ($LC_ALL, $LC_TIME, $LANG) and the machine's time zone
  // at the moment of formatting.
  IcuDates();
  // A locale ("de_DE.UTF-8") and a time zone ("Europe/Berlin") of the caller's choice.
  IcuDates(std::string locale, std::optional<std::string> timeZone);

  std::string format(Date date) override;

 private:
  const std::string locale_;
  const std::optional<std::string> timeZone_;
};

}  // namespace tessel
