// TimeZone: what the clocks of a zone show, and at which instants they show it.
//
// Where clocks go back, they show an hour twice; where they go forward, they skip one. Only the
// caller knows which reading is meant, so we return them all.
//
// The C library knows one zone at a time, the one of $TZ. Another zone takes its place for the
// length of a call. So no other thread may use local time meanwhile.

#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/System.h"

namespace tessel::ctl {

// A day and time of day as clocks show it. It is counted as if the zone were UTC.
using WallTime = Date;

class TimeZone {
 public:
  struct Offset {
    std::chrono::seconds fromUtc{0};
    std::string name;  // "CET", or "+01:00" if the zone has no names
  };
  struct Reading {
    Date date;
    Offset offset;
  };

  static TimeZone local() { return {}; }
  static TimeZone fixed(std::chrono::seconds fromUtc);
  // A zone of the system's database, such as "Europe/Berlin"; nothing if it has no such zone.
  static std::optional<TimeZone> named(std::string_view name);

  Offset at(Date date) const;
  WallTime wallTime(Date date) const { return date + at(date).fromUtc; }
  // The instants at which clocks show `wall`, earlier first: one, or two where clocks go back, or
  // none where they go forward.
  std::vector<Reading> readings(WallTime wall) const;
  // The instant at which clocks changed. REQUIRES: they changed within a day of `wall`.
  Date changeNear(WallTime wall) const;
  // Whether clocks of the zone use the name within a year of `date`.
  bool uses(std::string_view offsetName, Date date) const;

 private:
  std::optional<std::chrono::seconds> fixed_;
  std::string name_;  // empty: the zone of $TZ or of the machine
};

// What $TZ says, if it names no zone; local time is UTC from then on. The C library would count it
// as UTC, too, but without a word and under a made-up name.
std::optional<std::string> replaceUnknownZone();

// "+01:00"
std::string offsetText(std::chrono::seconds fromUtc);

}  // namespace tessel::ctl
