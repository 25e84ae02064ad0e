// Apply, commit and abort of transient tables, and deletion: the
// transaction states and their refusals, change counters, the committed and
// applied views of added and deleted rows, the packed index compacted at
// commit and abort, implicitly controlled tables committing every change,
// and no record left behind in the pool.

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <set>

#include "sr_i_hash_table.h"
#include "sr_i_rows.h"
#include "sr_i_transaction.h"
#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

class Transactions : public RowTables {
 protected:
  // Every packed position names a row index entry that names it back, and
  // the packed rows are exactly the rows with an applied or committed
  // record.
  static void expect_consistent_indexes(sr_opaque_handle_t table) {
    const sr_i_table_t *p = object(table);
    std::set<uint32_t> packed;
    for (uint32_t at = 0; at < p->total_applied_rows; ++at) {
      const uint32_t fixed = p->p_rows_packed_index[at];
      ASSERT_LT(fixed, p->maximum_rows);
      EXPECT_EQ(p->p_rows_fixed_index[fixed].packed_index, at);
      EXPECT_TRUE(packed.insert(fixed).second) << "row listed twice: " << fixed;
    }
    for (uint32_t fixed = 0; fixed < p->maximum_rows; ++fixed) {
      const sr_i_index_entry_t &entry = p->p_rows_fixed_index[fixed];
      const bool holds_row = entry.p_applied != nullptr || entry.p_committed != nullptr;
      EXPECT_EQ(holds_row, packed.count(fixed) == 1) << fixed;
    }
  }
};

TEST_F(Transactions, StatesRefuseWhatTheyMust) {
  sr_opaque_handle_t table = create_named_counts("/tx/states", Explicit);
  EXPECT_EQ(sr_commit_1(table), 0);  // nothing applied, nothing pending
  ASSERT_EQ(add_named(table, "a", 1), 0);
  EXPECT_EQ(sr_commit_1(table), SR_E_NOT_APPLIED);

  ASSERT_EQ(sr_apply_1(table, 0), 0);
  EXPECT_EQ(object(table)->ready_for_commit, Sr_Applied_In_Place);
  EXPECT_EQ(sr_apply_1(table, 0), SR_E_APPLIED_UNCOMMITTED);
  EXPECT_EQ(sr_delete_rows_1(table, nullptr), SR_E_APPLIED_UNCOMMITTED);
  EXPECT_EQ(count_of(table, "a", 0), -1);  // not committed yet
  EXPECT_EQ(count_of(table, "a", 1), 1);
  ASSERT_EQ(sr_commit_1(table), 0);
  EXPECT_EQ(object(table)->ready_for_commit, Sr_Nothing_Applied);
  EXPECT_EQ(count_of(table, "a", 0), 1);

  // Apply with nothing pending still moves the counter.
  const uint64_t counter = object(table)->change_counter;
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);
  EXPECT_EQ(object(table)->change_counter, counter + 1);

  EXPECT_EQ(sr_apply_1(nullptr, 0), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_commit_1(nullptr), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_abort_1(nullptr), SR_E_INVALID_HANDLE);
}

TEST_F(Transactions, TheCallersCounterCountsOnlyOnExplicitTables) {
  sr_opaque_handle_t explicit_table = create_numbered("/tx/counter/explicit", Explicit);
  EXPECT_EQ(object(explicit_table)->change_counter, 1u);
  ASSERT_EQ(sr_apply_1(explicit_table, 42), 0);
  ASSERT_EQ(sr_commit_1(explicit_table), 0);
  EXPECT_EQ(object(explicit_table)->change_counter, 42u);
  ASSERT_EQ(sr_apply_1(explicit_table, 0), 0);
  ASSERT_EQ(sr_abort_1(explicit_table), 0);
  EXPECT_EQ(object(explicit_table)->change_counter, 42u);  // abort keeps the committed one

  sr_opaque_handle_t implicit_table = create_numbered("/tx/counter/implicit", Implicit);
  ASSERT_EQ(add_numbered(implicit_table, 1, 1), 0);
  EXPECT_EQ(object(implicit_table)->change_counter, 2u);
  ASSERT_EQ(sr_apply_1(implicit_table, 99), 0);
  ASSERT_EQ(sr_commit_1(implicit_table), 0);
  EXPECT_EQ(object(implicit_table)->change_counter, 3u);
}

