// Listing tables below a path, from a mount directory's files and from the
// tree's transient tables; what is never listed; failures that leave no
// list behind; listing in a forked child; and the older directory calls:
// what they list, what making and deleting a directory does and refuses.

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "sr_row_test_support.h"
#include "storage/sr_i_system_calls.h"

namespace {

using namespace sr_test;

using names_t = std::multiset<std::string>;

class Listing : public RowTables {
 protected:
  void SetUp() override {
    RowTables::SetUp();
    mount_disk();
  }
  void TearDown() override {
    Sr_File_System = Sr_Default_File_System;
    RowTables::TearDown();
  }

  // The paths sr_list_tables_1 gives for `p_path`, freed; with the code in
  // `*p_rc`. A failed listing must leave the outputs as they were.
  names_t listed(const char *p_path, int32_t *p_rc = nullptr) {
    char **p_list = nullptr;
    uint32_t count = 7;
    const int32_t rc = sr_list_tables_1(tree_, p_path, &p_list, &count);
    if (p_rc != nullptr) {
      *p_rc = rc;
    } else {
      EXPECT_EQ(rc, 0) << p_path;
    }
    names_t names;
    if (rc != 0) {
      EXPECT_EQ(p_list, nullptr) << "a failed listing handed out an array";
      EXPECT_EQ(count, 7u);
      return names;
    }
    EXPECT_NE(p_list, nullptr) << "an empty listing is an array too";
    for (uint32_t entry = 0; entry < count; ++entry) {
      names.insert(p_list[entry]);
    }
    EXPECT_EQ(sr_free_table_list_1(p_list, count), 0);
    return names;
  }

  // The entries of the older directory listing, as "name type storage".
  std::vector<std::string> directory(const char *p_path) {
    sr_entry_metadata_t *p_entries = nullptr;
    uint32_t count = 0;
    EXPECT_EQ(sr_i_get_directory_list_compat(tree_, p_path, &p_entries, &count), 0) << p_path;
    std::vector<std::string> entries;
    if (p_entries == nullptr) {
      return entries;
    }
    for (uint32_t entry = 0; entry < count; ++entry) {
      const sr_entry_metadata_t &record = p_entries[entry];
      EXPECT_EQ(record.p_table_list, nullptr);
      entries.push_back(std::string(record.name) +
                        (record.type == SR_TABLE       ? " table"
                         : record.type == SR_DIRECTORY ? " directory"
                                                       : " ?") +
                        (record.storage == SR_PERSISTENT  ? " persistent"
                         : record.storage == SR_TRANSIENT ? " transient"
                                                          : " ?"));
    }
    EXPECT_EQ(sr_i_free_directory_list_compat(p_entries, count), 0);
    return entries;
  }

