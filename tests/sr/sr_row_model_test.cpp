// Rows and transactions of transient tables. A randomised model test runs
// thousands of random adds, sets, deletes, applies, commits and aborts
// against a table and a plain reference model of its committed and applied
// views: after every step each key reads back as the model says in both
// views, the packed and fixed indexes name each other, and an abort gives
// back every record the transaction took. Beside it: change counters, and
// implicitly controlled tables committing every change.

#include <gtest/gtest.h>

#include <cstdlib>
#include <map>
#include <optional>
#include <random>
#include <set>
#include <string>

#include "rows/sr_i_transaction.h"
#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

struct row_values {
  int32_t count;
  std::string note;
  bool operator==(const row_values &) const = default;
};

// What the table should hold, kept the simplest way.
struct reference_model {
  std::map<uint32_t, row_values> committed, applied;
  bool ready_for_commit = false;
  bool changed = false;        // something pending or applied since the last commit or abort
  uint64_t settled_bytes = 0;  // the records held after the last commit or abort
};

// Every packed position names a row index entry that names it back; with
// nothing pending (`settled`) the packed rows are exactly the rows with an
// applied or committed record.
void expect_consistent_indexes(sr_opaque_handle_t table, bool settled) {
  const sr_i_table_t *p = object(table);
  std::set<uint32_t> packed;
  for (uint32_t at = 0; at < p->total_applied_rows; ++at) {
    const uint32_t fixed = p->p_rows_packed_index[at];
    ASSERT_LT(fixed, p->maximum_rows);
    ASSERT_EQ(p->p_rows_fixed_index[fixed].packed_index, at);
    ASSERT_TRUE(packed.insert(fixed).second) << "row listed twice: " << fixed;
  }
  for (uint32_t fixed = 0; settled && fixed < p->maximum_rows; ++fixed) {
    const sr_i_index_entry_t &entry = p->p_rows_fixed_index[fixed];
    const bool holds_row = entry.p_applied != nullptr || entry.p_committed != nullptr;
    ASSERT_EQ(holds_row, packed.count(fixed) == 1) << fixed;
  }
}

// The bytes of the records the table's pool hands out, their headers
// included: what the free records and the block headers leave of the
// pool's used bytes.
uint64_t allocated_bytes(sr_opaque_handle_t table) {
  const sr_i_record_buffer_pool_t &pool = object(table)->record_buffer_pool;
  uint64_t bytes = pool.used_bytes - uint64_t{pool.total_blocks} * Sr_Record_Buffer_Header_Length;
  for (const sr_i_record_metadata_t *p = pool.p_free_chain; p != nullptr; p = p->p_next) {
    bytes -= Sr_Record_Header_Length;
  }
  return bytes;
}

constexpr uint32_t Total_Keys = 12;

class RowModel : public RowTables {
 protected:
  void SetUp() override {
    RowTables::SetUp();
    std::vector<sr_column_t> columns = {column("handle", QV_RSRC_HANDLE_PTR, SR_PRIMARY_KEY),
                                        column("count", QV_INT32, SR_STANDARD),
                                        column("note", QV_CHAR_PTR, SR_STANDARD)};
    ASSERT_EQ(sr_create_table_1(tree_, "/model/t", columns.data(), 3, Explicit, &table_), 0);
    for (uint32_t key = 0; key < Total_Keys; ++key) {
      handles_[key].id.id1 = 0xABCD;
      handles_[key].id.id4 = key;
    }
  }

  qv_value_t key_value(uint32_t key) {
    qv_value_t value{};
    value.ptr_rsrc_handle = &handles_[key];
    return value;
  }

  int32_t add(uint32_t key, const row_values &values) {
    return add_fields(table_, {{"note", string_value(values.note.c_str())},
                               {"handle", key_value(key)},
                               {"count", int32_value(values.count)}});
  }

  int32_t set(uint32_t key, const row_values &values) {
    const field_list fields{{"count", int32_value(values.count)},
                            {"note", string_value(values.note.c_str())}};
    return sr_set_fields_by_key_1(table_, key_value(key), fields.names.data(),
                                  fields.pointers.data(), 2);
  }

  int32_t remove(uint32_t key) {
    uint32_t fixed = 0;
    if (const int32_t rc = sr_get_fixed_row_index_for_key_1(table_, key_value(key), &fixed);
        rc != 0) {
      return rc;
    }
    return sr_delete_row_by_index_1(table_, object(table_)->p_rows_fixed_index[fixed].packed_index);
  }

  std::optional<row_values> read(uint32_t key, uint32_t uncommitted) {
    qv_value_t count{}, note{};
    const char *names[] = {"count", "note"};
    qv_value_t *results[] = {&count, &note};
    const int32_t rc = sr_get_fields_by_key_and_visibility_1(table_, key_value(key), names, results,
                                                             2, uncommitted, nullptr);
    if (rc != 0) {
      EXPECT_TRUE(rc == SR_E_NO_ROW_FOR_KEY || rc == SR_E_ROW_DELETED) << rc;
      return std::nullopt;
    }
    row_values values{count.val_int32, note.ptr_char};
    std::free(note.ptr_char);
    return values;
  }

