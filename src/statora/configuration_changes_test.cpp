// What an observer is told after a row of looks.

#include <gtest/gtest.h>

#include "statora/ConfigurationFiles.h"

namespace tessel {
namespace {

const ConfigurationFile kNone{false, {}};
const ConfigurationFile kUnreadable{true, {}};
ConfigurationFile holding(const char* text) { return {true, text}; }

TEST(ConfigurationChangesTest, AbsenceIsToldWhenItLasts) {
  const struct {
    const char* what;
    std::vector<ConfigurationFile> looks;
    const char* told;  // a letter a look: c a configuration, a its absence, - nothing
  } cases[] = {
      {"never a file", {kNone, kNone, kNone}, "---"},
      {"made, changed, touched", {kNone, holding("1"), holding("2"), holding("2")}, "-cc-"},
      {"written slowly",
       {holding(""), holding("{"), holding("{\"a\":"), holding("{\"a\":1}")},
       "---c"},
      {"rewritten slowly with what it held",
       {holding("{}"), holding("{"), holding("{}"), holding("{")},
       "c---"},
      {"left half written", {holding("{"), holding("{"), holding("{")}, "-a-"},
      {"gone for a moment", {holding("1"), kNone, holding("1")}, "c--"},
      {"gone, then back as it was", {holding("1"), kNone, kNone, kNone, holding("1")}, "c-a-c"},
      {"absent for one reason after another",
       {holding("1"), kNone, kNone, kUnreadable, kUnreadable},
       "c-a--"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    ConfigurationChanges changes;
    std::string told;
    for (const ConfigurationFile& seen : c.looks) {
      const auto report = changes.look(seen);
      told += !report ? '-' : report->configuration ? 'c' : 'a';
    }
    EXPECT_EQ(told, c.told);
  }
}

}  // namespace
}  // namespace tessel
