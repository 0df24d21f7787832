// Finding the bundle that holds an executable.

#include "objects/ProcessIdentity.h"

#include <gtest/gtest.h>

#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

class ProcessIdentityTest : public ::testing::Test {
 protected:
  // The identifier for the path, or "none" if it has no bundle.
  std::string lookUp(const std::string& path) {
    return std::string(identity.bundleIdentifierForImagePath(SharedString(path)).textOr("none"));
  }

  testing::FakeBundles bundles;
  ProcessIdentity identity{bundles};
};

TEST_F(ProcessIdentityTest, TheNearestNamedDirectoryWins) {
  const struct {
    const char* path;
    const char* bundle;
    bool found;
  } cases[] = {{"/apps/ID/Foo.app/Foo", "/apps/ID/Foo.app", true},
               {"/x/Foo.app/a/b/Foo", "/x/Foo.app", true},
               // The nearest match decides, even if it is no bundle.
               {"/x/Foo.app/Foo.noBundle/Foo", "/x/Foo.app", false},
               {"/x/Foo.framework/Foo", "/x/Foo.framework", true},
               {"Foo.app/Foo", "Foo.app", true},
               {"/x/Foo/Foo", "/x/Foo", false},
               {"/x/foo.app/Foo", "/x/foo.app", false},
               {"/x/Foobar.app/Foo", "/x/Foobar.app", false},
               {"/x/Foo./Foo", "/x/Foo.", true},
               {"/x/Foo.app//Foo/", "/x/Foo.app", true},
               {"/x/Foo", "/x", false},
               {"//Foo", "/", false},
               {"/", "/", false},
               {"Foo/", "", false},
               {"", "", false}};
  for (const auto& row : cases) {
    bundles.identifiers = {{row.bundle, "id"}};
    EXPECT_EQ(lookUp(row.path), row.found ? "id" : "none") << row.path;
  }
}

TEST_F(ProcessIdentityTest, OpensOnlyADirectoryWithItsName) {
  lookUp("/opt/lib/tool");
  lookUp("/Foo");
  EXPECT_TRUE(bundles.asked.empty());
  lookUp("/a/Foo.app/Foo.b/c/Foo");
  EXPECT_EQ(bundles.asked, std::vector<std::string>{"/a/Foo.app/Foo.b"});
}

TEST_F(ProcessIdentityTest, LooksAHundredDirectoriesUp) {
  bundles.identifiers["/Foo.app"] = "bundle";
  const auto imageBelow = [](int directories) {
    std::string path = "/Foo.app";
    for (int i = 0; i < directories; ++i) path += "/d";
    return path + "/Foo";
  };
  EXPECT_EQ(lookUp(imageBelow(99)), "bundle");
  EXPECT_EQ(lookUp(imageBelow(100)), "none");
}

TEST_F(ProcessIdentityTest, KeepsAnswersAndLogsFinds) {
  const testing::RecordingLog log;
  bundles.identifiers["/x/Foo.app"] = "com.vantor.Foo";
  for (int i = 0; i < 2; ++i) {
    EXPECT_EQ(lookUp("/x/Foo.app/Foo"), "com.vantor.Foo");
    EXPECT_EQ(lookUp("/x/Bar.app/Bar"), "none");
    EXPECT_FALSE(identity.bundleIdentifierForImagePath({}).present());
    // A bundle that changes later does not change the answer.
    bundles.identifiers = {{"/x/Bar.app", "com.vantor.Bar"}};
  }
  EXPECT_EQ(bundles.asked.size(), 2u);
  EXPECT_EQ(log.lines(), std::vector<std::string>{
                             "Found bundle ID: \"com.vantor.Foo\" for path:\"/x/Foo.app/Foo\""});
}

TEST_F(ProcessIdentityTest, AFullCacheStillAnswers) {
  bundles.identifiers["/x/Foo.app"] = "com.vantor.Foo";
  const std::string deep(4000, 'd');
  const auto asked = [&](const std::string& path) {
    bundles.asked.clear();
    EXPECT_EQ(lookUp(path), "com.vantor.Foo");
    return bundles.asked.size();
  };
  asked("/x/Foo.app/first/Foo");
  for (int i = 0; i < 2000; ++i) lookUp("/x/Bar.app/" + std::to_string(i) + deep + "/Bar");
  EXPECT_EQ(asked("/x/Foo.app/first/Foo"), 0u);
  // Short paths have room for longer, but not without end.
  for (int i = 0; i < 100'000; ++i) lookUp("/" + std::to_string(i));
  EXPECT_EQ(asked("/x/Foo.app/last/Foo"), 1u);
  EXPECT_EQ(asked("/x/Foo.app/last/Foo"), 1u);
  EXPECT_EQ(asked("/x/Foo.app/first/Foo"), 0u);
}

}  // namespace
}  // namespace tessel