  void expect_table_matches(const reference_model &model, int step) {
    for (uint32_t key = 0; key < Total_Keys; ++key) {
      for (const uint32_t uncommitted : {0u, 1u}) {
        const auto &view = uncommitted ? model.applied : model.committed;
        const auto expected = view.find(key);
        const std::optional<row_values> actual = read(key, uncommitted);
        ASSERT_EQ(actual.has_value(), expected != view.end())
            << "step " << step << " key " << key << " view " << uncommitted;
        if (actual) {
          ASSERT_TRUE(*actual == expected->second)
              << "step " << step << " key " << key << " view " << uncommitted;
        }
      }
    }
    const sr_i_table_t *p = object(table_);
    ASSERT_EQ(p->total_applied_rows - p->applied_deletions, model.applied.size()) << step;
    if (!model.changed) {
      ASSERT_EQ(p->total_committed_rows, model.committed.size()) << step;
      ASSERT_EQ(p->ready_for_commit, Sr_Nothing_Applied) << step;
      ASSERT_EQ(p->applied_deletions, 0u) << step;
      ASSERT_EQ(p->p_rows_change_list, nullptr) << step;
      ASSERT_EQ(p->p_delete_rows_change_list, nullptr) << step;
    }
    ASSERT_NO_FATAL_FAILURE(expect_consistent_indexes(table_, !model.changed)) << step;
  }

  sr_opaque_handle_t table_ = nullptr;
  qv_resource_handle_t handles_[Total_Keys] = {};
};

TEST_F(RowModel, RandomTransactionsMatchTheReferenceModel) {
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937 random(seed);
  auto pick = [&](uint32_t below) {
    return std::uniform_int_distribution<uint32_t>(0, below - 1)(random);
  };
  auto random_values = [&] {
    // Notes up to 120 bytes push records past their first size estimate.
    return row_values{static_cast<int32_t>(random()), std::string(pick(120), char('a' + pick(26)))};
  };

  reference_model model;
  model.settled_bytes = allocated_bytes(table_);
  const uint64_t empty_bytes = model.settled_bytes;
  for (int step = 0; step < 6000; ++step) {
    const uint32_t key = pick(Total_Keys);
    const uint32_t operation = pick(100);
    if (operation < 30) {
      const row_values values = random_values();
      int32_t expected = 0;
      if (model.ready_for_commit) {
        expected = SR_E_APPLIED_UNCOMMITTED;
      } else if (model.applied.count(key) != 0) {
        expected = SR_E_DUPLICATE_KEY;
      }
      ASSERT_EQ(add(key, values), expected) << "add, step " << step;
      if (expected == 0) {
        model.applied[key] = values;
        model.changed = true;
      }
    } else if (operation < 55) {
      const row_values values = random_values();
      // The key is found while some view holds it; a row deleted in the
      // applied view is found and then refused.
      const bool found = model.applied.count(key) != 0 || model.committed.count(key) != 0;
      int32_t expected = 0;
      if (!found) {
        expected = SR_E_NO_ROW_FOR_KEY;
      } else if (model.ready_for_commit) {
        expected = SR_E_APPLIED_UNCOMMITTED;
      } else if (model.applied.count(key) == 0) {
        expected = SR_E_ROW_DELETED;
      }
      ASSERT_EQ(set(key, values), expected) << "set, step " << step;
      if (expected == 0) {
        model.applied[key] = values;
        model.changed = true;
      }
    } else if (operation < 72) {
      const bool found = model.applied.count(key) != 0 || model.committed.count(key) != 0;
      int32_t expected = 0;
      if (!found) {
        expected = SR_E_NO_ROW_FOR_KEY;
      } else if (model.applied.count(key) == 0) {
        expected = SR_E_ROW_DELETED;
      }
      // Deleting one row is allowed even while changes wait for commit.
      ASSERT_EQ(remove(key), expected) << "delete, step " << step;
      if (expected == 0) {
        model.applied.erase(key);
        model.changed = true;
      }
    } else if (operation < 74) {
      int32_t expected = 0;
      if (model.ready_for_commit) {
        expected = SR_E_APPLIED_UNCOMMITTED;
      } else if (model.applied.empty()) {
        expected = SR_E_NO_ROWS;
      }
      ASSERT_EQ(sr_delete_rows_1(table_, nullptr), expected) << "delete all, step " << step;
      if (expected == 0) {
        model.applied.clear();
        model.changed = true;
      }
    } else if (operation < 84) {
      ASSERT_EQ(sr_apply_1(table_, 0), model.ready_for_commit ? SR_E_APPLIED_UNCOMMITTED : 0)
          << "apply, step " << step;
      model.ready_for_commit = true;
      model.changed = true;
    } else if (operation < 94) {
      int32_t expected = 0;
      if (!model.ready_for_commit && model.changed) {
        expected = SR_E_NOT_APPLIED;
      }
      ASSERT_EQ(sr_commit_1(table_), expected) << "commit, step " << step;
      if (expected == 0) {
        model.committed = model.applied;
        model.ready_for_commit = false;
        model.changed = false;
        model.settled_bytes = allocated_bytes(table_);
      }
    } else {
      ASSERT_EQ(sr_abort_1(table_), 0) << "abort, step " << step;
      ASSERT_EQ(allocated_bytes(table_), model.settled_bytes) << "abort, step " << step;
      model.applied = model.committed;
      model.ready_for_commit = false;
      model.changed = false;
    }
    expect_table_matches(model, step);
    if (model.committed.empty() && !model.changed) {
      ASSERT_EQ(allocated_bytes(table_), empty_bytes) << "step " << step;
    }
    if (HasFatalFailure()) {
      return;
    }
  }
}

using Transactions = RowTables;

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

}  // namespace
