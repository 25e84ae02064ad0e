// The diagnostic dumps: what a person debugging a table needs to find in
// them (each row's state in the two views, the pending changes, the file
// bookkeeping; a tree's mount points and tables), and no crash on tables
// in any state.

#include <gtest/gtest.h>

#include <string>

#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

class Dumps : public RowTables {};

TEST_F(Dumps, ATableDumpShowsEachRowsStateAndThePendingChanges) {
  sr_opaque_handle_t table = create_named_counts("/t", Explicit);
  for (const char *p_name : {"kept", "changed", "gone"}) {
    ASSERT_EQ(add_named(table, p_name, 1), 0);
  }
  apply_commit(table);
  const qv_value_t two = int32_value(2);
  ASSERT_EQ(sr_set_field_by_key_1(table, string_value("changed"), "count", &two), 0);
  ASSERT_EQ(sr_delete_rows_1(table, "name == $s", "gone"), 0);
  ASSERT_EQ(add_named(table, "new", 3), 0);

  testing::internal::CaptureStdout();
  ASSERT_EQ(sr_i_dump_table(table), 0);
  const std::string dump = testing::internal::GetCapturedStdout();
  EXPECT_NE(dump.find("name(/t)"), std::string::npos) << dump;
  EXPECT_NE(dump.find("[1] name(count) type(2)"), std::string::npos) << dump;
  EXPECT_NE(dump.find("fixed(0) packed(0) state(committed)"), std::string::npos) << dump;
  EXPECT_NE(dump.find("fixed(1) packed(1) state(updated)"), std::string::npos) << dump;
  EXPECT_NE(dump.find("state(deleted)"), std::string::npos) << dump;
  EXPECT_NE(dump.find("state(added)"), std::string::npos) << dump;
  EXPECT_NE(dump.find("changes: fixed(1) fixed(3)"), std::string::npos) << dump;
  EXPECT_NE(dump.find("deletions: fixed(2)-deleted"), std::string::npos) << dump;
  EXPECT_NE(dump.find("file: none (transient)"), std::string::npos) << dump;
  EXPECT_EQ(sr_i_dump_table(nullptr), SR_E_INVALID_HANDLE);
}

TEST_F(Dumps, ATreeDumpShowsItsMountPointsAndEveryTable) {
  mount_disk();
  ASSERT_NE(create_named_counts("/disk/cfg", Implicit), nullptr);
  ASSERT_NE(create_named_counts("/mem", Implicit), nullptr);
  testing::internal::CaptureStdout();
  ASSERT_EQ(sr_i_dump_tree(tree_), 0);
  const std::string dump = testing::internal::GetCapturedStdout();
  EXPECT_NE(dump.find("    p_name(/disk/)\n    p_filesystem_path(" + directory_ + ")\n"),
            std::string::npos)
      << dump;
  EXPECT_NE(dump.find("named tables(2)"), std::string::npos) << dump;
  EXPECT_NE(dump.find("registry_path(/disk/cfg)"), std::string::npos) << dump;
  EXPECT_NE(dump.find("file: path(" + directory_ + "/cfg) fd("), std::string::npos) << dump;
  EXPECT_NE(dump.find("name(/mem)"), std::string::npos) << dump;
  EXPECT_EQ(sr_i_dump_tree(nullptr), SR_E_INVALID_HANDLE);
}

}  // namespace
