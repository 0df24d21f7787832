// Finding the bundle that holds an executable.

#include "objects/ProcessIdentity.h"

#include <gtest/gtest.h>

#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

class ProcessIdentityTest : public ::testing::Test {
 protected:
  // The identifier for the path, "none" where there is none.
  std::string lookUp(const std::string& path) {
    return std::string(identity.bundleIdentifierForImagePath(SharedString(path)).textOr("none"));
  }

  testing::FakeBundles bundles;
  ProcessIdentity identity{bundles};
};

TEST_F(ProcessIdentityTest, TheNearestDirectoryNamedAfterTheImageDecides) {
  bundles.identifiers = {{"/apps/ID/Foo.app", "near"},
                         {"/x/Foo.app", "far"},
                         {"/y/Foo.app", "behind"},
                         {"Foo.app", "relative"},
                         {"/z/Foo.framework", "framework"},
                         {"/p/Foo", "plain"},
                         {"/p/foo.app", "case"},
                         {"/p/Foobar.app", "longer"},
                         {"/t/Foo.app", "trailing"},
                         {"/r/Foo.", "dot"}};
  const struct {
    const char* path;
    const char* identifier;
  } cases[] = {{"/apps/ID/Foo.app/Foo", "near"},
               {"/x/Foo.app/a/b/Foo", "far"},
               // The first match decides, even where it is no bundle.
               {"/y/Foo.app/Foo.noBundle/Foo", "none"},
               {"/z/Foo.framework/Foo", "framework"},
               {"Foo.app/Foo", "relative"},
               {"/p/Foo/Foo", "none"},
               {"/p/foo.app/Foo", "none"},
               {"/p/Foobar.app/Foo", "none"},
               {"/r/Foo./Foo", "dot"},
               {"/t/Foo.app//Foo/", "trailing"},
               {"/opt/lib/tool", "none"},
               {"/Foo", "none"},
               {"//Foo", "none"},
               {"/", "none"},
               {"Foo", "none"},
               {"Foo/", "none"},
               {"", "none"}};
  for (const auto& row : cases) EXPECT_EQ(lookUp(row.path), row.identifier) << row.path;
}

TEST_F(ProcessIdentityTest, NothingIsOpenedButTheDirectoryThatIsNamedAfterTheImage) {
  lookUp("/opt/lib/tool");
  lookUp("/Foo");
  EXPECT_TRUE(bundles.asked.empty());
  lookUp("/a/Foo.app/Foo.b/c/Foo");
  EXPECT_EQ(bundles.asked, std::vector<std::string>{"/a/Foo.app/Foo.b"});
}

TEST_F(ProcessIdentityTest, OnlyTheFirstHundredDirectoriesAreExamined) {
  bundles.identifiers["/Foo.app"] = "bundle";
  const auto imageBelow = [](int directories) {
    std::string path = "/Foo.app";
    for (int i = 0; i < directories; ++i) path += "/d";
    return path + "/Foo";
  };
  EXPECT_EQ(lookUp(imageBelow(99)), "bundle");
  EXPECT_EQ(lookUp(imageBelow(100)), "none");
}

TEST_F(ProcessIdentityTest, EveryAnswerIsKeptAndOnlyAFindIsLogged) {
  const testing::RecordingLog log;
  bundles.identifiers["/x/Foo.app"] = "com.vantor.Foo";
  for (int i = 0; i < 2; ++i) {
    EXPECT_EQ(lookUp("/x/Foo.app/Foo"), "com.vantor.Foo");
    EXPECT_EQ(lookUp("/x/Bar.app/Bar"), "none");
    EXPECT_FALSE(identity.bundleIdentifierForImagePath({}).present());
    // What the file system says later changes nothing.
    bundles.identifiers = {{"/x/Bar.app", "com.vantor.Bar"}};
  }
  EXPECT_EQ(bundles.asked.size(), 2u);
  EXPECT_EQ(log.lines(), std::vector<std::string>{
                             "Found bundle ID: \"com.vantor.Foo\" for path:\"/x/Foo.app/Foo\""});
}

}  // namespace
}  // namespace tessel
