// Root volume, build variant and dates, from files as they are found on machines.

#include "linux/SystemFacts.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>

#include "os/Files.h"
#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using testing::TemporaryDirectory;

TEST(MountTableTest, TheMountOfTheRootCountsElseTheTopmost) {
  const std::string kOthers =
      "900022 27 0:21 / /proc rw,relatime - proc proc rw\n"
      "900027 1 254:0 / /var/my\\040disk rw - xfs /dev/vdb rw\n";
  const struct {
    const char* table;
    std::optional<std::string> type;
  } kCases[] = {
      {"900027 1 254:0 / / rw,relatime - ext4 /dev/vda rw,discard\n", "ext4"},
      {"900027 1 254:0 /@ / rw shared:1 master:2 - btrfs /dev/vda rw\n", "btrfs"},
      {"900001 1 0:1 / / rw - rootfs rootfs rw\n900027 1 0:24 / / rw shared:1 - overlay overlay "
       "rw,lowerdir=/x\n",
       "overlay"},
      {"900027 1 0:44 / / rw - fuse.odd\\040name - src rw\n", "fuse.odd name"},
      {"900027 1 0:44 / / rw - a\\134b\\1 src rw\n", "a\\b\\1"},
      {"900027 1 0:44 / / rw - \xff\xfe src rw\n", "\xff\xfe"},
      {"900027 1 254:0 / / rw,relatime -\n", std::nullopt},
      {"900027 1 254:0 / / rw,relatime shared:1\n", std::nullopt},
      {"900027 1 254:0 /\n", std::nullopt},
      {"", std::nullopt},
  };
  const TemporaryDirectory directory;
  for (const auto& [table, type] : kCases) {
    EXPECT_EQ(MountTable(directory.write("mountinfo", table + kOthers)).rootFilesystemTypeName(),
              type)
        << table;
  }
  // The process may stand below a mount that somebody put over "/". Then the id tells.
  std::ifstream facts("/proc/self/fdinfo/" + std::to_string(openDirectory("/").release()));
  std::string id;
  while (facts >> id && id != "mnt_id:") {
  }
  ASSERT_TRUE(facts >> id);
  EXPECT_EQ(MountTable(directory.write("mountinfo", id + " 1 0:1 / / rw - xfs a rw\n900001 " + id +
                                                        " 0:2 / / rw - ext4 b rw\n"))
                .rootFilesystemTypeName(),
            "xfs");
  EXPECT_EQ(MountTable(directory.path("none")).rootFilesystemTypeName(), std::nullopt);
}

TEST(BuildVariantTest, TheLastVariantIdCounts) {
  const struct {
    const char* release;
    bool internal;
  } kCases[] = {
      {"ID=vantor\nVARIANT_ID=internal\nVERSION_ID=1\n", true},
      {"VARIANT_ID=\"internal\"", true},
      {"VARIANT_ID='internal' \r\n", true},
      {"VARIANT_ID=server\nVARIANT_ID=internal\n", true},
      {"VARIANT_ID=internal\nVARIANT_ID=server\n", false},
      {"VARIANT_ID=internal\nVARIANT_ID=\n", false},
      {"#VARIANT_ID=internal\n", false},
      {"MY_VARIANT_ID=internal\n", false},
      {"VARIANT=internal\n", false},
      {"VARIANT_ID=Internal\n", false},
      {"VARIANT_ID=\"internal\n", false},
      {"VARIANT_ID=internal-tools\n", false},
      {"", false},
  };
  const TemporaryDirectory directory;
  for (const auto& [release, internal] : kCases) {
    OsReleaseBuildVariant variant(directory.write("os-release", release));
    EXPECT_EQ(variant.hasInternalDiagnostics("com.vantor.tessel"), internal) << release;
  }
  EXPECT_FALSE(
      OsReleaseBuildVariant(directory.path("none")).hasInternalDiagnostics("com.vantor.tessel"));
}

TEST(BuildVariantTest, TheAnswerIsAtMostASecondOld) {
  static int64_t now;
  now = 5000;
  const TemporaryDirectory directory;
  OsReleaseBuildVariant variant(directory.write("os-release", "VARIANT_ID=internal\n"),
                                [] { return now; });
  const auto isInternalAt = [&variant](int64_t milliseconds) {
    now = milliseconds;
    return variant.hasInternalDiagnostics("com.vantor.tessel");
  };
  directory.write("os-release", "");
  EXPECT_TRUE(isInternalAt(5900)) << "the file is not read for every question";
  EXPECT_FALSE(isInternalAt(6000));
  directory.write("os-release", "VARIANT_ID=internal\n");
  EXPECT_FALSE(isInternalAt(6001));
  EXPECT_TRUE(isInternalAt(7000));
}

TEST(IcuDatesTest, FormatsByLocaleAndTimeZone) {
  const auto formatted = [](const char* zone, const char* locale, Date date) {
    ::setenv("TZ", zone, 1);
    return IcuDates(locale).format(date);
  };
  const Date autumn{std::chrono::seconds{1'795'000'000} + std::chrono::microseconds{999'999}};
  const Date summer{std::chrono::seconds{1'785'000'000}};
  const char* rule = "CET-1CEST,M3.5.0,M10.5.0/3";
  EXPECT_EQ(formatted("UTC", "de_DE.UTF-8", autumn), "18.11.26, 11:06:40");
  EXPECT_EQ(formatted("Asia/Kolkata", "de_DE.UTF-8", autumn), "18.11.26, 16:36:40");
  EXPECT_EQ(formatted(rule, "de_DE", autumn), "18.11.26, 12:06:40");
  EXPECT_EQ(formatted(rule, "de_DE", summer), "25.07.26, 19:20:00");
  EXPECT_EQ(formatted("no such zone", "en_GB", autumn), "18/11/2026, 11:06:40");
  EXPECT_EQ(formatted("UTC", "de_DE", Date{std::chrono::microseconds{-1}}), "31.12.69, 23:59:59");
  EXPECT_EQ(formatted("UTC", "no such locale!", autumn), formatted("UTC", "C", autumn));
  ::unsetenv("TZ");
  EXPECT_NE(IcuDates().format(autumn), "");
}

}  // namespace
}  // namespace tessel
