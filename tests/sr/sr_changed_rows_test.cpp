// The rows with pending changes and the rows that share a key, through the
// exported calls: list order and the deletions behind the count; bucket and
// fixed-index order of duplicates, the view the caller's argument alone
// chooses, keys with a body of their own, arrays that must grow, and the
// refusals with their codes and messages.

#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <utility>
#include <vector>

#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

// A count and the fixed indexes a call handed out.
using counted_rows = std::pair<uint32_t, std::vector<uint32_t>>;

class ChangedRows : public RowTables {
 protected:
  void SetUp() override {
    unsetenv("SR_UNCOMMITTED_UPDATES_VISIBLE");
    RowTables::SetUp();
  }
  void TearDown() override {
    unsetenv("SR_UNCOMMITTED_UPDATES_VISIBLE");
    RowTables::TearDown();
  }

  // An int32 key "id" that may repeat, and an int32 "count".
  sr_opaque_handle_t make_repeating(const char *p_path, sr_hash_function_t p_hash = nullptr) {
    return make_table(p_path,
                      {column("id", QV_INT32, SR_PRIMARY_KEY_NOCHECK), column("count", QV_INT32)},
                      Explicit, p_hash);
  }

  static uint32_t fixed_of(sr_opaque_handle_t table, int32_t id) {
    uint32_t fixed = 0xFFFFFFFFu;
    EXPECT_EQ(sr_get_fixed_row_index_for_key_1(table, int32_value(id), &fixed), 0);
    return fixed;
  }

  static int32_t set_count(sr_opaque_handle_t table, int32_t id, int32_t count) {
    const qv_value_t value = int32_value(count);
    return sr_set_field_by_key_1(table, int32_value(id), "count", &value);
  }

  // sr_get_updated_rows_1, reading the `deletions` entries that lie beyond
  // the count too. The array is null exactly when nothing is listed.
  static counted_rows updated(sr_opaque_handle_t table, uint32_t deletions) {
    uint32_t count = 99;
    uint32_t *p_rows = &count;
    EXPECT_EQ(sr_get_updated_rows_1(table, &count, &p_rows), 0);
    EXPECT_EQ(p_rows == nullptr, count + deletions == 0);
    std::vector<uint32_t> rows;
    if (p_rows != nullptr) {
      rows.assign(p_rows, p_rows + count + deletions);
    }
    std::free(p_rows);
    return {count, rows};
  }

  // sr_get_duplicate_rows_1: the code and the rows found.
  static std::pair<int32_t, std::vector<uint32_t>> duplicates(sr_opaque_handle_t table,
                                                              qv_value_t key, uint32_t visible) {
    uint32_t count = 0;
    uint32_t *p_rows = nullptr;
    const int32_t rc = sr_get_duplicate_rows_1(table, key, &count, &p_rows, visible);
    std::vector<uint32_t> rows;
    if (rc == 0) {
      rows.assign(p_rows, p_rows + count);
      std::free(p_rows);
    }
    return {rc, rows};
  }
  static std::vector<uint32_t> found(sr_opaque_handle_t table, qv_value_t key, uint32_t visible) {
    const auto [rc, rows] = duplicates(table, key, visible);
    EXPECT_EQ(rc, 0);
    return rows;
  }
};

