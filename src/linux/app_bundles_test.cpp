// Identifiers of application directories, some of them not meant well.

#include "linux/AppBundles.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>

#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using testing::TemporaryDirectory;

constexpr const char* kClock = "<component><id>com.vantor.Clock</id></component>";

std::optional<std::string> identifierAt(const std::string& directory) {
  MountTable mounts;
  return AppBundles(mounts).bundleIdentifier(directory);
}

std::optional<std::string> identifierOf(const std::map<std::string, std::string>& files) {
  const TemporaryDirectory bundle;
  for (const auto& [name, text] : files) bundle.write(name, text);
  return identifierAt(bundle.path());
}

TEST(AppBundlesTest, TheOneMetadataFileNamesTheBundle) {
  const std::string info = "usr/share/metainfo/";
  EXPECT_EQ(identifierOf({{info + "x.metainfo.xml", kClock}}), "com.vantor.Clock");
  EXPECT_EQ(identifierOf({{info + "x.appdata.xml", kClock}}), "com.vantor.Clock");
  EXPECT_EQ(
      identifierOf(
          {{info + "x.metainfo.xml", kClock}, {info + "README", ""}, {info + "y.xml", kClock}}),
      "com.vantor.Clock");
  EXPECT_EQ(identifierOf({{info + "x.metainfo.xml", kClock}, {"com.vantor.Other.desktop", ""}}),
            "com.vantor.Clock");
  EXPECT_EQ(identifierOf({{info + "x.metainfo.xml", kClock}, {info + "y.appdata.xml", kClock}}),
            std::nullopt);
  EXPECT_EQ(identifierOf({}), std::nullopt);
  EXPECT_EQ(identifierAt("/nowhere/Clock.AppDir"), std::nullopt);
}

