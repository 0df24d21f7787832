// The lists, the sets built from them and the rules of the lookup.

#include "whitelist/StringWhitelist.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <set>

#include "platform/testing/Fakes.h"
#include "whitelist/WhitelistLists.h"

namespace tessel {
namespace {

using Platform = TesselReporterPlatform;

bool isKnown(std::string_view value, Platform platform) {
  return stringIsWhitelisted(SharedString(value), platform);
}

struct ListCase {
  const char* name;
  StringList list;
  size_t entries;
  size_t distinct;
};

const std::vector<ListCase>& allLists() {
  static const std::vector<ListCase> lists = {
      {"components", perfLoggingComponentNames(), 75, 70},
      {"actions", perfLoggingActionNames(), 70, 69},
      {"desktop bundles", desktopBundleIdentifiers(), 774, 774},
      {"file system scans", fileSystemScanValues(), 25, 25},
      {"common", commonWhitelistValues(), 2, 2},
      {"launch sources", launchSourceValues(), 32, 32},
      {"camera", cameraValues(), 28, 28},
      {"share activities", shareActivityTypes(), 27, 27},
      {"extensions", extensionBundleIdentifiers(), 214, 214},
      {"periods", periodViewValues(), 6, 6},
      {"sizes", sizeValues(), 4, 4},
      {"mail accounts", mailAccountKindValues(), 10, 10},
      {"generation sources", generationSourceValues(), 4, 4},
  };
  return lists;
}

TEST(WhitelistListsTest, EachListHasItsSizeAndSharesNothing) {
  std::map<std::string_view, const char*> owner;
  for (const auto& row : allLists()) {
    const std::set<std::string_view> distinct(row.list.begin(), row.list.end());
    EXPECT_EQ(row.list.size(), row.entries) << row.name;
    EXPECT_EQ(distinct.size(), row.distinct) << row.name;
    for (const auto text : distinct) {
      EXPECT_TRUE(owner.emplace(text, row.name).second)
          << text << " in " << row.name << " and " << owner[text];
      EXPECT_FALSE(text.empty()) << row.name;
    }
  }
}

TEST(WhitelistListsTest, ShortListsAndPatternsHold) {
  const auto isOwn = [](std::string_view text) { return text.starts_with("com.vantor."); };
  EXPECT_TRUE(std::ranges::all_of(desktopBundleIdentifiers(), isOwn));
  EXPECT_TRUE(std::ranges::all_of(shareActivityTypes(), isOwn));
  EXPECT_EQ(std::ranges::count_if(extensionBundleIdentifiers(), isOwn), 51);

  std::vector<std::string> camera{"CameraLaunchIconTouch", "CameraLaunchWithoutPrewarm",
                                  "StillImageCaptureNow", "modeChange"};
  for (const char a : {'2', '3', '4'}) {
    for (const char b : {'1', '2'}) {
      for (const char c : {'0', '1'}) {
        for (const char d : {'0', '1'}) camera.push_back({a, ',', b, ',', c, ',', d});
      }
    }
  }
  EXPECT_TRUE(std::ranges::equal(cameraValues(), camera));

  const struct {
    StringList list;
    std::vector<std::string_view> values;
  } shortLists[] = {
      {commonWhitelistValues(), {"Root", "Ext"}},
      {periodViewValues(), {"day", "week", "month", "year", "list", "unknown"}},
      {sizeValues(), {"small", "medium", "large", "none"}},
      {generationSourceValues(), {"generationContext", "file", "generator", "cache"}},
  };
  for (const auto& row : shortLists) EXPECT_TRUE(std::ranges::equal(row.list, row.values));
}

TEST(StringWhitelistTest, EachPlatformKnowsTheUnionOfItsLists) {
  const struct {
    Platform platform;
    size_t size;
    std::set<std::string> lists;
  } cases[] = {
      {Platform::unknown, 0, {}},
      {Platform::quarro,
       940,
       {"components", "actions", "desktop bundles", "file system scans", "common"}},
      {Platform::selvin,
       327,
       {"launch sources", "camera", "share activities", "extensions", "periods", "sizes",
        "mail accounts", "generation sources", "common"}},
      {Platform::darrow, 2, {"common"}},
      {Platform::fennic, 2, {"common"}},
      {Platform::lumet, 0, {}},
      {static_cast<Platform>(6), 0, {}},
  };
  for (const auto& row : cases) {
    EXPECT_EQ(stringWhitelistForPlatform(row.platform).size(), row.size);
    for (const auto& list : allLists()) {
      for (const auto text : list.list) {
        EXPECT_EQ(isKnown(text, row.platform), row.lists.contains(list.name))
            << text << " of " << list.name << " on " << nameForPlatform(row.platform);
      }
    }
    EXPECT_FALSE(stringIsWhitelisted({}, row.platform));
  }
}

TEST(StringWhitelistTest, MembershipIsExact) {
  for (const char* value : {"Week", "week ", "wee", "", "1,1,0,0", "5,1,0,0", "2,1,0,2"}) {
    EXPECT_FALSE(isKnown(value, Platform::selvin)) << value;
  }
  EXPECT_TRUE(isKnown("2,2,1,0", Platform::selvin));
}

// Asks twice in a process of its own, where nothing was asked before, and prints the log.
[[noreturn]] void printLinesOfTwoLookups(Platform platform) {
  const testing::RecordingLog log;
  isKnown("week", platform);
  isKnown("week", platform);
  for (const auto& line : log.lines()) std::fprintf(stderr, "[%s]", line.c_str());
  std::exit(0);
}

TEST(StringWhitelistDeathTest, ASetSaysItsSizeOnceAndLumetOnEveryLookup) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const struct {
    Platform platform;
    const char* lines;
  } cases[] = {
      {Platform::unknown, "\\[Using string whitelist with 0 elements for Unknown platform\\]"},
      {Platform::quarro, "\\[Using string whitelist with 940 elements for Quarro platform\\]"},
      {Platform::selvin, "\\[Using string whitelist with 327 elements for Selvin platform\\]"},
      {Platform::darrow, "\\[Using string whitelist with 2 elements for Darrow platform\\]"},
      {Platform::fennic, "\\[Using string whitelist with 2 elements for Fennic platform\\]"},
      {Platform::lumet,
       "\\[Using string whitelist with 0 elements for Lumet platform\\]"
       "\\[Using string whitelist with 0 elements\\]\\[Using string whitelist with 0 elements\\]"},
  };
  for (const auto& row : cases) {
    EXPECT_EXIT(printLinesOfTwoLookups(row.platform), ::testing::ExitedWithCode(0),
                std::string("^") + row.lines + "$");
  }
}

TEST(StringWhitelistTest, TheBuildVariantSwitchesItOff) {
  testing::FakeBuildVariant variant;
  for (const bool internal : {true, false}) {
    const testing::RecordingLog log;
    variant.internal = internal;
    EXPECT_EQ(shouldUseStringWhitelist(variant), !internal);
    EXPECT_EQ(shouldUseStringWhitelist(variant), !internal);
    const char* line = internal ? "Not using string whitelist due to os_flavor"
                                : "Defaulting to using string whitelist";
    EXPECT_EQ(log.lines(), (std::vector<std::string>{line, line}));
  }
  EXPECT_EQ(variant.asked, 4u);
  EXPECT_EQ(variant.lastSubsystem, "com.vantor.tessel");
}

TEST(StringWhitelistTest, APerfLoggingOperationIsKnownByAllThreeStrings) {
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

}  // namespace
}  // namespace tessel