TEST_F(ChangedRows, UpdatedRowsAreAdditionsAndUpdatesThenDeletionsInListOrder) {
  sr_opaque_handle_t table = create_numbered("/updated", Explicit);
  EXPECT_EQ(updated(table, 0), counted_rows(0, {}));
  for (int32_t id = 1; id <= 4; ++id) {
    ASSERT_EQ(add_numbered(table, id, 0), 0);
  }
  apply_commit(table);
  EXPECT_EQ(updated(table, 0), counted_rows(0, {}));
  const uint32_t one = fixed_of(table, 1);
  const uint32_t two = fixed_of(table, 2);
  const uint32_t three = fixed_of(table, 3);
  const uint32_t four = fixed_of(table, 4);

  // Only deletions: none counted, both listed, in the order deleted (a
  // deleted row keeps its packed place until commit).
  ASSERT_EQ(sr_delete_row_by_index_1(table, 2), 0);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
  EXPECT_EQ(updated(table, 2), counted_rows(0, {three, one}));
  ASSERT_EQ(sr_abort_1(table), 0);

  // Rows in the order first changed, each once however often changed, the
  // deletion last.
  ASSERT_EQ(set_count(table, 4, 1), 0);
  ASSERT_EQ(add_numbered(table, 5, 0), 0);
  ASSERT_EQ(set_count(table, 5, 2), 0);
  ASSERT_EQ(set_count(table, 2, 1), 0);
  ASSERT_EQ(set_count(table, 4, 2), 0);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
  EXPECT_EQ(updated(table, 1), counted_rows(3, {four, fixed_of(table, 5), two, one}));
}

TEST_F(ChangedRows, DuplicatesComeInBucketOrFixedIndexOrderFromTheViewTheArgumentChooses) {
  // Both tables show uncommitted updates to their reads; here the argument
  // alone decides.
  setenv("SR_UNCOMMITTED_UPDATES_VISIBLE", "1", 1);
  sr_opaque_handle_t hashed = make_repeating("/dup/hashed", one_bucket);
  sr_opaque_handle_t walked = make_repeating("/dup/walked");
  for (sr_opaque_handle_t table : {hashed, walked}) {
    ASSERT_NE(object(table)->uncommitted_updates_visible, 0u);
    // Fixed indexes 0 to 3, committed; then 4 and 5 added, 2 deleted.
    for (const int32_t id : {7, 8, 7, 7}) {
      ASSERT_EQ(add_numbered(table, id, 0), 0);
    }
    apply_commit(table);
    ASSERT_EQ(add_numbered(table, 7, 0), 0);
    ASSERT_EQ(add_numbered(table, 10, 0), 0);
    ASSERT_EQ(sr_delete_row_by_index_1(table, 2), 0);
  }
  // Every key shares the one bucket: the newest row first.
  EXPECT_EQ(found(hashed, int32_value(7), 0), (std::vector<uint32_t>{3, 2, 0}));
  EXPECT_EQ(found(hashed, int32_value(7), 1), (std::vector<uint32_t>{4, 3, 0}));
  EXPECT_EQ(found(walked, int32_value(7), 0), (std::vector<uint32_t>{0, 2, 3}));
  EXPECT_EQ(found(walked, int32_value(7), 1), (std::vector<uint32_t>{0, 3, 4}));
  for (sr_opaque_handle_t table : {hashed, walked}) {
    EXPECT_EQ(found(table, int32_value(8), 0), std::vector<uint32_t>{1});
    // A key only an uncommitted row holds.
    EXPECT_EQ(duplicates(table, int32_value(10), 0).first, SR_E_NO_ROW_FOR_KEY);
    EXPECT_EQ(found(table, int32_value(10), 1), std::vector<uint32_t>{5});
  }
}

