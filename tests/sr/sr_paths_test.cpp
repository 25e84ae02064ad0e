// Registry paths and mount points: the syntax check, resolution to a table
// key or file path, directory creation, and the errors of mount and unmount.

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <string>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_paths.h"
#include "qv_sr.h"
#include "sr_row_test_support.h"
#include "storage/sr_i_system_calls.h"

namespace {

using sr_test::last_error;

// Components of letters, digits and underscores; anything else is 102,
// naming the path.
TEST(PathSyntax, OnlyComponentsOfLettersDigitsAndUnderscoresPass) {
  const std::string longest(255, 'a'), too_long(256, 'a');
  for (const char *p_path : {"/a/b", "a", "/", "/a/b/", "/Cfg_2/x9", longest.c_str()}) {
    EXPECT_EQ(sr_i_check_path_syntax(p_path), 0) << p_path;
  }
  for (const char *p_path : {"", too_long.c_str(), "/a b", "/a.b", "/a-b", "/a,b", "/a//b", "//",
                             "/a/./b", "/a\tb", "/caf\xc3\xa9"}) {
    EXPECT_EQ(sr_i_check_path_syntax(p_path), SR_E_INVALID_PATH) << p_path;
    EXPECT_EQ(last_error().second,
              std::string("2605-102 ") + p_path + " is an invalid pathname.\n");
  }
  EXPECT_EQ(sr_i_check_path_syntax(nullptr), SR_E_INVALID_PATH);
  EXPECT_EQ(last_error().second, "2605-102 <NULL POINTER> is an invalid pathname.\n");
}

// A tree with a scratch directory for mount points.
class MountPoints : public ::testing::Test {
 protected:
  void SetUp() override {
    directory_ = std::filesystem::temp_directory_path() /
                 ("sr_mount_" + std::to_string(getpid()) + "_" +
                  ::testing::UnitTest::GetInstance()->current_test_info()->name());
    std::filesystem::remove_all(directory_);
    ASSERT_EQ(sr_open_tree_1(&tree_, 0, 0), 0);
  }
  void TearDown() override {
    Sr_File_System = Sr_Default_File_System;
    EXPECT_EQ(sr_close_tree_1(tree_), 0);
    std::filesystem::remove_all(directory_);
  }
  std::string dir(const std::string &name) const { return (directory_ / name).string(); }
  const sr_i_tree_t *tree() const { return static_cast<sr_i_tree_t *>(tree_); }
  std::pair<std::string, uint32_t> resolve(const char *p_path) const {
    std::string key;
    uint32_t persistent = 99;
    EXPECT_EQ(sr_i_resolve_path(tree(), p_path, key, persistent), 0) << p_path;
    return {key, persistent};
  }

