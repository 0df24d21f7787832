// Dates through ICU.

#include "linux/IcuDates.h"

#include <unicode/datefmt.h>
#include <unicode/locid.h>
#include <unicode/timezone.h>

#include <cstdlib>
#include <memory>
#include <utility>

namespace tessel {

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

// ICU must not be given a locale whose name it cannot read; that one counts as none.
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
  // ICU without its data can make no format; the log then shows the plain number.
  if (!formatter) return std::to_string(milliseconds / 1000);
  if (auto zone = makeTimeZone(timeZone_)) formatter->adoptTimeZone(zone.release());
  icu::UnicodeString text;
  formatter->format(static_cast<UDate>(milliseconds), text);
  std::string utf8;
  text.toUTF8String(utf8);
  return utf8;
}

}  // namespace tessel
