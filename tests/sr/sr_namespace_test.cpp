// Copying, moving and deleting tables by path in the four directions
// between memory and disk: what reaches the target, what is left of the
// source, what becomes of handles on either, and what is refused.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <map>
#include <string>

#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

using rows_t = std::map<std::string, int32_t>;
const rows_t Rows = {{"a", 1}, {"b", 2}, {"c", 3}};

class Namespace : public RowTables {
 protected:
  void SetUp() override {
    RowTables::SetUp();
    mount_disk();
  }

  // A table at `p_path` with Rows, committed.
  sr_opaque_handle_t filled(const char *p_path) {
    sr_opaque_handle_t table = create_named_counts(p_path, Explicit);
    for (const auto &[name, count] : Rows) {
      EXPECT_EQ(add_named(table, name.c_str(), count), 0);
    }
    apply_commit(table);
    return table;
  }

  // The committed rows of the table at `p_path` as a second program finds
  // them; one "<code>" entry when it does not open.
  rows_t rows_elsewhere(const char *p_path) const {
    sr_opaque_handle_t tree = mounted_tree(directory_);
    sr_opaque_handle_t table = nullptr;
    const int32_t rc = sr_open_table_1(tree, p_path, SR_MODE_READ, &table);
    rows_t rows = rc == 0 ? rows_in<std::string>(table, "name", 0)
                          : rows_t{{"<" + std::to_string(rc) + ">", rc}};
    EXPECT_EQ(sr_close_tree_1(tree), 0);
    return rows;
  }

  // The rows of the table at `p_path` in this tree.
  rows_t rows_here(const char *p_path) {
    sr_opaque_handle_t table = nullptr;
    const int32_t rc = sr_open_table_1(tree_, p_path, SR_MODE_READ, &table);
    if (rc != 0) {
      return {{"<" + std::to_string(rc) + ">", rc}};
    }
    rows_t rows = rows_in<std::string>(table, "name", 0);
    EXPECT_EQ(sr_close_table_1(table), 0);
    return rows;
  }

  std::string file(const char *p_name) const { return directory_ + "/" + p_name; }
  static ino_t inode_of(const std::string &path) {
    struct stat status {};
    return ::stat(path.c_str(), &status) == 0 ? status.st_ino : 0;
  }
  bool exists(const char *p_name) const { return std::filesystem::exists(file(p_name)); }
};

TEST_F(Namespace, CopiesReachTheTargetInEveryDirectionAndLeaveTheSource) {
  sr_opaque_handle_t memory = filled("/m/a");
  // Memory to memory, then memory to disk, by handle.
  ASSERT_EQ(sr_copy_table_by_handle_1(memory, "/m/b", 0), 0);
  ASSERT_EQ(sr_copy_table_by_handle_1(memory, "/disk/b", 0), 0);
  EXPECT_EQ(rows_here("/m/b"), Rows);
  EXPECT_EQ(rows_elsewhere("/disk/b"), Rows);
  EXPECT_FALSE(exists("b.rewrite"));
  // Disk to disk and disk to memory, by name, from a file no one has open.
  ASSERT_EQ(sr_copy_table_by_name_1(tree_, "/disk/b", "/disk/c", 0), 0);
  ASSERT_EQ(sr_copy_table_by_name_1(tree_, "/disk/c", "/m/c", 0), 0);
  EXPECT_EQ(file_bytes(file("c")), file_bytes(file("b")));
  EXPECT_EQ(rows_here("/m/c"), Rows);
  // The sources are as they were.
  EXPECT_EQ(rows_in<std::string>(memory, "name", 0), Rows);
  EXPECT_EQ(rows_elsewhere("/disk/b"), Rows);

  // A table loaded into memory refers to no file: its changes stay there.
  const std::string c_file = file_bytes(file("c"));
  sr_opaque_handle_t loaded = nullptr;
  ASSERT_EQ(sr_open_table_1(tree_, "/m/c", SR_MODE_WRITE, &loaded), 0);
  ASSERT_EQ(add_named(loaded, "d", 4), 0);
  EXPECT_EQ(file_bytes(file("c")), c_file);
  EXPECT_EQ(count_of(loaded, "d", 0), 4);
}

