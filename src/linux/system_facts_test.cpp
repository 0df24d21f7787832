// Root volume, build variant and dates, from files as they are found on machines.

#include <gtest/gtest.h>

#include "linux/SystemFacts.h"
#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using testing::TemporaryDirectory;

TEST(MountTableTest, TheTopmostMountAtTheRootCounts) {
  const std::string kOthers =
      "22 27 0:21 / /proc rw,relatime - proc proc rw\n"
      "27 1 254:0 / /var/my\\040disk rw - xfs /dev/vdb rw\n";
  const struct {
    const char* table;
    std::optional<std::string> type;
  } kCases[] = {
      {"27 1 254:0 / / rw,relatime - ext4 /dev/vda rw,discard\n", "ext4"},
      {"27 1 254:0 /@ / rw shared:1 master:2 - btrfs /dev/vda rw\n", "btrfs"},
      {"1 1 0:1 / / rw - rootfs rootfs rw\n27 1 0:24 / / rw shared:1 - overlay overlay "
       "rw,lowerdir=/x\n",
       "overlay"},
      {"27 1 0:44 / / rw - fuse.odd\\040name - src rw\n", "fuse.odd name"},
      {"27 1 0:44 / / rw - a\\134b\\1 src rw\n", "a\\b\\1"},
      {"27 1 0:44 / / rw - \xff\xfe src rw\n", "\xff\xfe"},
      {"27 1 254:0 / / rw,relatime -\n", std::nullopt},
      {"27 1 254:0 / / rw,relatime shared:1\n", std::nullopt},
      {"27 1 254:0 /\n", std::nullopt},
      {"", std::nullopt},
  };
  const TemporaryDirectory directory;
  for (const auto& [table, type] : kCases) {
    EXPECT_EQ(MountTable(directory.write("mountinfo", table + kOthers)).rootFilesystemTypeName(),
              type)
        << table;
  }
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

TEST(BuildVariantTest, TheFileIsReadOnce) {
  const TemporaryDirectory directory;
  OsReleaseBuildVariant variant(directory.write("os-release", "VARIANT_ID=internal\n"));
  directory.write("os-release", "");
  EXPECT_TRUE(variant.hasInternalDiagnostics("com.vantor.tessel"));
}

TEST(IcuDatesTest, FormatsByLocaleAndTimeZone) {
  const Date date{std::chrono::seconds{1'795'000'000} + std::chrono::microseconds{999'999}};
  EXPECT_EQ(IcuDates("de_DE.UTF-8", "UTC").format(date), "18.11.26, 11:06:40");
  EXPECT_EQ(IcuDates("de_DE.UTF-8", "Asia/Kolkata").format(date), "18.11.26, 16:36:40");
  EXPECT_EQ(IcuDates("en_GB", "UTC").format(date), "18/11/2026, 11:06:40");
  EXPECT_EQ(IcuDates("de_DE", "UTC").format(Date{std::chrono::microseconds{-1}}),
            "31.12.69, 23:59:59");
  EXPECT_NE(IcuDates().format(date), "");
  EXPECT_EQ(IcuDates("no such locale!", "UTC").format(date), IcuDates("C", "UTC").format(date));
  EXPECT_NE(IcuDates("xx_YY", "no such zone").format(date), "");
}

}  // namespace
}  // namespace tessel