  std::filesystem::path directory_;
  sr_opaque_handle_t tree_ = nullptr;
};

TEST_F(MountPoints, PathsBelowAMountPointResolveToFlatFiles) {
  ASSERT_EQ(sr_mount_local_tree_1(tree_, "/a", dir("d").c_str(), 0), 0);
  EXPECT_EQ(resolve("/a/x/y"), std::make_pair(dir("d") + "/x,y", Sr_Mount_Block_Size));
  EXPECT_EQ(resolve("/a/t"), std::make_pair(dir("d") + "/t", Sr_Mount_Block_Size));
  EXPECT_EQ(resolve("/a"), std::make_pair(std::string("/a"), 0u));
  EXPECT_EQ(resolve("/ab/x"), std::make_pair(std::string("/ab/x"), 0u));
  EXPECT_EQ(resolve("a/x"), std::make_pair(std::string("a/x"), 0u));
}

TEST_F(MountPoints, MountCreatesTheDirectoryWithItsParents) {
  const std::string deep = dir("one/two/three");
  const mode_t umask_now = umask(0);
  umask(umask_now);
  ASSERT_EQ(sr_mount_local_tree_1(tree_, "/cfg", deep.c_str(), 1), 0);
  struct stat status {};
  ASSERT_EQ(stat(deep.c_str(), &status), 0);
  EXPECT_TRUE(S_ISDIR(status.st_mode));
  EXPECT_EQ(status.st_mode & 0777, 0755u & ~umask_now);
  // A directory that exists already is fine, with or without a trailing "/".
  EXPECT_EQ(sr_mount_local_tree_1(tree_, "/other", (deep + "/").c_str(), 0), 0);
}

TEST_F(MountPoints, OverlappingMountsAreRefusedOnlyFromBelow) {
  ASSERT_EQ(sr_mount_local_tree_1(tree_, "/a/b", dir("ab").c_str(), 0), 0);
  EXPECT_EQ(sr_mount_local_tree_1(tree_, "/a/b", dir("ab2").c_str(), 0), SR_E_MOUNT_POINT_EXISTS);
  EXPECT_EQ(sr_mount_local_tree_1(tree_, "/a/b/c", dir("abc").c_str(), 0), SR_E_MOUNT_POINT_EXISTS);
  // Mounting above an existing mount point is allowed; the deeper one keeps
  // the paths below it.
  ASSERT_EQ(sr_mount_local_tree_1(tree_, "/a", dir("a").c_str(), 0), 0);
  EXPECT_EQ(resolve("/a/b/t").first, dir("ab") + "/t");
  EXPECT_EQ(resolve("/a/bc/t").first, dir("a") + "/bc,t");
  EXPECT_EQ(resolve("/a/t").first, dir("a") + "/t");
}

TEST_F(MountPoints, ArgumentsAreChecked) {
  EXPECT_EQ(sr_mount_local_tree_1(nullptr, "/a", dir("d").c_str(), 0), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_mount_local_tree_1(tree_, "/a", nullptr, 0), SR_E_NULL_POINTER);
  EXPECT_EQ(sr_mount_local_tree_1(tree_, nullptr, dir("d").c_str(), 0), SR_E_INVALID_PATH);
  EXPECT_EQ(last_error().second, "2605-102 <NULL POINTER> is an invalid pathname.\n");
  EXPECT_EQ(sr_mount_local_tree_1(tree_, "/a.b", dir("d").c_str(), 0), SR_E_INVALID_PATH);
  EXPECT_EQ(sr_unmount_local_tree_1(nullptr, "/a"), SR_E_INVALID_HANDLE);
}

TEST_F(MountPoints, UnmountFindsOnlyTheMountPointItself) {
  // With no mount point at all, even an invalid path gives 208.
  EXPECT_EQ(sr_unmount_local_tree_1(tree_, "/a b"), SR_E_NO_MOUNT_POINT);
  ASSERT_EQ(sr_mount_local_tree_1(tree_, "/a", dir("d").c_str(), 0), 0);
  EXPECT_EQ(sr_unmount_local_tree_1(tree_, "/a b"), SR_E_INVALID_PATH);
  EXPECT_EQ(sr_unmount_local_tree_1(tree_, "/a/b"), SR_E_NO_MOUNT_POINT);
  EXPECT_EQ(sr_unmount_local_tree_1(tree_, "/x"), SR_E_NO_MOUNT_POINT);
  EXPECT_EQ(sr_unmount_local_tree_1(tree_, "/a"), 0);
  EXPECT_EQ(resolve("/a/t"), std::make_pair(std::string("/a/t"), 0u));
  EXPECT_EQ(sr_unmount_local_tree_1(tree_, "/a"), SR_E_NO_MOUNT_POINT);
  // The directory stays.
  EXPECT_TRUE(std::filesystem::is_directory(dir("d")));
}

TEST_F(MountPoints, DirectoryFailuresAreReportedAndMountNothing) {
  Sr_File_System.mkdir = [](const char *, mode_t) {
    errno = ENOSPC;
    return -1;
  };
  EXPECT_EQ(sr_mount_local_tree_1(tree_, "/a", dir("full").c_str(), 0), SR_E_FILESYSTEM_FULL);
  Sr_File_System.mkdir = [](const char *, mode_t) {
    errno = EACCES;
    return -1;
  };
  EXPECT_EQ(sr_mount_local_tree_1(tree_, "/a", dir("denied").c_str(), 0), SR_E_ACCESS);
  Sr_File_System.mkdir = [](const char *, mode_t) {
    errno = EIO;
    return -1;
  };
  EXPECT_EQ(sr_mount_local_tree_1(tree_, "/a", dir("broken").c_str(), 0), SR_E_SYSTEM_CALL);
  EXPECT_EQ(
      last_error().second.rfind("2605-010 The mkdir system call unexpectedly returned an errno "
                                "of 5 to the sr_i_make_directory function",
                                0),
      0u);
  EXPECT_TRUE(tree()->mount_points.empty());
}

}  // namespace
