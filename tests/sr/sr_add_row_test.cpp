// Adding rows: the order of the checks, a failed add leaving no trace,
// defaults, null pointers stored as empty values, long keys and values, key
// checks by scan and by hash, revival of a deleted key at its old position,
// the row index growing under pending changes, and an add whose memory
// cannot be had leaving the table as it was. Beneath them the table object:
// its row index hands out the lowest free position, also as it grows and
// while part of it was never used, and it answers block containment for the
// file writer.

#include <gtest/gtest.h>

#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <map>
#include <random>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "rows/sr_i_rows.h"
#include "sr_row_test_support.h"
#include "tables/sr_i_allocation.h"
#include "tables/sr_i_table.h"

namespace {

using namespace sr_test;

using AddRow = RowTables;

// What a failed add must leave exactly as it was.
struct footprint {
  uint32_t applied_rows, deletions, used_bytes;
  const void *p_changes;
  explicit footprint(const sr_i_table_t *p)
      : applied_rows(p->total_applied_rows),
        deletions(p->applied_deletions),
        used_bytes(p->record_buffer_pool.used_bytes),
        p_changes(p->p_rows_change_list) {}
  bool operator==(const footprint &) const = default;
};

TEST_F(AddRow, ChecksComeInTheirOrderAndAFailureLeavesNoTrace) {
  sr_opaque_handle_t table = create_named_counts("/add/order", Explicit);
  ASSERT_EQ(add_named(table, "a", 1), 0);
  const footprint before(object(table));

  qv_value_t name = string_value("b"), number = int32_value(2);
  {  // The key column left out: 107 even though every other column is named.
    qv_value_t note = string_value("x");
    const char *names[] = {"count", "note"};
    qv_value_t *values[] = {&number, &note};
    EXPECT_EQ(sr_add_row_1(table, names, values, 2), SR_E_KEY_EXPECTED);
  }
  {  // A name given twice, or unknown: 104, and it wins over a null key.
    const char *twice[] = {"name", "count", "count"};
    qv_value_t *values[] = {&name, &number, &number};
    EXPECT_EQ(sr_add_row_1(table, twice, values, 3), SR_E_NO_COLUMNS);
    const char *unknown[] = {"name", "bogus"};
    qv_value_t *null_key[] = {nullptr, &number};
    EXPECT_EQ(sr_add_row_1(table, unknown, null_key, 2), SR_E_NO_COLUMNS);
    const char *key_only[] = {"name"};
    EXPECT_EQ(sr_add_row_1(table, key_only, null_key, 1), SR_E_KEY_EXPECTED);
  }
  EXPECT_EQ(add_named(table, "a", 9), SR_E_DUPLICATE_KEY);
  EXPECT_TRUE(footprint(object(table)) == before);

  ASSERT_EQ(sr_apply_1(table, 0), 0);
  EXPECT_EQ(add_named(table, "c", 3), SR_E_APPLIED_UNCOMMITTED);
  ASSERT_EQ(sr_commit_1(table), 0);
  EXPECT_EQ(add_named(table, "c", 3), 0);

  // A read-only handle is refused.
  ASSERT_EQ(sr_close_table_1(create_numbered("/add/readonly", Explicit)), 0);
  sr_opaque_handle_t reader = nullptr;
  ASSERT_EQ(sr_open_table_1(tree_, "/add/readonly", 1, &reader), 0);
  EXPECT_EQ(add_numbered(reader, 1, 1), SR_E_ACCESS);
  EXPECT_EQ(object(reader)->total_applied_rows, 0u);
}

TEST_F(AddRow, UnnamedColumnsTakeDefaultsAndNullValuesBecomeEmpty) {
  sr_opaque_handle_t table = create_named_counts("/add/defaults", Implicit);
  ASSERT_EQ(add_fields(table, {{"name", string_value("k")}, {"note", string_value(nullptr)}}), 0);
  EXPECT_EQ(count_of(table, "k", 0), 7);
  EXPECT_EQ(string_at_fixed(table, fixed_index_of(table, "k"), "note", 0), "");
}

TEST_F(AddRow, LongKeysAndValuesAreStoredWhole) {
  sr_opaque_handle_t table = create_named_counts("/add/long", Implicit);
  for (const size_t length : {31u, 32u, 33u, 200u, 5000u}) {
    const std::string key(length, 'k'), note(length * 2, 'n');
    ASSERT_EQ(add_fields(table, {{"name", string_value(key.c_str())},
                                 {"note", string_value(note.c_str())}}),
              0)
        << length;
    const uint32_t fixed = fixed_index_of(table, key.c_str());
    EXPECT_EQ(string_at_fixed(table, fixed, "note", 0), note) << length;
    EXPECT_EQ(string_at_fixed(table, fixed, "name", 0), key) << length;
  }
}

TEST_F(AddRow, PrimaryKeyByScanRefusesWhenTheNewRowLiesBeforeTheLastLiveRow) {
  sr_opaque_handle_t table = create_named_counts("/add/scan", Explicit);
  for (const char *p_name : {"a", "b", "c"}) {
    ASSERT_EQ(add_named(table, p_name, 1), 0);
  }
  apply_commit(table);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
  apply_commit(table);
  // Position 0 is free again and lies before "c": the key check meets the
  // new row itself.
  EXPECT_EQ(add_named(table, "d", 1), SR_E_DUPLICATE_KEY);
  EXPECT_EQ(object(table)->total_applied_rows, 2u);

  sr_opaque_handle_t nocheck =
      create_named_counts("/add/nocheck", Explicit, SR_PRIMARY_KEY_NOCHECK);
  EXPECT_EQ(add_named(nocheck, "same", 1), 0);
  EXPECT_EQ(add_named(nocheck, "same", 2), 0);
  EXPECT_EQ(object(nocheck)->total_applied_rows, 2u);
}

TEST_F(AddRow, ADeletedKeyComesBackAtItsOldPosition) {
  // Handle keys: the table gets the built-in key hash table.
  std::vector<sr_column_t> columns = {column("handle", QV_RSRC_HANDLE_PTR, SR_PRIMARY_KEY),
                                      column("count", QV_INT32, SR_STANDARD)};
  sr_opaque_handle_t table = make_table("/add/revive", columns, Explicit);
  qv_resource_handle_t handles[3] = {};
  auto add = [&](uint32_t at, int32_t count) {
    handles[at].id.id4 = at + 1;
    qv_value_t key{};
    key.ptr_rsrc_handle = &handles[at];
    return add_fields(table, {{"handle", key}, {"count", int32_value(count)}});
  };
  for (uint32_t at = 0; at < 3; ++at) {
    ASSERT_EQ(add(at, static_cast<int32_t>(at)), 0);
  }
  apply_commit(table);
  qv_value_t key{};
  key.ptr_rsrc_handle = &handles[1];
  uint32_t fixed_before = 0;
  ASSERT_EQ(sr_get_fixed_row_index_for_key_1(table, key, &fixed_before), 0);
  ASSERT_EQ(
      sr_delete_row_by_index_1(table, object(table)->p_rows_fixed_index[fixed_before].packed_index),
      0);
  EXPECT_EQ(object(table)->applied_deletions, 1u);

  ASSERT_EQ(add(1, 42), 0);
  uint32_t fixed_after = 0;
  ASSERT_EQ(sr_get_fixed_row_index_for_key_1(table, key, &fixed_after), 0);
  EXPECT_EQ(fixed_after, fixed_before);
  EXPECT_EQ(object(table)->applied_deletions, 0u);
  EXPECT_EQ(object(table)->total_applied_rows, 3u);
  EXPECT_EQ(sr_i_get_row_state_for_fixed_index(object(table), fixed_after), SR_ROW_STATE_UPDATED);
  EXPECT_EQ(add(1, 42), SR_E_DUPLICATE_KEY);  // a live key is still a duplicate
  apply_commit(table);
  qv_value_t read{};
  ASSERT_EQ(sr_get_field_by_key_1(table, key, "count", &read), 0);
  EXPECT_EQ(read.val_int32, 42);
}

// ---- Allocations that fail -----------------------------------------------

// The allocation through the table's door that fails: the n-th from now (1
// the next), or none (0).
int Allocations_Until_Failure = 0;

bool allocation_fails() {
  return Allocations_Until_Failure > 0 && --Allocations_Until_Failure == 0;
}

// A grown block always moves, as it does when the heap cannot grow it in
// place: whatever points into it must follow.
constexpr sr_i_allocation_calls_t Failing_Allocation = {
    .allocate = [](size_t length) -> void * {
      return allocation_fails() ? nullptr : Sr_Default_Allocation.allocate(length);
    },
    .reallocate = [](void *p_block, size_t length) -> void * {
      if (allocation_fails()) {
        return nullptr;
      }
      void *p_moved = std::malloc(length);
      void *p_grown = Sr_Default_Allocation.reallocate(p_block, length);
      std::memcpy(p_moved, p_grown, length);
      std::free(p_grown);
      return p_moved;
    },
};

// Row tables whose growing allocations go through a door that fails the one
// Allocations_Until_Failure names.
class AddRowWithoutMemory : public RowTables {
 protected:
  void SetUp() override {
    RowTables::SetUp();
    Allocations_Until_Failure = 0;
    Sr_Allocation = Failing_Allocation;
  }
  void TearDown() override {
    Sr_Allocation = Sr_Default_Allocation;
    RowTables::TearDown();
  }

