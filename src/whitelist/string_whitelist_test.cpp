// The lists, the sets built from them and the rules of the lookup.

#include "whitelist/StringWhitelist.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <set>

#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

using Platform = TesselReporterPlatform;

bool isKnown(std::string_view value, Platform platform) {
  return stringIsWhitelisted(SharedString(value), platform);
}

const struct {
  const char* name;
  StringList list;
  size_t entries, distinct;
  std::set<Platform> platforms;  // that know its values
} kLists[] = {
    {"components", perfLoggingComponentNames(), 75, 70, {Platform::quarro}},
    {"actions", perfLoggingActionNames(), 70, 69, {Platform::quarro}},
    {"desktop bundles", desktopBundleIdentifiers(), 774, 774, {Platform::quarro}},
    {"file system scans", fileSystemScanValues(), 25, 25, {Platform::quarro}},
    {"common",
     commonWhitelistValues(),
     2,
     2,
     {Platform::quarro, Platform::selvin, Platform::darrow, Platform::fennic}},
    {"launch sources", launchSourceValues(), 32, 32, {Platform::selvin}},
    {"camera", cameraValues(), 28, 28, {Platform::selvin}},
    {"share activities", shareActivityTypes(), 27, 27, {Platform::selvin}},
    {"extensions", extensionBundleIdentifiers(), 214, 214, {Platform::selvin}},
    {"periods", periodViewValues(), 6, 6, {Platform::selvin}},
    {"sizes", sizeValues(), 4, 4, {Platform::selvin}},
    {"mail accounts", mailAccountKindValues(), 10, 10, {Platform::selvin}},
    {"generation sources", generationSourceValues(), 4, 4, {Platform::selvin}},
};

TEST(WhitelistTest, EachPlatformKnowsItsLists) {
  std::map<Platform, size_t> sizes;
  std::set<std::string_view> seen;
  for (const auto& row : kLists) {
    const std::set<std::string_view> distinct(row.list.begin(), row.list.end());
    EXPECT_EQ(row.list.size(), row.entries) << row.name;
    EXPECT_EQ(std::ranges::count(stringLists(), row.list.data(),
                                 [](const StringListRow& shown) { return shown.list().data(); }),
              1)
        << row.name;
    EXPECT_EQ(distinct.size(), row.distinct) << row.name;
    for (const Platform platform : row.platforms) sizes[platform] += row.distinct;
    for (const auto text : distinct) {
      EXPECT_TRUE(seen.insert(text).second) << text << " again in " << row.name;
      for (uint64_t code = 0; code <= 6; ++code) {
        const auto platform = static_cast<Platform>(code);
        EXPECT_EQ(isKnown(text, platform), row.platforms.contains(platform))
            << text << " of " << row.name << " on " << nameForPlatform(platform);
      }
    }
  }
  for (uint64_t code = 0; code <= 6; ++code) {
    const auto platform = static_cast<Platform>(code);
    EXPECT_EQ(stringWhitelistForPlatform(platform).size(), sizes[platform]);
    EXPECT_FALSE(stringIsWhitelisted({}, platform));
  }
}

TEST(WhitelistTest, MembershipIsExact) {
  for (const char* value : {"Week", "week ", "wee", "", "1,1,0,0", "5,1,0,0", "2,1,0,2"}) {
    EXPECT_FALSE(isKnown(value, Platform::selvin)) << value;
  }
  for (const char* value : {"Root", "week", "small", "2,2,1,0", "modeChange", "imap", "cache"}) {
    EXPECT_TRUE(isKnown(value, Platform::selvin)) << value;
  }
}

// Asks twice in a process of its own, where nothing was asked before, and prints the log.
[[noreturn]] void printLinesOfTwoLookups(Platform platform) {
  const testing::RecordingLog log;
  isKnown("week", platform);
  isKnown("week", platform);
  for (const auto& line : log.lines()) std::fprintf(stderr, "[%s]", line.c_str());
  std::exit(0);
}

TEST(WhitelistDeathTest, ASetLogsItsSizeOnce) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(printLinesOfTwoLookups(Platform::darrow), ::testing::ExitedWithCode(0),
              "^\\[Using string whitelist with 2 elements for Darrow platform\\]$");
  EXPECT_EXIT(printLinesOfTwoLookups(Platform::selvin), ::testing::ExitedWithCode(0),
              "^\\[Using string whitelist with 327 elements for Selvin platform\\]$");
  EXPECT_EXIT(
      printLinesOfTwoLookups(Platform::lumet), ::testing::ExitedWithCode(0),
      "^\\[Using string whitelist with 0 elements for Lumet platform\\]"
      "\\[Using string whitelist with 0 elements\\]\\[Using string whitelist with 0 elements\\]$");
}

TEST(WhitelistTest, TheBuildVariantSwitchesItOff) {
  testing::FakeBuildVariant variant;
  const testing::RecordingLog log;
  for (const bool internal : {true, false}) {
    variant.internal = internal;
    EXPECT_EQ(shouldUseStringWhitelist(variant), !internal);
  }
  EXPECT_EQ(log.lines(), (std::vector<std::string>{"Not using string whitelist due to os_flavor",
                                                   "Defaulting to using string whitelist"}));
  EXPECT_EQ(variant.lastSubsystem, "com.vantor.tessel");
}

TEST(WhitelistTest, AllThreeNamesMakePerfLogging) {
  const SharedString subsystem("com.vantor.PerformanceAnalysis");
  const SharedString category("PerfLogging");
  const SharedString name("PerfLoggingOperation");
  const SharedString other("perfLogging");
  EXPECT_TRUE(isPerfLoggingOperation(subsystem, category, name));
  for (const StringRef wrong : {StringRef(other), StringRef()}) {
    EXPECT_FALSE(isPerfLoggingOperation(wrong, category, name));
    EXPECT_FALSE(isPerfLoggingOperation(subsystem, wrong, name));
    EXPECT_FALSE(isPerfLoggingOperation(subsystem, category, wrong));
  }
}

TEST(PlatformProfileTest, NamesAndCodesBelongTogether) {
  for (uint64_t code = 0; code <= 5; ++code) {
    const auto platform = static_cast<Platform>(code);
    EXPECT_EQ(platformFromName(SharedString(nameForPlatform(platform))), platform);
  }
  EXPECT_EQ(nameForPlatform(currentPlatform()), "Selvin");
  EXPECT_EQ(nameForPlatform(static_cast<Platform>(6)), "Unknown");
  EXPECT_EQ(platformFromName(SharedString("selvin")), Platform::unknown);
  EXPECT_EQ(platformFromName({}), Platform::unknown);
}

}  // namespace
}  // namespace tessel