TEST_F(Namespace, AnExistingTargetIsReplacedOnlyWithOverwrite) {
  sr_opaque_handle_t source = filled("/m/a");
  // The replaced transient target lives on, detached, for this handle.
  sr_opaque_handle_t old_target = create_named_counts("/m/t", Implicit);
  ASSERT_NE(old_target, nullptr);
  ASSERT_NE(create_named_counts("/disk/t", Implicit), nullptr);
  for (const char *p_target : {"/m/t", "/disk/t"}) {
    EXPECT_EQ(sr_copy_table_by_handle_1(source, p_target, 0), SR_E_TABLE_EXISTS) << p_target;
    EXPECT_EQ(sr_copy_table_by_name_1(tree_, "/m/a", p_target, 0), SR_E_TABLE_EXISTS);
    EXPECT_EQ(sr_move_table_by_handle_1(source, p_target, 0), SR_E_TABLE_EXISTS);
    EXPECT_TRUE(rows_here(p_target).empty()) << p_target;
    EXPECT_EQ(sr_copy_table_by_handle_1(source, p_target, 1), 0) << p_target;
    EXPECT_EQ(rows_here(p_target), Rows) << p_target;
  }
  EXPECT_EQ(rows_elsewhere("/disk/t"), Rows);
  // A table onto its own path: nothing to do, or refused.
  EXPECT_EQ(sr_copy_table_by_handle_1(source, "/m/a", 0), SR_E_TABLE_EXISTS);
  EXPECT_EQ(sr_copy_table_by_handle_1(source, "/m/a", 1), 0);
  EXPECT_EQ(sr_move_table_by_name_1(tree_, "/disk/t", "/disk/t", 1), 0);
  EXPECT_EQ(rows_elsewhere("/disk/t"), Rows);
  // An empty file is no table.
  write_file(file("empty"), "");
  EXPECT_EQ(sr_copy_table_by_handle_1(source, "/disk/empty", 0), 0);
  EXPECT_EQ(rows_elsewhere("/disk/empty"), Rows);
  EXPECT_TRUE(rows_in<std::string>(old_target, "name", 0).empty());
  EXPECT_EQ(sr_close_table_1(old_target), 0);
}

TEST_F(Namespace, MissingSourcesAndBadPathsAreRefused) {
  sr_opaque_handle_t source = filled("/m/a");
  EXPECT_EQ(sr_copy_table_by_name_1(tree_, "/m/none", "/m/b", 0), SR_E_NO_TABLE);
  EXPECT_EQ(sr_move_table_by_name_1(tree_, "/m/none", "/m/b", 0), SR_E_NO_TABLE);
  EXPECT_EQ(sr_copy_table_by_name_1(tree_, "/disk/none", "/m/b", 0), SR_E_NO_TABLE);
  EXPECT_EQ(sr_copy_table_by_name_1(tree_, "/disk/none", "/disk/b", 0), SR_E_NO_TABLE);
  EXPECT_EQ(sr_move_table_by_name_1(tree_, "/disk/none", "/disk/b", 0), SR_E_NO_TABLE);
  EXPECT_FALSE(exists("b"));
  EXPECT_FALSE(exists("b.rewrite"));
  EXPECT_EQ(sr_copy_table_by_handle_1(source, "/m/bad path", 0), SR_E_INVALID_PATH);
  EXPECT_EQ(sr_copy_table_by_handle_1(source, nullptr, 0), SR_E_INVALID_PATH);
  EXPECT_EQ(sr_copy_table_by_name_1(tree_, "//m", "/m/b", 0), SR_E_INVALID_PATH);
  EXPECT_EQ(sr_copy_table_by_handle_1(nullptr, "/m/b", 0), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_copy_table_by_name_1(nullptr, "/m/a", "/m/b", 0), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_delete_table_1(nullptr, "/m/a"), SR_E_INVALID_HANDLE);
  EXPECT_EQ(rows_here("/m/b"), (rows_t{{"<200>", 200}}));
}