  void make_file(const char *p_name) { write_file(directory_ + "/" + p_name, "x"); }
  void persistent(const char *p_path) {
    EXPECT_EQ(sr_close_table_1(create_named_counts(p_path, Implicit)), 0) << p_path;
  }
};

TEST_F(Listing, AMountDirectoryListsItsTableFilesAsRegistryPaths) {
  persistent("/disk/t");
  persistent("/disk/a/b");
  persistent("/disk/a/c/d");
  make_file("ab");
  // Files beside the tables that are no tables: the lock file a copy
  // leaves, side files, hidden files.
  make_file(",Lock");
  make_file("t.rewrite");
  make_file("a,b.rewrite");
  make_file(".hidden");
  make_file(".a,b");
  const names_t all = {"/disk/t", "/disk/a/b", "/disk/a/c/d", "/disk/ab"};
  EXPECT_EQ(listed("/disk"), all);
  EXPECT_EQ(listed("/disk/"), all);
  // Below the mount point the rest of the path is a prefix of file names.
  EXPECT_EQ(listed("/disk/a"), (names_t{"/disk/a/b", "/disk/a/c/d", "/disk/ab"}));
  EXPECT_EQ(listed("/disk/a/"), (names_t{"/disk/a/b", "/disk/a/c/d"}));
  EXPECT_EQ(listed("/disk/a/c/d"), (names_t{"/disk/a/c/d"}));
  EXPECT_EQ(listed("/disk/none"), names_t{});
  // An open table is listed from its file like any other, and transient
  // tables are not in the directory.
  ASSERT_NE(create_named_counts("/disk/open", Implicit), nullptr);
  ASSERT_NE(create_named_counts("/diskette", Implicit), nullptr);
  names_t with_open = all;
  with_open.insert("/disk/open");
  EXPECT_EQ(listed("/disk"), with_open);
}

TEST_F(Listing, TransientListingsTakeTheTablesWhosePathsBeginWithThePath) {
  // Closed, a transient table stays in the tree, and is listed.
  for (const char *p_path : {"/m/a", "/m/b/c", "/mx", "/n/a", "m/a"}) {
    EXPECT_EQ(sr_close_table_1(create_named_counts(p_path, Implicit)), 0) << p_path;
  }
  // Persistent tables open in the tree, and a table loaded from a mount
  // point that is gone since, are not transient tables.
  ASSERT_NE(create_named_counts("/disk/m", Implicit), nullptr);
  ASSERT_NE(create_named_counts("/disk2/x", Implicit), nullptr);
  EXPECT_EQ(sr_mount_local_tree_1(tree_, "/disk2", (directory_ + "/sub").c_str(), 0), 0);
  ASSERT_NE(create_named_counts("/disk2/y", Implicit), nullptr);
  EXPECT_EQ(sr_unmount_local_tree_1(tree_, "/disk2"), 0);

  EXPECT_EQ(listed("/m"), (names_t{"/m/a", "/m/b/c", "/mx"}));
  EXPECT_EQ(listed("/m/"), (names_t{"/m/a", "/m/b/c"}));
  EXPECT_EQ(listed("/m/b/c"), (names_t{"/m/b/c"}));
  EXPECT_EQ(listed("/"), (names_t{"/m/a", "/m/b/c", "/mx", "/n/a", "/disk2/x"}));
  EXPECT_EQ(listed("m"), (names_t{"m/a"}));
  EXPECT_EQ(listed("/q"), names_t{});
  // A deleted table is gone from the listing, a new one is in it.
  ASSERT_EQ(sr_delete_table_1(tree_, "/m/a"), 0);
  ASSERT_NE(create_named_counts("/m/z", Implicit), nullptr);
  EXPECT_EQ(listed("/m/"), (names_t{"/m/b/c", "/m/z"}));
}

TEST_F(Listing, ListsLongerThanOneGrowthStepKeepEveryEntry) {
  // The array starts with room for 100 entries and grows by 100: 250
  // table files make it grow twice, 150 transient tables once.
  names_t files;
  names_t tables;
  for (int at = 0; at < 250; ++at) {
    const std::string name = "t" + std::to_string(at);
    make_file(("x," + name).c_str());
    files.insert("/disk/x/" + name);
    if (at < 150) {
      const std::string path = "/mem/" + name;
      EXPECT_EQ(sr_close_table_1(create_named_counts(path.c_str(), Implicit)), 0);
      tables.insert(path);
    }
  }
  EXPECT_EQ(listed("/disk/x/"), files);
  EXPECT_EQ(listed("/mem/"), tables);
}

TEST_F(Listing, BadArgumentsAreRefusedWithTheirCodes) {
  char **p_list = nullptr;
  uint32_t count = 0;
  EXPECT_EQ(sr_list_tables_1(nullptr, "/disk", &p_list, &count), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_list_tables_1(tree_, nullptr, &p_list, &count), SR_E_INVALID_PATH);
  EXPECT_NE(last_error().second.find("<NULL POINTER>"), std::string::npos);
  EXPECT_EQ(sr_list_tables_1(tree_, "/a.b", &p_list, &count), SR_E_INVALID_PATH);
  EXPECT_EQ(sr_list_tables_1(tree_, "", &p_list, &count), SR_E_INVALID_PATH);
  EXPECT_EQ(sr_list_tables_1(tree_, "/disk", nullptr, &count), SR_E_NULL_POINTER);
  EXPECT_EQ(sr_list_tables_1(tree_, "/disk", &p_list, nullptr), SR_E_NULL_POINTER);
  EXPECT_EQ(p_list, nullptr);
  EXPECT_EQ(sr_free_table_list_1(nullptr, 3), SR_E_NULL_POINTER);
  EXPECT_EQ(last_error().first, SR_E_NULL_POINTER);
  // Null entries are passed over.
  auto **p_sparse = static_cast<char **>(std::calloc(2, sizeof(char *)));
  p_sparse[1] = strdup("/a");
  EXPECT_EQ(sr_free_table_list_1(p_sparse, 2), 0);
}

TEST_F(Listing, AMountDirectoryThatCannotBeReadLeavesNoList) {
  persistent("/disk/t");
  // Refused access, and any other failure of opening, naming the call.
  Sr_File_System.opendir = [](const char *) -> DIR * {
    errno = EACCES;
    return nullptr;
  };
  int32_t rc = 0;
  listed("/disk", &rc);
  EXPECT_EQ(rc, SR_E_ACCESS);
  Sr_File_System.opendir = [](const char *) -> DIR * {
    errno = EIO;
    return nullptr;
  };
  listed("/disk/t", &rc);
  EXPECT_EQ(rc, SR_E_SYSTEM_CALL);
  EXPECT_NE(last_error().second.find("opendir"), std::string::npos) << last_error().second;
  // A directory that fails while it is read, after entries were made:
  // they are freed (the sanitizer builds see a leak otherwise).
  static int entries_read;
  entries_read = 0;
  Sr_File_System = Sr_Default_File_System;
  for (int at = 0; at < 150; ++at) {
    make_file(("u" + std::to_string(at)).c_str());
  }
  Sr_File_System.readdir = [](DIR * p_directory) -> struct dirent * {
    if (++entries_read > 120) {
      errno = EIO;
      return nullptr;
    }
    return Sr_Default_File_System.readdir(p_directory);
  };
  listed("/disk", &rc);
  EXPECT_EQ(rc, SR_E_SYSTEM_CALL);
  EXPECT_NE(last_error().second.find("readdir"), std::string::npos) << last_error().second;
  EXPECT_GT(entries_read, 120);
  // The directory is closed on the way out: every open has its close.
  static int opened;
  static int closed;
  opened = closed = 0;
  Sr_File_System = Sr_Default_File_System;
  Sr_File_System.opendir = [](const char *p_path) {
    ++opened;
    return Sr_Default_File_System.opendir(p_path);
  };
  Sr_File_System.closedir = [](DIR *p_directory) {
    ++closed;
    return Sr_Default_File_System.closedir(p_directory);
  };
  EXPECT_EQ(listed("/disk").size(), 151u);
  EXPECT_EQ(opened, 1);
  EXPECT_EQ(closed, 1);
  // The listing works again once the directory can be read.
  Sr_File_System = Sr_Default_File_System;
  EXPECT_EQ(listed("/disk/t"), names_t{"/disk/t"});
}

TEST_F(Listing, AForkedChildListsAndIsStillRefusedChanges) {
  persistent("/disk/t");
  ASSERT_NE(create_named_counts("/m/a", Implicit), nullptr);
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    // Exit codes say what went wrong in the child: gtest's checks do not
    // reach the parent from here.
    char **p_list = nullptr;
    uint32_t count = 0;
    if (sr_list_tables_1(tree_, "/disk", &p_list, &count) != 0 || count != 1 ||
        std::string(p_list[0]) != "/disk/t" || sr_free_table_list_1(p_list, count) != 0) {
      _exit(1);
    }
    if (sr_list_tables_1(tree_, "/m", &p_list, &count) != 0 || count != 1 ||
        std::string(p_list[0]) != "/m/a" || sr_free_table_list_1(p_list, count) != 0) {
      _exit(2);
    }
    sr_entry_metadata_t *p_entries = nullptr;
    if (sr_i_get_directory_list_compat(tree_, "/", &p_entries, &count) != 0 || count != 2 ||
        sr_i_free_directory_list_compat(p_entries, count) != 0) {
      _exit(3);
    }
    if (sr_i_create_directory_compat(tree_, "/d") != SR_E_INTERNAL ||
        sr_i_delete_directory_compat(tree_, "/m") != SR_E_INTERNAL) {
      _exit(4);
    }
    _exit(0);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

// ---- The older directory calls ------------------------------------------

TEST_F(Listing, ADirectoryListsItsTablesAndEachDirectoryBelowItOnce) {
  for (const char *p_path : {"/m/t", "/m/u", "/m/s/t", "/m/s/u", "/m/s/v/w", "/m/s"}) {
    ASSERT_NE(create_named_counts(p_path, Implicit), nullptr) << p_path;
  }
  persistent("/disk/t");
  persistent("/disk/a/b");
  persistent("/disk/a/c");
  make_file("a,b.rewrite");
  make_file(",Lock");
  make_file(".x,y");
  EXPECT_EQ(directory("/m"),
            (std::vector<std::string>{"/m/s table transient", "/m/s directory transient",
                                      "/m/t table transient", "/m/u table transient"}));
  EXPECT_EQ(directory("/m/s/"),
            (std::vector<std::string>{"/m/s/t table transient", "/m/s/u table transient",
                                      "/m/s/v directory transient"}));
  // The root: the mount point is a persistent directory.
  EXPECT_EQ(directory("/"),
            (std::vector<std::string>{"/disk directory persistent", "/m directory transient"}));
  EXPECT_EQ(directory("/disk"),
            (std::vector<std::string>{"/disk/a directory persistent", "/disk/t table persistent"}));
  EXPECT_EQ(directory("/disk/a"),
            (std::vector<std::string>{"/disk/a/b table persistent", "/disk/a/c table persistent"}));
  // Not a directory: empty, with an array all the same.
  EXPECT_EQ(directory("/m/t"), std::vector<std::string>{});
  EXPECT_EQ(directory("/nothing"), std::vector<std::string>{});
  // A mount point is a persistent directory wherever it lies, and so is
  // everything below it.
  const std::string nested = new_directory("qv_nested");
  ASSERT_EQ(sr_mount_local_tree_1(tree_, "/m/s/n", nested.c_str(), 0), 0);
  ASSERT_NE(create_named_counts("/m/s/n/x/y", Implicit), nullptr);
  EXPECT_EQ(directory("/m/s"),
            (std::vector<std::string>{"/m/s/n directory persistent", "/m/s/t table transient",
                                      "/m/s/u table transient", "/m/s/v directory transient"}));
  EXPECT_EQ(directory("/m/s/n"), (std::vector<std::string>{"/m/s/n/x directory persistent"}));
  std::filesystem::remove_all(nested);
}

TEST_F(Listing, MadeDirectoriesAreListedUntilDeletedAndReserveNothingOnDisk) {
  ASSERT_EQ(sr_i_create_directory_compat(tree_, "/d"), 0);
  ASSERT_EQ(sr_i_create_directory_compat(tree_, "/d/e/f/"), 0);
  ASSERT_EQ(sr_i_create_directory_compat(tree_, "/d/"), 0);
  ASSERT_EQ(sr_i_create_directory_compat(tree_, "/"), 0);
  EXPECT_EQ(directory("/"),
            (std::vector<std::string>{"/d directory transient", "/disk directory persistent"}));
  EXPECT_EQ(directory("/d"), (std::vector<std::string>{"/d/e directory transient"}));
  EXPECT_EQ(directory("/d/e/f"), std::vector<std::string>{});

  // Below a mount point: nothing is made, and the directory appears with
  // its first table.
  ASSERT_EQ(sr_i_create_directory_compat(tree_, "/disk/sub"), 0);
  EXPECT_TRUE(std::filesystem::is_empty(directory_));
  EXPECT_EQ(directory("/disk"), std::vector<std::string>{});
  persistent("/disk/sub/t");
  EXPECT_EQ(directory("/disk"), (std::vector<std::string>{"/disk/sub directory persistent"}));

  // Refused while a table lies below, open or not, on disk or in memory.
  EXPECT_EQ(sr_i_delete_directory_compat(tree_, "/disk/sub"), SR_E_TABLE_EXISTS);
  EXPECT_EQ(last_error().first, SR_E_TABLE_EXISTS);
  sr_opaque_handle_t open_table = create_named_counts("/d/e/t", Implicit);
  ASSERT_NE(open_table, nullptr);
  EXPECT_EQ(sr_i_delete_directory_compat(tree_, "/d"), SR_E_TABLE_EXISTS);
  EXPECT_EQ(directory("/d"), (std::vector<std::string>{"/d/e directory transient"}));
  // ... and while a mount point is at or below it.
  EXPECT_EQ(sr_i_delete_directory_compat(tree_, "/disk"), SR_E_MOUNT_POINT_EXISTS);
  EXPECT_EQ(sr_i_delete_directory_compat(tree_, "/disk/"), SR_E_MOUNT_POINT_EXISTS);
  EXPECT_EQ(sr_i_delete_directory_compat(tree_, "/"), SR_E_MOUNT_POINT_EXISTS);
  EXPECT_EQ(directory("/disk/sub"), (std::vector<std::string>{"/disk/sub/t table persistent"}));

  // Once the tables are gone the directory goes, with those made below it.
  ASSERT_EQ(sr_delete_table_1(tree_, "/disk/sub/t"), 0);
  EXPECT_EQ(sr_i_delete_directory_compat(tree_, "/disk/sub"), 0);
  ASSERT_EQ(sr_close_table_1(open_table), 0);
  ASSERT_EQ(sr_delete_table_1(tree_, "/d/e/t"), 0);
  EXPECT_EQ(sr_i_delete_directory_compat(tree_, "/d/"), 0);
  EXPECT_EQ(directory("/"), (std::vector<std::string>{"/disk directory persistent"}));
  // A path that is a table's is no directory: deleting it as one leaves the
  // table. Nothing left to delete is no failure.
  ASSERT_NE(create_named_counts("/m/t", Implicit), nullptr);
  EXPECT_EQ(sr_i_delete_directory_compat(tree_, "/m/t"), 0);
  EXPECT_EQ(listed("/m/t"), names_t{"/m/t"});
  EXPECT_EQ(sr_i_delete_directory_compat(tree_, "/nothing"), 0);

  // A mount directory that cannot be read cannot be judged empty.
  Sr_File_System.opendir = [](const char *) -> DIR * {
    errno = EACCES;
    return nullptr;
  };
  EXPECT_EQ(sr_i_delete_directory_compat(tree_, "/disk/sub"), SR_E_ACCESS);
  sr_entry_metadata_t *p_entries = nullptr;
  uint32_t count = 0;
  EXPECT_EQ(sr_i_get_directory_list_compat(tree_, "/disk", &p_entries, &count), SR_E_ACCESS);
  EXPECT_EQ(p_entries, nullptr);
}

TEST_F(Listing, TheDirectoryCallsRefuseBadArguments) {
  sr_entry_metadata_t *p_entries = nullptr;
  uint32_t count = 0;
  EXPECT_EQ(sr_i_get_directory_list_compat(nullptr, "/", &p_entries, &count), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_i_get_directory_list_compat(tree_, nullptr, &p_entries, &count), SR_E_INVALID_PATH);
  EXPECT_EQ(sr_i_get_directory_list_compat(tree_, "/a,b", &p_entries, &count), SR_E_INVALID_PATH);
  EXPECT_EQ(sr_i_get_directory_list_compat(tree_, "/", nullptr, &count), SR_E_NULL_POINTER);
  EXPECT_EQ(sr_i_get_directory_list_compat(tree_, "/", &p_entries, nullptr), SR_E_NULL_POINTER);
  EXPECT_EQ(p_entries, nullptr);
  EXPECT_EQ(sr_i_free_directory_list_compat(nullptr, 0), SR_E_NULL_POINTER);
  for (const auto call : {sr_i_create_directory_compat, sr_i_delete_directory_compat}) {
    EXPECT_EQ(call(nullptr, "/d"), SR_E_INVALID_HANDLE);
    EXPECT_EQ(call(tree_, nullptr), SR_E_INVALID_PATH);
    EXPECT_EQ(call(tree_, "/d//e"), SR_E_INVALID_PATH);
  }
  EXPECT_EQ(directory("/"), (std::vector<std::string>{"/disk directory persistent"}));
}

}  // namespace