TEST(AppBundlesTest, UnusableMetadataLetsTheDesktopFileSpeak) {
  const std::string deep(100'000, '<');
  const struct {
    std::string xml;
    std::optional<std::string> identifier;
  } kCases[] = {
      {"<?xml version=\"1.0\"?><!-- c --><component type=\"desktop\"><name>n</name>"
       "<id>\n  com.vantor.Clock-2_x\n</id><id>com.vantor.Second</id></component>",
       "com.vantor.Clock-2_x"},
      {"<component><provides><id>com.vantor.Inner</id></provides></component>", {}},
      {"<component></component>", {}},
      {"<component><id/></component>", {}},
      {"<component><id>com vantor</id></component>", {}},
      {"<component><id>../com.vantor</id></component>", {}},
      {"<component><id>" + std::string(255, 'a') + "</id></component>", std::string(255, 'a')},
      {"<component><id>" + std::string(256, 'a') + "</id></component>", {}},
      {"<application><id>com.vantor.Clock</id></application>", {}},
      {"<component><id>com.vantor.Clock</id>", {}},
      {"<component><id>com.vantor.Clock</name></component>", {}},
      {std::string(kClock) + kClock, {}},
      {"<!DOCTYPE component [<!ENTITY e SYSTEM \"file:///etc/hostname\">]>"
       "<component><id>&e;</id></component>",
       {}},
      {"<!DOCTYPE component [<!ENTITY e \"com.vantor.Clock\">]><component><id>&e;</id></component>",
       {}},
      {"", {}},
      {deep, {}},
  };
  for (const auto& [xml, identifier] : kCases) {
    EXPECT_EQ(identifierOf(
                  {{"usr/share/metainfo/x.metainfo.xml", xml}, {"com.vantor.Desktop.desktop", ""}}),
              identifier.value_or("com.vantor.Desktop"))
        << xml.substr(0, 100);
  }
}

TEST(AppBundlesTest, MetadataMayTakeOneMebibyte) {
  const std::string comment = std::string(kClock) + "<!--";
  const auto padded = [&](size_t size) {
    return comment + std::string(size - comment.size() - 3, ' ') + "-->";
  };
  EXPECT_EQ(identifierOf({{"usr/share/metainfo/x.metainfo.xml", padded(1 << 20)}}),
            "com.vantor.Clock");
  EXPECT_EQ(identifierOf({{"usr/share/metainfo/x.metainfo.xml", padded((1 << 20) + 1)}}),
            std::nullopt);
}

TEST(AppBundlesTest, ALoneDesktopFileNamesTheBundle) {
  const struct {
    const char* file;
    std::optional<std::string> identifier;
  } kCases[] = {
      {"com.vantor.Clock.desktop", "com.vantor.Clock"},
      {"com.vantor-works.Clock_2.desktop", "com.vantor-works.Clock_2"},
      {"Clock.desktop", {}},
      {".desktop", {}},
      {".com.vantor.Clock.desktop", {}},
      {"com..Clock.desktop", {}},
      {"com.vantor..desktop", {}},
      {"Clock-1.2.desktop", {}},
      {"com.vantor.Clo ck.desktop", {}},
      {"com.vantor.Clock.DESKTOP", {}},
      {"usr/com.vantor.Clock.desktop", {}},
  };
  for (const auto& [file, identifier] : kCases)
    EXPECT_EQ(identifierOf({{file, ""}}), identifier) << file;
  EXPECT_EQ(identifierOf({{"com.vantor.Clock.desktop", ""}, {"com.vantor.Other.desktop", ""}}),
            std::nullopt);
}

TEST(AppBundlesTest, ADirectoryWithTooManyEntriesHasNoIdentifier) {
  const TemporaryDirectory bundle;
  bundle.write("com.vantor.Clock.desktop", "");
  bundle.write("1", "");
  const auto add = [&](int number) {
    std::filesystem::create_hard_link(bundle.path("1"), bundle.path(std::to_string(number)));
  };
  for (int i = 2; i < 10'000; ++i) add(i);
  EXPECT_EQ(identifierAt(bundle.path()), "com.vantor.Clock");
  add(10'000);
  EXPECT_EQ(identifierAt(bundle.path()), std::nullopt);
}

TEST(AppBundlesTest, OnlyRegularFilesOfTheTreeAreOpened) {
  const TemporaryDirectory outside;
  outside.write("x.metainfo.xml", kClock);
  const std::string metadata = "usr/share/metainfo/x.metainfo.xml";
  const struct {
    std::string target;  // of a link at `metadata`
    bool followed;
  } kLinks[] = {
      {"../clock", true},
      {"..//./../share/clock", true},
      {"../../../usr/share/metainfo/../clock", true},
      {"../applications/link", true},
      {"../applications/self", false},
      {"../missing", false},
      {"../../../../x.metainfo.xml", false},
      {outside.path("x.metainfo.xml"), false},
      {"../applications", false},
      {"../applications/pipe", false},
  };
  for (const auto& [target, followed] : kLinks) {
    const TemporaryDirectory parent;
    const std::string bundle = parent.path("Clock.AppDir");
    parent.write("x.metainfo.xml", kClock);
    parent.write("Clock.AppDir/com.vantor.Desktop.desktop", "");
    parent.write("Clock.AppDir/usr/share/clock", kClock);
    const std::string applications = bundle + "/usr/share/applications";
    std::filesystem::create_directories(applications);
    std::filesystem::create_directories(bundle + "/usr/share/metainfo");
    std::filesystem::create_symlink("../clock", applications + "/link");
    std::filesystem::create_symlink("self", applications + "/self");
    ASSERT_EQ(::mkfifo((applications + "/pipe").c_str(), 0600), 0);
    std::filesystem::create_symlink(target, bundle + '/' + metadata);
    EXPECT_EQ(identifierAt(bundle), followed ? "com.vantor.Clock" : "com.vantor.Desktop") << target;
  }
}

// Each of the links has a long way that leads to no file.
TEST(AppBundlesTest, LinksWithoutEndLeaveABundleUnclear) {
  const TemporaryDirectory bundle;
  bundle.write("com.vantor.Clock.desktop", "");
  std::string way;
  for (int i = 0; i < 2000; ++i) way += "./";
  const auto link = [&](int number) {
    std::filesystem::create_symlink(way, bundle.path(std::to_string(number) + ".desktop"));
  };
  for (int i = 0; i < 4; ++i) link(i);
  EXPECT_EQ(identifierAt(bundle.path()), "com.vantor.Clock");
  for (int i = 4; i < 6; ++i) link(i);
  EXPECT_EQ(identifierAt(bundle.path()), std::nullopt);
}

TEST(AppBundlesTest, LinksOnTheWayToTheBundleAreFollowed) {
  const TemporaryDirectory directory;
  directory.write("real/Clock.AppDir/com.vantor.Clock.desktop", "");
  const std::string real = directory.path("real");
  const struct {
    std::string target;  // of "link" beside "real"
    std::string path;
    bool found;
  } kWays[] = {
      {"real", "/link/Clock.AppDir", true},
      {real + "/", "/link/Clock.AppDir/", true},
      {"real/../real/./Clock.AppDir", "/link/../Clock.AppDir", true},
      {"/../../" + real, "/link/Clock.AppDir", true},
      {"link", "/link/Clock.AppDir", false},
      {"link/link", "/link/Clock.AppDir", false},
      {"real", std::string("/link/Clock.AppDir\0x", 20), false},
  };
  for (const auto& [target, path, found] : kWays) {
    std::filesystem::remove(directory.path("link"));
    std::filesystem::create_symlink(target, directory.path("link"));
    EXPECT_EQ(identifierAt(directory.path() + path).has_value(), found) << target;
  }
}

// A table in which a mount of a server's type stands where in truth there is none. That the
// directory is not touched cannot be seen from here, but its answer would be found if it were.
TEST(AppBundlesTest, MountsThatAreNotLocalAreLeftAlone) {
  const TemporaryDirectory directory;
  directory.write("apps/Clock.AppDir/com.vantor.Clock.desktop", "");
  std::filesystem::create_symlink("apps", directory.path("link"));
  std::stringstream kernels;
  kernels << std::ifstream("/proc/self/mountinfo").rdbuf();
  const std::string apps = directory.path("apps");
  const struct {
    std::string mount;  // "POINT - TYPE"
    bool found;
  } kTables[] = {
      {"/elsewhere rw - nfs4", true},
      {apps + " rw - ext4", true},
      {apps + "/Clock.AppDir/usr rw - nfs", true},
      {apps + " rw shared:1 - nfs4", false},
      {apps + " rw - autofs", false},
      {apps + " rw - fuse.clock", false},
      {apps + " rw - someday", false},
      {apps + "/Clock.AppDir rw - 9p", false},
      {apps + "/Clock.AppDir/com.vantor.Clock.desktop rw - fuse", false},
      {"/ rw - nfs", true},  // its id is not that of "/"
  };
  for (const auto& [mount, found] : kTables) {
    MountTable mounts(directory.write(
        "mountinfo", kernels.str() + "900001 1 0:99 / " + mount + " server:/ rw\n"));
    for (const char* way : {"/apps/Clock.AppDir", "/link/Clock.AppDir"})
      EXPECT_EQ(AppBundles(mounts).bundleIdentifier(directory.path() + way).has_value(), found)
          << mount << way;
  }
  MountTable none(directory.path("none"));
  EXPECT_EQ(AppBundles(none).bundleIdentifier(apps + "/Clock.AppDir"), std::nullopt);
}

}  // namespace
}  // namespace tessel
