// Identifiers of application directories, some of them not meant well.

#include "linux/AppBundles.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <map>

#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using testing::TemporaryDirectory;

constexpr const char* kClock = "<component><id>com.vantor.Clock</id></component>";

std::optional<std::string> identifierOf(const std::map<std::string, std::string>& files) {
  const TemporaryDirectory bundle;
  for (const auto& [name, text] : files) bundle.write(name, text);
  return AppBundles().bundleIdentifier(bundle.path());
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
  EXPECT_EQ(AppBundles().bundleIdentifier("/nowhere/Clock.AppDir"), std::nullopt);
}

TEST(AppBundlesTest, MetadataIsWellFormedAndHasAnId) {
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
              identifier)
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

TEST(AppBundlesTest, OnlyFilesAndLinksToThemAreOpened) {
  const TemporaryDirectory bundle;
  bundle.write("usr/share/applications/clock", "");
  std::filesystem::create_symlink("usr/share/applications/clock",
                                  bundle.path("com.vantor.Clock.desktop"));
  EXPECT_EQ(AppBundles().bundleIdentifier(bundle.path()), "com.vantor.Clock");
  // Opening a pipe that nobody writes to would wait for ever.
  std::filesystem::create_directories(bundle.path("usr/share/metainfo"));
  ASSERT_EQ(::mkfifo(bundle.path("usr/share/metainfo/x.metainfo.xml").c_str(), 0600), 0);
  EXPECT_EQ(AppBundles().bundleIdentifier(bundle.path()), "com.vantor.Clock");
}

}  // namespace
}  // namespace tessel