TEST_F(Namespace, AMovedTableKeepsItsHandlesInMemoryAndItsPathIsFree) {
  sr_opaque_handle_t table = filled("/m/a");
  ASSERT_EQ(sr_move_table_by_handle_1(table, "/m/b", 0), 0);
  EXPECT_EQ(rows_here("/m/a"), (rows_t{{"<200>", 200}}));
  // The same object, under its new path: the handle goes on.
  ASSERT_EQ(add_named(table, "d", 4), 0);
  apply_commit(table);
  sr_opaque_handle_t again = nullptr;
  ASSERT_EQ(sr_open_table_1(tree_, "/m/b", SR_MODE_READ, &again), 0);
  EXPECT_EQ(again, table);
  ASSERT_EQ(sr_close_table_1(again), 0);

  // Memory to disk: the file holds it, the handle keeps the detached table.
  ASSERT_EQ(sr_move_table_by_name_1(tree_, "/m/b", "/disk/b", 0), 0);
  rows_t moved = Rows;
  moved["d"] = 4;
  EXPECT_EQ(rows_elsewhere("/disk/b"), moved);
  EXPECT_EQ(rows_here("/m/b"), (rows_t{{"<200>", 200}}));
  EXPECT_EQ(count_of(table, "d", 0), 4);
  EXPECT_EQ(sr_close_table_1(table), 0);

  // Disk to disk, nobody has it open: one rename.
  ASSERT_EQ(sr_move_table_by_name_1(tree_, "/disk/b", "/disk/c", 0), 0);
  EXPECT_FALSE(exists("b"));
  EXPECT_FALSE(exists("c.rewrite"));
  EXPECT_EQ(rows_elsewhere("/disk/c"), moved);

  // Disk, open here, to memory: the file is gone, the rows are in memory.
  sr_opaque_handle_t open = nullptr;
  ASSERT_EQ(sr_open_table_1(tree_, "/disk/c", SR_MODE_WRITE_EXPLICIT, &open), 0);
  ASSERT_EQ(sr_move_table_by_handle_1(open, "/m/c", 0), 0);
  EXPECT_FALSE(exists("c"));
  EXPECT_EQ(rows_in<std::string>(open, "name", 0), moved);
  ASSERT_EQ(add_named(open, "e", 5), 0);
  apply_commit(open);
  EXPECT_FALSE(exists("c"));
  EXPECT_EQ(count_of(open, "e", 0), 5);
}

// A table file open here that moves within its directory is renamed: the
// same object goes on under the new path, and what its handle changes
// afterwards goes to the renamed file.
TEST_F(Namespace, AnOpenTableFileMovesByRenameAndItsHandleWritesToTheNewPath) {
  sr_opaque_handle_t table = filled("/disk/a");
  ASSERT_EQ(add_named(table, "pending", 9), 0);  // stays pending across the move
  const ino_t inode = inode_of(file("a"));
  ASSERT_EQ(sr_move_table_by_handle_1(table, "/disk/b", 0), 0);
  EXPECT_FALSE(exists("a"));
  EXPECT_EQ(inode_of(file("b")), inode);
  EXPECT_EQ(rows_elsewhere("/disk/b"), Rows);
  apply_commit(table);
  rows_t expected = Rows;
  expected["pending"] = 9;
  EXPECT_EQ(rows_elsewhere("/disk/b"), expected);
  sr_opaque_handle_t again = nullptr;
  ASSERT_EQ(sr_open_table_1(tree_, "/disk/b", SR_MODE_READ, &again), 0);
  EXPECT_EQ(again, table);
  EXPECT_EQ(rows_here("/disk/a"), (rows_t{{"<200>", 200}}));
  ASSERT_EQ(sr_close_table_1(again), 0);
  EXPECT_EQ(sr_close_table_1(table), 0);
}

// An open persistent target overwritten by a copy is read again: its
// handles see the new rows, and their changes go to the new file.
TEST_F(Namespace, AnOpenPersistentTargetIsRefreshedAndItsChangesReachTheNewFile) {
  sr_opaque_handle_t source = filled("/m/a");
  sr_opaque_handle_t target = create_named_counts("/disk/t", Explicit);
  ASSERT_EQ(add_named(target, "old", 9), 0);
  EXPECT_EQ(sr_copy_table_by_handle_1(source, "/disk/t", 1), SR_E_UNCOMMITTED);
  apply_commit(target);
  ASSERT_EQ(sr_copy_table_by_handle_1(source, "/disk/t", 1), 0);
  EXPECT_EQ(rows_in<std::string>(target, "name", 0), Rows);
  ASSERT_EQ(add_named(target, "later", 10), 0);
  apply_commit(target);
  rows_t expected = Rows;
  expected["later"] = 10;
  EXPECT_EQ(rows_elsewhere("/disk/t"), expected);
  EXPECT_FALSE(exists("t.rewrite"));

  // A transient target's handles keep the table they had.
  sr_opaque_handle_t transient = create_named_counts("/m/t", Implicit);
  ASSERT_EQ(add_named(transient, "mine", 1), 0);
  ASSERT_EQ(sr_copy_table_by_handle_1(source, "/m/t", 1), 0);
  EXPECT_EQ(rows_in<std::string>(transient, "name", 0), (rows_t{{"mine", 1}}));
  EXPECT_EQ(rows_here("/m/t"), Rows);
  EXPECT_EQ(sr_close_table_1(transient), 0);
}

