// Apply, commit and abort of transient tables beyond what the row model
// test checks: change counters, the packed index compacted at commit and
// abort, implicitly controlled tables committing every change, and no
// record left behind in the pool.

#include <gtest/gtest.h>

#include <set>

#include "rows/sr_i_transaction.h"
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

TEST_F(Transactions, TheCallersCounterCountsOnlyOnExplicitTables) {
  sr_opaque_handle_t explicit_table = create_numbered("/tx/counter/explicit", Explicit);
  EXPECT_EQ(object(explicit_table)->change_counter, 1u);
  ASSERT_EQ(sr_apply_1(explicit_table, 42), 0);
  ASSERT_EQ(sr_commit_1(explicit_table), 0);
  EXPECT_EQ(object(explicit_table)->change_counter, 42u);
  ASSERT_EQ(sr_apply_1(explicit_table, 0), 0);
  ASSERT_EQ(sr_abort_1(explicit_table), 0);
  EXPECT_EQ(object(explicit_table)->change_counter, 42u);  // abort keeps the committed one
  apply_commit(explicit_table);  // with nothing pending the counter still moves
  EXPECT_EQ(object(explicit_table)->change_counter, 43u);

  sr_opaque_handle_t implicit_table = create_numbered("/tx/counter/implicit", Implicit);
  ASSERT_EQ(add_numbered(implicit_table, 1, 1), 0);
  EXPECT_EQ(object(implicit_table)->change_counter, 2u);
  ASSERT_EQ(sr_apply_1(implicit_table, 99), 0);
  ASSERT_EQ(sr_commit_1(implicit_table), 0);
  EXPECT_EQ(object(implicit_table)->change_counter, 3u);
}

TEST_F(Transactions, RowsThatNeverCommitLeaveNoTraceAndNoRecord) {
  sr_opaque_handle_t table = create_named_counts("/tx/abort", Explicit, SR_PRIMARY_KEY_NOCHECK);
  const uint32_t used_empty = object(table)->record_buffer_pool.used_bytes;
  for (const char *p_name : {"a", "b"}) {
    ASSERT_EQ(add_named(table, p_name, 1), 0);
  }
  apply_commit(table);
  const uint32_t used_committed = object(table)->record_buffer_pool.used_bytes;
  // Aborted: three rows added, one of them deleted again, a committed row
  // deleted.
  for (const char *p_name : {"c", "d", "e"}) {
    ASSERT_EQ(add_named(table, p_name, 2), 0);
  }
  ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 3), 0);
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_abort_1(table), 0);
  EXPECT_EQ(object(table)->total_applied_rows, 2u);
  EXPECT_EQ(sr_delete_row_by_index_1(table, 2), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(object(table)->applied_deletions, 0u);
  EXPECT_EQ(object(table)->ready_for_commit, Sr_Nothing_Applied);
  EXPECT_EQ(object(table)->p_rows_change_list, nullptr);
  EXPECT_EQ(object(table)->p_delete_rows_change_list, nullptr);
  EXPECT_EQ(object(table)->record_buffer_pool.used_bytes, used_committed);
  expect_consistent_indexes(table);
  EXPECT_EQ(count_of(table, "a", 1), 1);
  EXPECT_EQ(count_of(table, "c", 1), -1);

  // Committed: a row added and deleted again, then every row deleted.
  ASSERT_EQ(add_named(table, "x", 3), 0);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 2), 0);
  ASSERT_EQ(sr_delete_rows_1(table, nullptr), 0);
  apply_commit(table);
  EXPECT_EQ(object(table)->total_applied_rows, 0u);
  EXPECT_EQ(object(table)->record_buffer_pool.used_bytes, used_empty);
  EXPECT_EQ(sr_delete_rows_1(table, nullptr), SR_E_NO_ROWS);
  expect_consistent_indexes(table);
}

TEST_F(Transactions, ImplicitTablesCommitEveryChange) {
  sr_opaque_handle_t table = create_named_counts("/tx/implicit", Implicit);
  ASSERT_EQ(add_named(table, "a", 1), 0);
  EXPECT_EQ(count_of(table, "a", 0), 1);
  qv_value_t two = int32_value(2);
  ASSERT_EQ(sr_set_field_by_key_1(table, string_value("a"), "count", &two), 0);
  EXPECT_EQ(count_of(table, "a", 0), 2);
  EXPECT_EQ(state_of(table, 0), SR_ROW_STATE_COMMITTED);
  EXPECT_EQ(object(table)->p_rows_change_list, nullptr);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
  EXPECT_EQ(count_of(table, "a", 0), -1);
  EXPECT_EQ(object(table)->total_committed_rows, 0u);
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

}  // namespace