TEST_F(Transactions, DeletedRowsStayInTheCommittedViewUntilCommit) {
  sr_opaque_handle_t table = create_named_counts("/tx/delete", Explicit);
  for (const char *p_name : {"a", "b", "c"}) {
    ASSERT_EQ(add_named(table, p_name, static_cast<int32_t>(p_name[0])), 0);
  }
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);
  const uint32_t b = fixed_index_of(table, "b");
  const uint32_t b_packed = object(table)->p_rows_fixed_index[b].packed_index;

  ASSERT_EQ(sr_delete_row_by_index_1(table, b_packed), 0);
  EXPECT_EQ(sr_delete_row_by_index_1(table, b_packed), SR_E_ROW_DELETED);
  EXPECT_EQ(sr_delete_row_by_index_1(table, 3), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(state_of(table, b), SR_ROW_STATE_DELETED);
  EXPECT_EQ(count_of(table, "b", 0), 'b');
  EXPECT_EQ(count_of(table, "b", 1), -1);
  EXPECT_EQ(object(table)->total_applied_rows, 3u);  // packed place kept until commit

  ASSERT_EQ(sr_abort_1(table), 0);
  EXPECT_EQ(state_of(table, b), SR_ROW_STATE_COMMITTED);
  EXPECT_EQ(count_of(table, "b", 1), 'b');
  expect_consistent_indexes(table);

  ASSERT_EQ(sr_delete_row_by_index_1(table, b_packed), 0);
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);
  EXPECT_EQ(state_of(table, b), SR_ROW_STATE_NO_ROW);
  EXPECT_EQ(object(table)->total_applied_rows, 2u);
  EXPECT_EQ(object(table)->total_committed_rows, 2u);
  expect_consistent_indexes(table);
  EXPECT_EQ(count_of(table, "a", 0), 'a');
  EXPECT_EQ(count_of(table, "c", 0), 'c');
}

TEST_F(Transactions, ARowAddedAndDeletedBeforeCommitLeavesNoTrace) {
  std::vector<sr_column_t> columns = {column("handle", QV_RSRC_HANDLE_PTR, SR_PRIMARY_KEY),
                                      column("count", QV_INT32, SR_STANDARD)};
  sr_opaque_handle_t table = nullptr;
  ASSERT_EQ(sr_create_table_1(tree_, "/tx/transient", columns.data(), 2, Explicit, &table), 0);
  const uint32_t used_before = object(table)->record_buffer_pool.used_bytes;
  qv_resource_handle_t handle{};
  handle.id.id4 = 5;
  qv_value_t key{}, count = int32_value(1);
  key.ptr_rsrc_handle = &handle;
  const char *names[] = {"handle", "count"};
  qv_value_t *values[] = {&key, &count};

  ASSERT_EQ(sr_add_row_1(table, names, values, 2), 0);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
  EXPECT_EQ(state_of(table, 0), SR_ROW_STATE_NO_ROW);
  // The key is free again at once: adding it makes a new row.
  ASSERT_EQ(sr_add_row_1(table, names, values, 2), 0);
  ASSERT_EQ(sr_delete_rows_1(table, nullptr), 0);
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);

  EXPECT_EQ(object(table)->total_applied_rows, 0u);
  EXPECT_EQ(object(table)->record_buffer_pool.used_bytes, used_before);
  uint32_t fixed = 0;
  EXPECT_EQ(sr_get_fixed_row_index_for_key_1(table, key, &fixed), SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(sr_delete_rows_1(table, nullptr), SR_E_NO_ROWS);
  expect_consistent_indexes(table);
}

TEST_F(Transactions, AbortDropsAddedRowsAndCompactsThePackedIndex) {
  sr_opaque_handle_t table = create_named_counts("/tx/abort", Explicit, SR_PRIMARY_KEY_NOCHECK);
  for (const char *p_name : {"a", "b"}) {
    ASSERT_EQ(add_named(table, p_name, 1), 0);
  }
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);
  const uint32_t used_committed = object(table)->record_buffer_pool.used_bytes;
  for (const char *p_name : {"c", "d", "e"}) {
    ASSERT_EQ(add_named(table, p_name, 2), 0);
  }
  ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 3), 0);
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_abort_1(table), 0);

  EXPECT_EQ(object(table)->total_applied_rows, 2u);
  EXPECT_EQ(object(table)->applied_deletions, 0u);
  EXPECT_EQ(object(table)->ready_for_commit, Sr_Nothing_Applied);
  EXPECT_EQ(object(table)->p_rows_change_list, nullptr);
  EXPECT_EQ(object(table)->p_delete_rows_change_list, nullptr);
  EXPECT_EQ(object(table)->record_buffer_pool.used_bytes, used_committed);
  expect_consistent_indexes(table);
  EXPECT_EQ(count_of(table, "a", 1), 1);
  EXPECT_EQ(count_of(table, "c", 1), -1);
}

TEST_F(Transactions, DeletingEveryRowCountsOnlyLiveRows) {
  sr_opaque_handle_t table = create_numbered("/tx/all", Explicit);
  EXPECT_EQ(sr_delete_rows_1(table, nullptr), SR_E_NO_ROWS);
  for (int32_t id = 0; id < 5; ++id) {
    ASSERT_EQ(add_numbered(table, id, id), 0);
  }
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 2), 0);
  ASSERT_EQ(sr_delete_rows_1(table, nullptr), 0);
  EXPECT_EQ(object(table)->applied_deletions, 5u);
  EXPECT_EQ(sr_delete_rows_1(table, nullptr), SR_E_NO_ROWS);
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);
  EXPECT_EQ(object(table)->total_committed_rows, 0u);
  expect_consistent_indexes(table);
}