// A target open here for writing holds its file's lock: every way onto it
// must hand that lock over rather than wait for it, and leave the handle
// writing into the new file.
TEST_F(Namespace, EveryWayOntoATargetOpenForWritingRefreshesItsHandle) {
  sr_opaque_handle_t memory = filled("/m/a");
  ASSERT_EQ(sr_close_table_1(filled("/disk/a")), 0);
  sr_opaque_handle_t target = create_named_counts("/disk/t", Explicit);
  const auto expect_target_written_on = [&](const char *p_way, const char *p_row) {
    SCOPED_TRACE(p_way);
    EXPECT_EQ(rows_in<std::string>(target, "name", 0), Rows);
    ASSERT_EQ(add_named(target, p_row, 10), 0);
    apply_commit(target);
    rows_t expected = Rows;
    expected[p_row] = 10;
    EXPECT_EQ(rows_elsewhere("/disk/t"), expected);
    EXPECT_FALSE(exists("t.rewrite"));
  };
  ASSERT_EQ(sr_copy_table_by_handle_1(memory, "/disk/t", 1), 0);
  expect_target_written_on("copy by handle", "x");
  ASSERT_EQ(sr_copy_table_by_name_1(tree_, "/disk/a", "/disk/t", 1), 0);
  expect_target_written_on("copy by name", "y");
  ASSERT_EQ(sr_move_table_by_name_1(tree_, "/disk/a", "/disk/t", 1), 0);
  EXPECT_FALSE(exists("a"));
  expect_target_written_on("move by name", "z");
  EXPECT_EQ(sr_close_table_1(target), 0);
}

// Another process creating a table writes its first file as "<file>.rewrite"
// under that file's lock. A copy onto the same path meanwhile must neither
// write into that file nor remove it: it is refused as onto a table that
// exists. A side file nobody holds is a crash's leftover, taken over.
TEST_F(Namespace, ACopyLeavesASideFileBeingWrittenByACreatorAlone) {
  sr_opaque_handle_t source = filled("/m/a");
  const std::string side = file("t.rewrite");
  const std::string creators_bytes(100000, 'c');
  write_file(side, creators_bytes);
  const int creator = ::open(side.c_str(), O_RDWR | O_CLOEXEC);
  ASSERT_GE(creator, 0);
  struct flock whole {};
  whole.l_type = F_WRLCK;
  whole.l_whence = SEEK_SET;
  ASSERT_EQ(::fcntl(creator, F_OFD_SETLK, &whole), 0);
  for (const int overwrite : {0, 1}) {
    EXPECT_EQ(sr_copy_table_by_handle_1(source, "/disk/t", overwrite), SR_E_TABLE_EXISTS);
    EXPECT_EQ(sr_move_table_by_handle_1(source, "/disk/t", overwrite), SR_E_TABLE_EXISTS);
  }
  EXPECT_EQ(file_bytes(side), creators_bytes);
  EXPECT_FALSE(exists("t"));
  EXPECT_EQ(rows_here("/m/a"), Rows);
  // The creator is gone and left its file: the copy empties it first.
  ASSERT_EQ(::close(creator), 0);
  ASSERT_EQ(sr_copy_table_by_handle_1(source, "/disk/t", 0), 0);
  EXPECT_EQ(rows_elsewhere("/disk/t"), Rows);
  EXPECT_LT(std::filesystem::file_size(file("t")), creators_bytes.size());
  EXPECT_FALSE(exists("t.rewrite"));
}

