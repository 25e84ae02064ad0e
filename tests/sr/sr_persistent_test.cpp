// Persistent tables: the first file of a new table, an abort cutting off
// what apply appended, metadata surviving the tree that wrote it, rewrites
// of mostly dead files, damaged files refused with a clear code, and the
// repair of leftover rewrite files.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>

#include "rows/sr_i_transaction.h"
#include "sr_row_test_support.h"
#include "storage/sr_i_storage.h"
#include "storage/sr_i_table_file.h"

namespace {

using namespace sr_test;

uint32_t word_at(const std::string &bytes, size_t offset) {
  uint32_t word;
  std::memcpy(&word, bytes.data() + offset, 4);
  return word;
}

class Persistent : public RowTables {
 protected:
  void SetUp() override {
    RowTables::SetUp();
    mount_disk();
  }

  // A fresh tree with the same mount point: a second program.
  sr_opaque_handle_t second_tree() const { return mounted_tree(directory_); }

  std::string path(const char *p_name) const { return directory_ + "/" + p_name; }
};

TEST_F(Persistent, ANewTableIsItsMetadataAndAnEmptyCommitRecord) {
  sr_opaque_handle_t table = create_named_counts("/disk/cfg/services", Explicit);
  ASSERT_NE(table, nullptr);
  const std::string file = path("cfg,services");
  const std::string bytes = file_bytes(file);
  const uint32_t metadata_length = word_at(bytes, 0);
  ASSERT_EQ(bytes.size(), metadata_length + 24u);
  EXPECT_EQ(word_at(bytes, 8), 1u);
  EXPECT_EQ(word_at(bytes, metadata_length + 8), 0xFFFFFFFFu);
  EXPECT_EQ(object(table)->p_file->commit_record.offset, metadata_length);
  EXPECT_FALSE(std::filesystem::exists(file + ".rewrite"));

  struct stat status {};
  ASSERT_EQ(stat(file.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777, 0644u);
  EXPECT_EQ(fcntl(object(table)->p_file->fd, F_GETFD) & FD_CLOEXEC, FD_CLOEXEC);
}

// An applied tail behind the commit record is cut off again by an abort,
// and the committed application metadata outlives the tree that wrote it.
// (Rows outliving their tree, and other programs seeing committed states
// only, are the daily work of the durability and fault-injection suites.)
TEST_F(Persistent, AbortCutsOffTheAppliedTailAndMetadataOutlivesItsTree) {
  sr_opaque_handle_t table = create_named_counts("/disk/t", Explicit);
  ASSERT_EQ(add_named(table, "a", 1), 0);
  auto metadata = zeroed_block<qv_binary_t>(4);
  metadata->length = 4;
  std::memcpy(metadata->data, "meta", 4);
  ASSERT_EQ(sr_set_application_metadata_1(table, metadata.get()), 0);
  apply_commit(table);
  const std::string committed = file_bytes(path("t"));
  ASSERT_EQ(add_named(table, "b", 2), 0);
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  EXPECT_GT(file_bytes(path("t")).size(), committed.size());
  ASSERT_EQ(sr_abort_1(table), 0);
  EXPECT_EQ(file_bytes(path("t")), committed);

  sr_opaque_handle_t reader_tree = second_tree();
  sr_opaque_handle_t reader = nullptr;
  ASSERT_EQ(sr_open_table_1(reader_tree, "/disk/t", 1, &reader), 0);
  EXPECT_EQ(count_of(reader, "a", 0), 1);
  EXPECT_EQ(object(reader)->change_counter, object(table)->change_counter);
  qv_binary_t *p_read = nullptr;
  ASSERT_EQ(sr_get_application_metadata_1(reader, &p_read), 0);
  EXPECT_EQ(std::string(reinterpret_cast<char *>(p_read->data), p_read->length), "meta");
  std::free(p_read);
  EXPECT_EQ(sr_close_tree_1(reader_tree), 0);
}

TEST_F(Persistent, ARewriteLeavesOnlyTheLiveRows) {
  sr_opaque_handle_t table = create_named_counts("/disk/big", Explicit, SR_PRIMARY_KEY_NOCHECK);
  const std::string note(300, 'n');
  for (int row = 0; row < 100; ++row) {
    const std::string key = std::to_string(row);
    ASSERT_EQ(add_fields(table, {{"name", string_value(key.c_str())},
                                 {"note", string_value(note.c_str())}}),
              0);
  }
  apply_commit(table);
  for (int row = 0; row < 90; ++row) {
    ASSERT_EQ(sr_delete_row_by_index_1(table, static_cast<uint32_t>(row)), 0);
  }
  apply_commit(table);
  const size_t before = file_bytes(path("big")).size();
  ASSERT_GT(before, 16384u);
  ASSERT_EQ(sr_i_rewrite_wanted(object(table)), 1u);

  ASSERT_EQ(sr_apply_1(table, 0), 0);
  EXPECT_EQ(object(table)->ready_for_commit, Sr_Applied_By_Rewrite);
  EXPECT_TRUE(std::filesystem::exists(path("big.rewrite")));
  ASSERT_EQ(sr_commit_1(table), 0);
  EXPECT_FALSE(std::filesystem::exists(path("big.rewrite")));
  EXPECT_LT(file_bytes(path("big")).size(), before / 4);

  // The rewritten file is a committed state of its own, and appends go on
  // from it.
  ASSERT_EQ(add_named(table, "new", 7), 0);
  apply_commit(table);
  sr_opaque_handle_t other = second_tree();
  sr_opaque_handle_t reader = nullptr;
  ASSERT_EQ(sr_open_table_1(other, "/disk/big", 1, &reader), 0);
  EXPECT_EQ(object(reader)->total_committed_rows, 11u);
  EXPECT_EQ(count_of(reader, "new", 0), 7);
  EXPECT_EQ(string_at_fixed(reader, fixed_index_of(reader, "95"), "note", 0), note);
  EXPECT_EQ(sr_close_tree_1(other), 0);
}

TEST_F(Persistent, DamagedFilesAreRefusedWithACode) {
  sr_opaque_handle_t table = create_named_counts("/disk/t", Implicit);
  ASSERT_EQ(add_named(table, "a", 1), 0);
  ASSERT_EQ(add_named(table, "b", 2), 0);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
  ASSERT_EQ(sr_close_table_1(table), 0);
  const std::string good = file_bytes(path("t"));
  const uint32_t metadata_length = word_at(good, 0);
  const uint32_t first_row = metadata_length + 24;  // behind the first commit record

  auto open_with = [&](const std::string &bytes) {
    write_file(path("t"), bytes);
    sr_opaque_handle_t opened = nullptr;
    const int32_t rc = sr_open_table_1(tree_, "/disk/t", 1, &opened);
    if (rc == 0) {
      sr_close_table_1(opened);
    }
    return rc;
  };
  auto with_word = [&](size_t offset, uint32_t word) {
    std::string bad = good;
    std::memcpy(bad.data() + offset, &word, 4);
    return bad;
  };
  EXPECT_EQ(open_with(good.substr(0, 12)), SR_E_TABLE_UNREADABLE);
  EXPECT_EQ(open_with(good.substr(0, metadata_length)), SR_E_NO_COMMIT_RECORD);
  EXPECT_EQ(open_with(with_word(first_row, 0)), SR_E_TABLE_UNREADABLE);
  EXPECT_EQ(open_with(with_word(first_row + 8, 9)), SR_E_TABLE_UNREADABLE);
  EXPECT_EQ(open_with(with_word(0, 0xFFFF)), SR_E_TABLE_UNREADABLE);
  // A row record replacing something that is not a current row.
  EXPECT_EQ(open_with(with_word(first_row + 12, 5)), SR_E_NO_REPLACED_ROW);
  // Every single-byte corruption opens or fails cleanly.
  for (size_t at = 0; at < good.size(); ++at) {
    std::string bad = good;
    bad[at] ^= 0x5A;
    const int32_t rc = open_with(bad);
    EXPECT_TRUE(rc == 0 || rc == SR_E_TABLE_UNREADABLE || rc == SR_E_NO_REPLACED_ROW ||
                rc == SR_E_NO_DELETED_ROW || rc == SR_E_NO_COMMIT_RECORD ||
                rc == SR_E_DUPLICATE_KEY)
        << "byte " << at << " gave " << rc;
  }
  write_file(path("t"), good);
  sr_opaque_handle_t opened = nullptr;
  ASSERT_EQ(sr_open_table_1(tree_, "/disk/t", 1, &opened), 0);
  EXPECT_EQ(count_of(opened, "b", 0), 2);
}

TEST_F(Persistent, RepairRemovesLeftoverRewriteFilesOnlyWhenNoWriterHoldsThem) {
  ASSERT_EQ(sr_close_table_1(create_named_counts("/disk/t", Implicit)), 0);
  const auto table_file = file_bytes(path("t"));
  write_file(path("t.rewrite"), "\1\2\3");
  ASSERT_NE(create_named_counts("/transient", Implicit), nullptr);
  const char *paths[] = {"/transient", "/disk/t", "/disk/never"};
  EXPECT_EQ(sr_repair_tables_1(tree_, paths, 3), 0);
  EXPECT_FALSE(std::filesystem::exists(path("t.rewrite")));
  EXPECT_EQ(file_bytes(path("t")), table_file);
  // A side file whose lock is held is a live writer's, here or elsewhere.
  write_file(path("t.rewrite"), "\1\2\3");
  const int writer = ::open(path("t.rewrite").c_str(), O_RDWR | O_CLOEXEC);
  ASSERT_GE(writer, 0);
  struct flock whole {};
  whole.l_type = F_WRLCK;
  whole.l_whence = SEEK_SET;
  ASSERT_EQ(::fcntl(writer, F_OFD_SETLK, &whole), 0);
  EXPECT_EQ(sr_repair_tables_1(tree_, paths, 3), 0);
  EXPECT_EQ(file_bytes(path("t.rewrite")), "\1\2\3");
  ASSERT_EQ(::close(writer), 0);
  EXPECT_EQ(sr_repair_tables_1(tree_, paths, 3), 0);
  EXPECT_FALSE(std::filesystem::exists(path("t.rewrite")));
  EXPECT_EQ(sr_repair_tables_1(tree_, nullptr, 0), 0);
  EXPECT_EQ(sr_repair_tables_1(tree_, nullptr, 1), SR_E_NULL_POINTER);
  EXPECT_EQ(sr_repair_tables_1(nullptr, paths, 1), SR_E_INVALID_HANDLE);
  const char *bad[] = {"/disk/t", "no-slash"};
  EXPECT_EQ(sr_repair_tables_1(tree_, bad, 2), SR_E_INVALID_PATH);

  // The older layout's entry point reads the same file.
  sr_opaque_handle_t table = nullptr;
  ASSERT_EQ(sr_i_open_table_vorel_format(tree_, "/disk/t", 1, nullptr, &table), 0);
  EXPECT_EQ(sr_i_open_table_vorel_format(tree_, "/disk/t", 0, nullptr, &table), SR_E_INVALID_MODE);
}

}  // namespace