TEST_F(Transactions, ImplicitTablesCommitEveryChange) {
  sr_opaque_handle_t table = create_named_counts("/tx/implicit", Implicit);
  ASSERT_EQ(add_named(table, "a", 1), 0);
  EXPECT_EQ(count_of(table, "a", 0), 1);
  EXPECT_EQ(object(table)->p_rows_change_list, nullptr);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
  EXPECT_EQ(count_of(table, "a", 0), -1);
  EXPECT_EQ(object(table)->total_committed_rows, 0u);

  alignas(qv_binary_t) unsigned char block[sizeof(qv_binary_t) + 3] = {};
  auto *p_metadata = reinterpret_cast<qv_binary_t *>(block);
  p_metadata->length = 3;
  std::memcpy(p_metadata->data, "xyz", 3);
  ASSERT_EQ(sr_set_application_metadata_1(table, p_metadata), 0);
  EXPECT_EQ(object(table)->ready_for_commit, Sr_Nothing_Applied);
  qv_binary_t *p_read = nullptr;
  ASSERT_EQ(sr_get_application_metadata_1(table, &p_read), 0);  // the committed view
  EXPECT_EQ(p_read->length, 3u);
  std::free(p_read);
}

TEST_F(Transactions, RepeatedAddAndDeleteReturnsThePoolToWhereItWas) {
  sr_opaque_handle_t table = create_named_counts("/tx/pool", Implicit, SR_PRIMARY_KEY_NOCHECK);
  ASSERT_EQ(add_named(table, "warm-up", 1), 0);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
  const uint32_t used = object(table)->record_buffer_pool.used_bytes;
  const uint32_t total = object(table)->record_buffer_pool.total_bytes;
  for (int round = 0; round < 200; ++round) {
    ASSERT_EQ(add_named(table, "row", round), 0);
    ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
  }
  EXPECT_EQ(object(table)->record_buffer_pool.used_bytes, used);
  EXPECT_EQ(object(table)->record_buffer_pool.total_bytes, total);
}

TEST_F(Transactions, SecondaryAccessIsRebuiltFromCommittedRows) {
  std::vector<sr_column_t> columns = {column("handle", QV_RSRC_HANDLE_PTR, SR_PRIMARY_KEY),
                                      column("count", QV_INT32, SR_STANDARD)};
  sr_opaque_handle_t table = nullptr;
  ASSERT_EQ(sr_create_table_1(tree_, "/tx/rebuild", columns.data(), 2, Explicit, &table), 0);
  qv_resource_handle_t handles[4] = {};
  for (uint32_t at = 0; at < 4; ++at) {
    handles[at].id.id4 = 100 + at;
    qv_value_t key{}, count = int32_value(static_cast<int32_t>(at));
    key.ptr_rsrc_handle = &handles[at];
    const char *names[] = {"handle", "count"};
    qv_value_t *values[] = {&key, &count};
    ASSERT_EQ(sr_add_row_1(table, names, values, 2), 0);
  }
  ASSERT_EQ(sr_delete_row_by_index_1(table, 1), 0);
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);

  // Forget the packed index and the hash table, as a freshly loaded table
  // has them, and rebuild both.
  sr_i_table_t *p = object(table);
  ASSERT_EQ(sr_i_hash_table_close(p->p_rows_hash_table), 0);
  ASSERT_EQ(sr_i_hash_table_open(0, nullptr, nullptr, &p->p_rows_hash_table), 0);
  for (uint32_t fixed = 0; fixed < p->maximum_rows; ++fixed) {
    p->p_rows_fixed_index[fixed].packed_index = 0xFFFFFFFFu;
    p->p_rows_fixed_index[fixed].p_hash_table_element = nullptr;
  }
  std::memset(p->p_rows_packed_index, 0xFF, sizeof(uint32_t) * p->maximum_rows);
  ASSERT_EQ(sr_i_establish_secondary_row_access(p), 0);

  EXPECT_EQ(p->p_rows_packed_index[0], 0u);
  EXPECT_EQ(p->p_rows_packed_index[1], 2u);
  EXPECT_EQ(p->p_rows_packed_index[2], 3u);
  for (const uint32_t at : {0u, 2u, 3u}) {
    qv_value_t key{};
    key.ptr_rsrc_handle = &handles[at];
    uint32_t fixed = 0;
    ASSERT_EQ(sr_get_fixed_row_index_for_key_1(table, key, &fixed), 0);
    EXPECT_EQ(fixed, at);
    EXPECT_NE(p->p_rows_fixed_index[fixed].p_hash_table_element, nullptr);
  }
}

}  // namespace