// A move by name to a mount point on another file system cannot rename:
// the table is copied there and its file removed, and nothing is left
// beside either.
TEST_F(Namespace, AMoveByNameCrossesFileSystems) {
  const std::string other = new_directory("qv_other", false);
  struct stat here {
  }, there{};
  ASSERT_EQ(::stat(directory_.c_str(), &here), 0);
  ASSERT_EQ(::stat(other.c_str(), &there), 0);
  if (here.st_dev == there.st_dev) {
    std::filesystem::remove_all(other);
    GTEST_SKIP() << "/tmp and /dev/shm are one file system here";
  }
  ASSERT_EQ(sr_mount_local_tree_1(tree_, "/shm", other.c_str(), 0), 0);
  ASSERT_EQ(sr_close_table_1(filled("/disk/a")), 0);
  ASSERT_EQ(sr_move_table_by_name_1(tree_, "/disk/a", "/shm/a", 0), 0);
  EXPECT_EQ(rows_here("/shm/a"), Rows);
  EXPECT_FALSE(exists("a"));
  // And back, onto a table open here for writing.
  sr_opaque_handle_t target = create_named_counts("/disk/b", Explicit);
  ASSERT_EQ(sr_move_table_by_name_1(tree_, "/shm/a", "/disk/b", 1), 0);
  EXPECT_EQ(rows_in<std::string>(target, "name", 0), Rows);
  EXPECT_EQ(rows_elsewhere("/disk/b"), Rows);
  EXPECT_EQ(sr_close_table_1(target), 0);
  EXPECT_FALSE(std::filesystem::exists(other + "/a"));
  EXPECT_FALSE(std::filesystem::exists(other + "/a.rewrite"));
  EXPECT_FALSE(exists("b.rewrite"));
  std::filesystem::remove_all(other);
}

TEST_F(Namespace, DeletingFreesThePathAndHandlesKeepWorking) {
  sr_opaque_handle_t memory = filled("/m/a");
  ASSERT_EQ(sr_delete_table_1(tree_, "/m/a"), 0);
  EXPECT_EQ(sr_delete_table_1(tree_, "/m/a"), SR_E_NO_TABLE);
  EXPECT_EQ(rows_in<std::string>(memory, "name", 0), Rows);
  ASSERT_EQ(add_named(memory, "d", 4), 0);
  sr_opaque_handle_t fresh = create_named_counts("/m/a", Implicit);
  ASSERT_NE(fresh, nullptr);
  EXPECT_NE(fresh, memory);
  EXPECT_EQ(sr_close_table_1(memory), 0);

  // A persistent table open here: the file goes at once.
  sr_opaque_handle_t disk = filled("/disk/a");
  write_file(file("a.rewrite"), "left over");
  ASSERT_EQ(sr_delete_table_1(tree_, "/disk/a"), 0);
  EXPECT_FALSE(exists("a"));
  EXPECT_FALSE(exists("a.rewrite"));
  EXPECT_EQ(rows_in<std::string>(disk, "name", 0), Rows);
  EXPECT_EQ(sr_close_table_1(disk), 0);
  // One no one has open.
  ASSERT_NE(filled("/disk/b"), nullptr);
  sr_opaque_handle_t other = mounted_tree(directory_);
  ASSERT_EQ(sr_delete_table_1(other, "/disk/b"), 0);
  EXPECT_FALSE(exists("b"));
  EXPECT_EQ(sr_delete_table_1(other, "/disk/b"), SR_E_NO_TABLE);
  EXPECT_EQ(sr_delete_table_1(other, "/disk/bad path"), SR_E_INVALID_PATH);
  EXPECT_EQ(sr_close_tree_1(other), 0);
}

TEST_F(Namespace, AForkedChildGetsInternalErrorFromEveryNamespaceChange) {
  sr_opaque_handle_t table = filled("/m/a");
  const pid_t child = fork();
  ASSERT_NE(child, -1);
  if (child == 0) {
    const bool all_refused = sr_copy_table_by_handle_1(table, "/m/b", 0) == SR_E_INTERNAL &&
                             sr_copy_table_by_name_1(tree_, "/m/a", "/m/b", 0) == SR_E_INTERNAL &&
                             sr_move_table_by_handle_1(table, "/m/b", 0) == SR_E_INTERNAL &&
                             sr_move_table_by_name_1(tree_, "/m/a", "/m/b", 0) == SR_E_INTERNAL &&
                             sr_delete_table_1(tree_, "/m/a") == SR_E_INTERNAL;
    _exit(all_refused ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

}  // namespace