  // The rows of one view, id to count.
  static std::map<int32_t, int32_t> rows_in(sr_opaque_handle_t table, uint32_t uncommitted) {
    return sr_test::rows_in<int32_t>(table, "id", uncommitted);
  }
};

// Everything of the row index an add touches: the arrays themselves, their
// bounds and free chain, the packed order, and the pending changes with the
// entries they point at.
struct index_state {
  uint32_t maximum_rows;
  const void *p_fixed, *p_packed, *p_free_chain, *p_never_used;
  std::vector<uint32_t> packed;
  std::vector<std::pair<const void *, uint32_t>> changes;
  footprint rest;
  explicit index_state(const sr_i_table_t *p)
      : maximum_rows(p->maximum_rows),
        p_fixed(p->p_rows_fixed_index),
        p_packed(p->p_rows_packed_index),
        p_free_chain(p->p_rows_free_chain),
        p_never_used(p->p_rows_never_used),
        packed(p->p_rows_packed_index, p->p_rows_packed_index + p->total_applied_rows),
        rest(p) {
    for (const sr_i_change_entry_t *p_list :
         {p->p_rows_change_list, p->p_delete_rows_change_list}) {
      for (const sr_i_change_entry_t *p_change = p_list; p_change != nullptr;
           p_change = p_change->p_next) {
        changes.emplace_back(p_change->p_index_entry, p_change->deletion);
      }
    }
  }
  bool operator==(const index_state &) const = default;
};

// A full index of 100 committed rows, with rows set and a row deleted
// pending: the next add must grow the index, and either allocation of the
// growth fails. Then the add is made again: after an abort, or on top of the
// pending changes, which must follow their rows into the grown index.
TEST_F(AddRowWithoutMemory, AGrowthThatFailsLeavesTheIndexAndTheTransactionAsTheyWere) {
  for (const int failing : {1, 2}) {
    SCOPED_TRACE("allocation " + std::to_string(failing) + " of the growth fails");
    const std::string path = "/add/no_memory_" + std::to_string(failing);
    sr_opaque_handle_t table = create_numbered(path.c_str(), Explicit);
    EXPECT_EQ(object(table)->maximum_rows, 100u);
    std::map<int32_t, int32_t> committed;
    for (int32_t id = 0; id < 100; ++id) {
      ASSERT_EQ(add_numbered(table, id, id), 0);
      committed[id] = id;
    }
    apply_commit(table);
    std::map<int32_t, int32_t> applied = committed;
    for (int32_t id = 0; id < 5; ++id) {
      qv_value_t changed = int32_value(500 + id);
      ASSERT_EQ(sr_set_field_by_key_1(table, int32_value(id), "count", &changed), 0);
      applied[id] = 500 + id;
    }
    ASSERT_EQ(sr_delete_rows_1(table, "id == 7"), 0);
    applied.erase(7);
    ASSERT_EQ(object(table)->p_rows_free_chain, nullptr);
    const index_state before(object(table));

    Allocations_Until_Failure = failing;
    EXPECT_EQ(add_numbered(table, 100, 100), SR_E_NO_MEMORY);
    EXPECT_EQ(last_error().first, SR_E_NO_MEMORY);
    ASSERT_EQ(Allocations_Until_Failure, 0) << "the add made fewer allocations";
    // The arrays first: a table that lost them cannot be looked at further.
    ASSERT_EQ(object(table)->p_rows_packed_index, before.p_packed);
    ASSERT_EQ(object(table)->p_rows_fixed_index, before.p_fixed);
    ASSERT_TRUE(index_state(object(table)) == before);
    EXPECT_EQ(rows_in(table, 1), applied);
    EXPECT_EQ(rows_in(table, 0), committed);

    if (failing == 1) {
      ASSERT_EQ(sr_abort_1(table), 0);
      EXPECT_EQ(rows_in(table, 1), committed);
      applied = committed;
    }
    ASSERT_EQ(add_numbered(table, 100, 100), 0);
    applied[100] = 100;
    EXPECT_EQ(object(table)->maximum_rows, 200u);
    const sr_i_index_entry_t *p_fixed = object(table)->p_rows_fixed_index;
    size_t listed = 0;
    for (const sr_i_change_entry_t *p_list :
         {object(table)->p_rows_change_list, object(table)->p_delete_rows_change_list}) {
      for (auto *p_change = p_list; p_change != nullptr; p_change = p_change->p_next, ++listed) {
        const sr_i_index_entry_t *p_entry = p_change->p_index_entry;
        ASSERT_TRUE(p_entry >= p_fixed && p_entry < p_fixed + 200) << "a change lost its row";
        EXPECT_EQ(p_entry->p_pending_change, p_change);
      }
    }
    EXPECT_EQ(listed, failing == 1 ? 1u : 7u);
    apply_commit(table);
    EXPECT_EQ(rows_in(table, 0), applied);
  }
}

// The first change of a transaction takes a new block of change entries;
// when it cannot be had, the row built and entered in the key hash table so
// far is given back.
TEST_F(AddRowWithoutMemory, AChangeThatCannotBeQueuedGivesTheRowBack) {
  sr_opaque_handle_t table =
      make_table("/add/no_change_entry",
                 {column("id", QV_INT32, SR_PRIMARY_KEY), column("count", QV_INT32, SR_STANDARD)},
                 Explicit, four_buckets);
  const std::map<int32_t, int32_t> committed = {{0, 0}, {1, 10}, {2, 20}};
  for (const auto &[id, count] : committed) {
    ASSERT_EQ(add_numbered(table, id, count), 0);
  }
  apply_commit(table);
  ASSERT_EQ(object(table)->p_change_entry_blocks, nullptr);
  const footprint before(object(table));
  const sr_i_index_entry_t *p_free = object(table)->p_rows_free_chain;

  Allocations_Until_Failure = 1;
  EXPECT_EQ(add_numbered(table, 3, 30), SR_E_NO_MEMORY);
  ASSERT_EQ(Allocations_Until_Failure, 0) << "the add made no allocation";
  EXPECT_TRUE(footprint(object(table)) == before);
  EXPECT_EQ(object(table)->p_rows_free_chain, p_free);
  uint32_t fixed = 0;
  EXPECT_EQ(sr_get_fixed_row_index_for_key_1(table, int32_value(3), &fixed), SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(rows_in(table, 1), committed);

  ASSERT_EQ(add_numbered(table, 3, 30), 0);
  ASSERT_EQ(sr_get_fixed_row_index_for_key_1(table, int32_value(3), &fixed), 0);
  EXPECT_EQ(object(table)->p_rows_fixed_index + fixed, p_free);
  apply_commit(table);
  std::map<int32_t, int32_t> with_new_row = committed;
  with_new_row[3] = 30;
  EXPECT_EQ(rows_in(table, 0), with_new_row);
}

// ---- The table object ---------------------------------------------------

class TableObject : public ::testing::Test {
 protected:
  void SetUp() override {
    p_table_ = sr_i_create_null_table();
    ASSERT_NE(p_table_, nullptr);
  }
  void TearDown() override { sr_i_close_table(p_table_); }

  size_t position_of(const sr_i_index_entry_t *p_entry) const {
    return static_cast<size_t>(p_entry - p_table_->p_rows_fixed_index);
  }
  sr_i_table_t *p_table_ = nullptr;
};

// Positions given back in any order while part of the index was never
// handed out, and growth whenever nothing is free: every take is the lowest
// free position, cleared of what its last row left there.
TEST_F(TableObject, TakesAgreeWithASetOfFreePositionsThroughReturnsAndGrowth) {
  ASSERT_EQ(sr_i_establish_rows_index(p_table_, 0), 0);  // no size: the default
  ASSERT_EQ(p_table_->maximum_rows, Sr_Default_Index_Rows);
  std::set<size_t> free_positions;
  for (size_t position = 0; position < Sr_Default_Index_Rows; ++position) {
    free_positions.insert(position);
  }
  std::vector<size_t> taken;
  std::mt19937 random(3);
  for (int step = 0; step < 3000; ++step) {
    if (taken.empty() || random() % 3 != 0) {
      sr_i_index_entry_t *p_entry = sr_i_rows_free_chain_remove(p_table_);
      if (free_positions.empty()) {
        ASSERT_EQ(p_entry, nullptr);
        const uint32_t old_rows = p_table_->maximum_rows;
        ASSERT_EQ(sr_i_grow_index(p_table_, old_rows), 0);
        for (size_t position = old_rows; position < 2 * size_t{old_rows}; ++position) {
          free_positions.insert(position);
        }
        continue;
      }
      ASSERT_NE(p_entry, nullptr);
      ASSERT_EQ(position_of(p_entry), *free_positions.begin()) << "step " << step;
      ASSERT_EQ(p_entry->p_committed, nullptr) << "step " << step;
      free_positions.erase(free_positions.begin());
      taken.push_back(position_of(p_entry));
      p_entry->p_committed = p_entry;  // a row's state, to be cleared when it goes
    } else {
      const size_t at = random() % taken.size();
      sr_i_rows_free_chain_insert(p_table_, p_table_->p_rows_fixed_index + taken[at]);
      free_positions.insert(taken[at]);
      taken.erase(taken.begin() + static_cast<std::ptrdiff_t>(at));
    }
  }
  EXPECT_GT(p_table_->maximum_rows, 4 * Sr_Default_Index_Rows);
}

TEST_F(TableObject, RecordEndingOnABlockBoundaryIsNotContained) {
  p_table_->block_size = 4096;
  uint32_t block = 99;
  EXPECT_FALSE(sr_i_record_contained_in_block(p_table_, 4000, 96, block));
  EXPECT_TRUE(sr_i_record_contained_in_block(p_table_, 4000, 95, block));
  EXPECT_EQ(block, 0u);
  EXPECT_TRUE(sr_i_record_contained_in_block(p_table_, 8192, 100, block));
  EXPECT_EQ(block, 2u);
}

}  // namespace