TEST_F(ChangedRows, KeysWithABodyOfTheirOwnCompareByValue) {
  // A handle key gets the built-in hash table: the bucket from id4, the
  // handle compared whole.
  sr_opaque_handle_t handles = make_table(
      "/dup/handles",
      {column("handle", QV_RSRC_HANDLE_PTR, SR_PRIMARY_KEY_NOCHECK), column("count", QV_INT32)},
      Explicit);
  ASSERT_NE(object(handles)->p_rows_hash_table, nullptr);
  qv_resource_handle_t same{};
  same.id.id1 = 1;
  same.id.id4 = 5;
  qv_resource_handle_t other = same;
  other.id.id1 = 2;
  for (qv_resource_handle_t *p_handle : {&same, &other, &same}) {
    qv_value_t key{};
    key.ptr_rsrc_handle = p_handle;
    ASSERT_EQ(add_fields(handles, {{"handle", key}, {"count", int32_value(0)}}), 0);
  }
  qv_resource_handle_t copy = same;
  qv_value_t key{};
  key.ptr_rsrc_handle = &copy;
  EXPECT_EQ(found(handles, key, 1), (std::vector<uint32_t>{2, 0}));

  // Strings without a hash table; a null pointer stands for the empty string.
  sr_opaque_handle_t names = create_named_counts("/dup/names", Explicit, SR_PRIMARY_KEY_NOCHECK);
  for (const char *p_name : {"", "same", ""}) {
    ASSERT_EQ(add_named(names, p_name, 0), 0);
  }
  apply_commit(names);
  const std::string text = "same";
  EXPECT_EQ(found(names, string_value(text.c_str()), 0), std::vector<uint32_t>{1});
  EXPECT_EQ(found(names, string_value(nullptr), 0), (std::vector<uint32_t>{0, 2}));
}

TEST_F(ChangedRows, ManyDuplicatesAllCome) {
  sr_opaque_handle_t hashed = make_repeating("/many/hashed", four_buckets);
  sr_opaque_handle_t walked = make_repeating("/many/walked");
  std::vector<uint32_t> threes;
  for (uint32_t row = 0; row < 30; ++row) {
    const int32_t id = row % 6 == 5 ? 4 : 3;
    for (sr_opaque_handle_t table : {hashed, walked}) {
      ASSERT_EQ(add_numbered(table, id, static_cast<int32_t>(row)), 0);
    }
    if (id == 3) {
      threes.push_back(row);
    }
  }
  ASSERT_EQ(threes.size(), 25u);
  EXPECT_EQ(found(walked, int32_value(3), 1), threes);
  EXPECT_EQ(found(hashed, int32_value(3), 1),
            std::vector<uint32_t>(threes.rbegin(), threes.rend()));
}

TEST_F(ChangedRows, RefusalsLeaveTheCallersPointersAlone) {
  sr_opaque_handle_t table = create_numbered("/refused", Explicit);
  ASSERT_EQ(add_numbered(table, 1, 0), 0);
  apply_commit(table);
  uint32_t count = 77;
  uint32_t *p_rows = &count;
  const qv_value_t key = int32_value(1);
  EXPECT_EQ(sr_get_updated_rows_1(nullptr, &count, &p_rows), SR_E_INVALID_HANDLE);
  EXPECT_EQ(last_error().first, SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_get_duplicate_rows_1(nullptr, key, &count, &p_rows, 0), SR_E_INVALID_HANDLE);
  EXPECT_EQ(last_error().first, SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_get_updated_rows_1(table, nullptr, &p_rows), SR_E_NULL_POINTER);
  EXPECT_EQ(sr_get_updated_rows_1(table, &count, nullptr), SR_E_NULL_POINTER);
  EXPECT_EQ(sr_get_duplicate_rows_1(table, key, nullptr, &p_rows, 0), SR_E_NULL_POINTER);
  EXPECT_EQ(sr_get_duplicate_rows_1(table, key, &count, nullptr, 0), SR_E_NULL_POINTER);
  EXPECT_EQ(last_error().first, SR_E_NULL_POINTER);

  EXPECT_EQ(sr_get_duplicate_rows_1(table, int32_value(-9), &count, &p_rows, 1),
            SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(last_error(),
            std::make_pair(SR_E_NO_ROW_FOR_KEY,
                           std::string("2605-213 There is no row corresponding to the specified "
                                       "key value (-9) in table (/refused).\n")));
  EXPECT_EQ(count, 77u);
  EXPECT_EQ(p_rows, &count);
  EXPECT_EQ(found(table, key, 0), std::vector<uint32_t>{0});
  EXPECT_EQ(last_error().first, 0);
}

}  // namespace
