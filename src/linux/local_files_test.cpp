// The marker file's needs of a file system, on a real one.

#include "linux/StateDirectory.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>

#include "os/UniqueFd.h"
#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using testing::TemporaryDirectory;
namespace fs = std::filesystem;

class LocalFilesTest : public ::testing::Test {
 protected:
  TemporaryDirectory directory_;
  LocalFiles files_;
  const std::string path_ = directory_.path("marker");
};

TEST_F(LocalFilesTest, ALinkCountsAsWhatItIs) {
  const auto existence = [&] {
    const FileExistence found = files_.existence(path_);
    return std::pair(found.exists, found.isDirectory);
  };
  EXPECT_EQ(existence(), std::pair(false, false));
  fs::create_symlink("/nowhere", path_);
  EXPECT_EQ(existence(), std::pair(true, false));
  fs::remove(path_);
  fs::create_directory_symlink("/tmp", path_);
  EXPECT_EQ(existence(), std::pair(true, false));
  fs::remove(path_);
  fs::create_directory(path_);
  EXPECT_EQ(existence(), std::pair(true, true));
}

TEST_F(LocalFilesTest, AFileIsMadeOnlyWhereNothingIs) {
  EXPECT_FALSE(files_.createFile(path_));
  EXPECT_EQ(fs::file_size(path_), 0u);
  directory_.write("marker", "kept");
  EXPECT_TRUE(files_.createFile(path_));
  EXPECT_EQ(directory_.read("marker"), "kept");
  fs::remove(path_);
  fs::create_symlink(directory_.path("target"), path_);
  EXPECT_TRUE(files_.createFile(path_));
  EXPECT_FALSE(fs::exists(directory_.path("target"))) << "a file was made through a link";
  EXPECT_TRUE(files_.createFile(directory_.path("missing/marker")));
}

TEST_F(LocalFilesTest, RemovalFollowsNoLink) {
  directory_.write("outside/file", "kept");
  directory_.write("marker/a/b/file", "");
  directory_.write("marker/file", "");
  fs::create_directory_symlink(directory_.path("outside"), path_ + "/a/link");
  fs::create_symlink("/nowhere", path_ + "/dangling");
  ASSERT_EQ(::mkfifo((path_ + "/fifo").c_str(), 0600), 0);
  const RemovalResult result = files_.remove(path_);
  EXPECT_TRUE(result.removed && !result.error) << result.error->words;
  EXPECT_FALSE(fs::exists(path_));
  EXPECT_EQ(directory_.read("outside/file"), "kept");

  fs::create_directory_symlink(directory_.path("outside"), path_);
  EXPECT_TRUE(files_.remove(path_).removed);
  EXPECT_EQ(directory_.read("outside/file"), "kept");
}

TEST_F(LocalFilesTest, AFailedRemovalSaysWhatAndWhy) {
  const RemovalResult result = files_.remove(path_);
  EXPECT_FALSE(result.removed);
  EXPECT_EQ(result.error->words, path_ + ": No such file or directory");
  EXPECT_EQ(result.error->code, ErrorCode::notFound);
  EXPECT_EQ(files_.remove(directory_.path("missing/marker")).error->words,
            directory_.path("missing") + ": No such file or directory");
}

TEST_F(LocalFilesTest, RemovalEndsAtItsDepthLimit) {
  UniqueFd level(::open(directory_.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  const char* name = "marker";
  for (int depth = 0; depth <= LocalFiles::kMaxRemovalDepth; ++depth) {
    ASSERT_EQ(::mkdirat(level.get(), name, 0700), 0);
    level = UniqueFd(::openat(level.get(), name, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    name = "d";
  }
  const RemovalResult result = files_.remove(path_);
  EXPECT_FALSE(result.removed);
  ASSERT_TRUE(result.error);
  EXPECT_THAT(result.error->words, ::testing::EndsWith("/d/d: nested too deeply"));
  fs::rename(path_ + "/d", directory_.path("rest"));
  EXPECT_TRUE(files_.remove(directory_.path("rest")).removed) << "one level less";
}

// Runs in a child process, which gets a mount namespace of its own: status 0 where both removals
// stop at the mount. Users other than root must make a user namespace for that.
[[noreturn]] void removeAcrossMounts(LocalFiles& files, const TemporaryDirectory& directory) {
  const std::string marker = directory.path("marker");
  const int namespaces = ::geteuid() == 0 ? CLONE_NEWNS : CLONE_NEWNS | CLONE_NEWUSER;
  const bool mounted = ::unshare(namespaces) == 0 &&
                       ::mount("", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
                       ::mount(directory.path("outside").c_str(), (marker + "/below").c_str(),
                               nullptr, MS_BIND, nullptr) == 0;
  if (!mounted) {
    std::perror("this test needs root or user namespaces");
    _exit(2);
  }
  const auto isRefused = [&](const std::string& path) {
    const auto error = files.remove(path).error;
    return error && error->words == marker + "/below: something is mounted here";
  };
  const bool below = isRefused(marker);
  const bool above = isRefused(marker + "/below");
  _exit(below && above && directory.read("outside/file") == "kept" ? 0 : 1);
}

TEST_F(LocalFilesTest, RemovalCrossesNoMount) {
  // The other style would run this test anew, with a directory that the child's _exit() leaves.
  GTEST_FLAG_SET(death_test_style, "fast");
  directory_.write("outside/file", "kept");
  fs::create_directories(path_ + "/below");
  EXPECT_EXIT(removeAcrossMounts(files_, directory_), ::testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace tessel
