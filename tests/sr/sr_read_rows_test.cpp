// Reading rows through the exported calls: the order of the checks and the
// codes they raise, the committed and applied views with the row states,
// key lookups with and without a key hash table (deleted rows, null, NaN and
// binary keys), the key-not-found message, and variable-length values handed
// to the caller in blocks of its own.

#include <gtest/gtest.h>

#include <cmath>
#include <cstdlib>
#include <cstring>
#include <string>
#include <tuple>
#include <vector>

#include "pmsg_test_values.h"
#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

// Never a state a read reports: shows that a failed read stored none.
constexpr auto No_State_Stored = static_cast<sr_row_state_t>(7);

// A failure returns its code and leaves it as the thread's error.
void expect_failure(int32_t rc, int32_t code) {
  EXPECT_EQ(rc, code);
  EXPECT_EQ(last_error().first, code);
}

class ReadRows : public RowTables {
 protected:
  void SetUp() override {
    unsetenv("SR_UNCOMMITTED_UPDATES_VISIBLE");
    RowTables::SetUp();
  }

  // An int32 key "k", a string "name" and an int64 "count".
  sr_opaque_handle_t create_named(const char *p_path, int32_t mode = Explicit,
                                  sr_hash_function_t p_hash = nullptr) {
    return make_table(p_path,
                      {column("k", QV_INT32, SR_PRIMARY_KEY), column("name", QV_CHAR_PTR),
                       column("count", QV_INT64)},
                      mode, p_hash);
  }
  static void add_named(sr_opaque_handle_t table, int32_t key, const char *p_name) {
    ASSERT_EQ(add_fields(table, {{"k", int32_value(key)}, {"name", string_value(p_name)}}), 0);
  }
  static int32_t find(sr_opaque_handle_t table, qv_value_t key, uint32_t *p_fixed = nullptr) {
    uint32_t fixed = 0;
    return sr_get_fixed_row_index_for_key_1(table, key, p_fixed ? p_fixed : &fixed);
  }
  static uint32_t fixed_for(sr_opaque_handle_t table, qv_value_t key) {
    uint32_t fixed = 0xFFFFFFFF;
    EXPECT_EQ(find(table, key, &fixed), 0);
    return fixed;
  }
  // The "name" of a row by fixed index: the code, the text, the state.
  static std::tuple<int32_t, std::string, sr_row_state_t> read_name(sr_opaque_handle_t table,
                                                                    uint32_t fixed,
                                                                    uint32_t visible) {
    qv_value_t value{};
    sr_row_state_t state = No_State_Stored;
    const int32_t rc = sr_get_field_by_fixed_index_and_visibility_1(
        table, static_cast<int32_t>(fixed), "name", &value, visible, &state);
    std::string name = rc == 0 ? value.ptr_char : "";
    std::free(rc == 0 ? value.ptr_char : nullptr);
    return {rc, name, state};
  }
};

TEST_F(ReadRows, ChecksComeInTheirOrderWithTheirCodes) {
  sr_opaque_handle_t table = create_named("/cfg/t");
  add_named(table, 1, "one");
  apply_commit(table);
  const auto empty = static_cast<int32_t>(object(table)->maximum_rows) - 1;
  qv_value_t value{};
  auto by_fixed = [&](int32_t fixed, const char *p_column) {
    return sr_get_field_by_fixed_index_and_visibility_1(table, fixed, p_column, &value, 0, nullptr);
  };
  // One value: the index range, then the name, then the row.
  expect_failure(by_fixed(empty + 1, "nope"), SR_E_NO_ROW_FOR_INDEX);
  expect_failure(by_fixed(-1, "k"), SR_E_NO_ROW_FOR_INDEX);
  expect_failure(by_fixed(empty, "nope"), SR_E_INVALID_COLUMN);
  expect_failure(by_fixed(empty, "k"), SR_E_ROW_DELETED);
  expect_failure(sr_get_field_by_index_1(table, 1, "k", &value), SR_E_NO_ROW_FOR_INDEX);
  // The key is looked up before the name, and named with the table.
  expect_failure(sr_get_field_by_key_1(table, int32_value(1), "nope", &value), SR_E_INVALID_COLUMN);
  EXPECT_EQ(sr_get_field_by_key_1(table, int32_value(-42), "nope", &value), SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(last_error(),
            std::make_pair(SR_E_NO_ROW_FOR_KEY,
                           std::string("2605-213 There is no row corresponding to the specified "
                                       "key value (-42) in table (/cfg/t).\n")));
  ASSERT_EQ(sr_get_field_by_index_1(table, 0, "k", &value), 0);
  EXPECT_EQ(value.val_int32, 1);
  EXPECT_EQ(last_error().first, 0);
  // A table without a name (a selection result) is named as unknown.
  char *p_name = object(table)->p_name;
  object(table)->p_name = nullptr;
  EXPECT_EQ(find(table, int32_value(3)), SR_E_NO_ROW_FOR_KEY);
  object(table)->p_name = p_name;
  EXPECT_NE(last_error().second.find("(3) in table ((UNKNOWN_TABLE_NAME))"), std::string::npos);

  // Several values: the row before any name; values read before a failing
  // name stay with the caller, the rest and the state are not touched.
  qv_value_t count{};
  count.val_int64 = 77;
  field_list read{{"name", {}}, {"k", {}}, {"nope", {}}, {"count", count}};
  const char *const *names = read.names.data();
  qv_value_t *const *results = read.pointers.data();
  sr_row_state_t state = No_State_Stored;
  auto several_by_fixed = [&](int32_t fixed) {
    return sr_get_fields_by_fixed_index_and_visibility_1(table, fixed, names, results, 4, 0,
                                                         &state);
  };
  expect_failure(several_by_fixed(empty + 1), SR_E_NO_ROW_FOR_INDEX);
  expect_failure(several_by_fixed(empty), SR_E_ROW_DELETED);
  expect_failure(
      sr_get_fields_by_key_and_visibility_1(table, int32_value(1), names, results, 4, 0, &state),
      SR_E_INVALID_COLUMN);
  ASSERT_NE(results[0]->ptr_char, nullptr);
  EXPECT_STREQ(results[0]->ptr_char, "one");
  std::free(results[0]->ptr_char);
  EXPECT_EQ(results[1]->val_int32, 1);
  EXPECT_EQ(results[3]->val_int64, 77);
  EXPECT_EQ(state, No_State_Stored);
  ASSERT_EQ(sr_get_fields_by_key_and_visibility_1(table, int32_value(1), names + 1, results + 1, 1,
                                                  0, &state),
            0);
  EXPECT_EQ(state, SR_ROW_STATE_COMMITTED);
  expect_failure(sr_get_fields_by_index_1(table, 1, names, results, 4), SR_E_NO_ROW_FOR_INDEX);
  expect_failure(sr_get_fields_by_key_1(table, int32_value(2), names, results, 4),
                 SR_E_NO_ROW_FOR_KEY);

  EXPECT_EQ(sr_get_fixed_row_index_for_key_1(nullptr, int32_value(1), nullptr),
            SR_E_INVALID_HANDLE);  // the handle first, then the result pointer
  expect_failure(sr_get_fixed_row_index_for_key_1(table, int32_value(1), nullptr),
                 SR_E_NULL_POINTER);
}

// Every call on rows, reading or changing, looks at its handle first.
TEST_F(ReadRows, EveryRowCallRefusesANullHandle) {
  const qv_value_t one = int32_value(1);
  field_list fields{{"k", one}};
  const char *const *names = fields.names.data();
  qv_value_t *const *values = fields.pointers.data();
  qv_value_t value{};
  uint32_t fixed = 0;
  for (const int32_t rc :
       {sr_get_field_by_index_1(nullptr, 0, "k", &value),
        sr_get_field_by_index_and_visibility_1(nullptr, 0, "k", &value, 0, nullptr),
        sr_get_field_by_fixed_index_and_visibility_1(nullptr, 0, "k", &value, 0, nullptr),
        sr_get_field_by_key_1(nullptr, one, "k", &value),
        sr_get_field_by_key_and_visibility_1(nullptr, one, "k", &value, 0, nullptr),
        sr_get_fields_by_index_1(nullptr, 0, names, values, 1),
        sr_get_fields_by_index_and_visibility_1(nullptr, 0, names, values, 1, 0, nullptr),
        sr_get_fields_by_fixed_index_and_visibility_1(nullptr, 0, names, values, 1, 0, nullptr),
        sr_get_fields_by_key_1(nullptr, one, names, values, 1),
        sr_get_fields_by_key_and_visibility_1(nullptr, one, names, values, 1, 0, nullptr),
        sr_get_fixed_row_index_for_key_1(nullptr, one, &fixed),
        sr_set_field_by_index_1(nullptr, 0, "k", &one),
        sr_set_field_by_fixed_index_1(nullptr, 0, "k", &one),
        sr_set_field_by_key_1(nullptr, one, "k", &one),
        sr_set_fields_by_index_1(nullptr, 0, names, values, 1),
        sr_set_fields_by_fixed_index_1(nullptr, 0, names, values, 1),
        sr_set_fields_by_key_1(nullptr, one, names, values, 1),
        sr_add_row_1(nullptr, names, values, 1),
        sr_delete_row_by_index_1(nullptr, 0),
        sr_delete_rows_1(nullptr, nullptr),
        sr_apply_1(nullptr, 0),
        sr_commit_1(nullptr),
        sr_abort_1(nullptr),
        sr_close_table_1(nullptr)}) {
    EXPECT_EQ(rc, SR_E_INVALID_HANDLE);
  }
}

TEST_F(ReadRows, EachViewReadsItsOwnRecordAndEveryReadReportsTheRowState) {
  sr_opaque_handle_t table = create_named("/t");
  add_named(table, 1, "one");
  add_named(table, 2, "two");
  apply_commit(table);
  const uint32_t updated = fixed_for(table, int32_value(1));
  const uint32_t deleted = fixed_for(table, int32_value(2));
  const qv_value_t uno = string_value("uno");
  ASSERT_EQ(sr_set_field_by_key_1(table, int32_value(1), "name", &uno), 0);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 1), 0);  // packed: 1, 2, then 3, 4, 5 added
  add_named(table, 3, "three");
  const uint32_t added = fixed_for(table, int32_value(3));
  // A row added and deleted again before apply has no record in either view
  // (its state would be "no row", which therefore no read can report); a
  // key scan passes over it to the rows behind.
  add_named(table, 4, "four");
  const uint32_t gone = fixed_for(table, int32_value(4));
  ASSERT_EQ(sr_delete_row_by_index_1(table, 3), 0);
  add_named(table, 5, "five");
  EXPECT_EQ(find(table, int32_value(5)), 0);
  expect_failure(find(table, int32_value(4)), SR_E_NO_ROW_FOR_KEY);

  using read_t = std::tuple<uint32_t, uint32_t, int32_t, std::string, sr_row_state_t>;
  auto expect_reads = [&](std::vector<read_t> reads) {
    for (const auto &[fixed, visible, rc, name, state] : reads) {
      EXPECT_EQ(read_name(table, fixed, visible), std::make_tuple(rc, name, state))
          << fixed << "/" << visible;
    }
  };
  expect_reads({{updated, 0, 0, "one", SR_ROW_STATE_UPDATED},
                {updated, 1, 0, "uno", SR_ROW_STATE_UPDATED},
                {deleted, 0, 0, "two", SR_ROW_STATE_DELETED},
                {deleted, 1, SR_E_ROW_DELETED, "", No_State_Stored},
                {added, 0, SR_E_ROW_DELETED, "", No_State_Stored},
                {added, 1, 0, "three", SR_ROW_STATE_ADDED},
                {gone, 0, SR_E_ROW_DELETED, "", No_State_Stored},
                {gone, 1, SR_E_ROW_DELETED, "", No_State_Stored}});
  // The packed index counts the applied rows, so a plain read reaches the
  // added row and finds nothing committed there; so does one by its key.
  qv_value_t value{};
  expect_failure(sr_get_field_by_index_1(table, 2, "k", &value), SR_E_ROW_DELETED);
  expect_failure(sr_get_field_by_key_1(table, int32_value(3), "k", &value), SR_E_ROW_DELETED);

  apply_commit(table);
  expect_reads({{updated, 0, 0, "uno", SR_ROW_STATE_COMMITTED},
                {added, 0, 0, "three", SR_ROW_STATE_COMMITTED},
                {deleted, 1, SR_E_ROW_DELETED, "", No_State_Stored}});

  // SR_UNCOMMITTED_UPDATES_VISIBLE set at all, even empty, when a table is
  // made shows its applied view to the reads that do not choose a view.
  setenv("SR_UNCOMMITTED_UPDATES_VISIBLE", "", 1);
  sr_opaque_handle_t shown = create_named("/shown");
  unsetenv("SR_UNCOMMITTED_UPDATES_VISIBLE");
  add_named(shown, 1, "one");
  ASSERT_EQ(sr_get_field_by_key_1(shown, int32_value(1), "name", &value), 0);
  EXPECT_STREQ(value.ptr_char, "one");
  std::free(value.ptr_char);
  EXPECT_EQ(read_name(shown, fixed_for(shown, int32_value(1)), 0),
            std::make_tuple(0, std::string("one"), SR_ROW_STATE_ADDED));
}

TEST_F(ReadRows, HashedAndScannedTablesFindTheSameRows) {
  sr_opaque_handle_t scanned = create_named("/scanned");
  sr_opaque_handle_t hashed = create_named("/hashed", Explicit, four_buckets);
  const int32_t keys[] = {5, -3, 12, 0, 9};
  for (sr_opaque_handle_t table : {scanned, hashed}) {
    for (const int32_t key : keys) {
      add_named(table, key, std::to_string(key).c_str());
    }
    apply_commit(table);
    ASSERT_EQ(sr_delete_row_by_index_1(table, 4), 0);  // key 9, pending
  }
  for (const int32_t key : keys) {
    const uint32_t fixed = fixed_for(scanned, int32_value(key));
    EXPECT_EQ(fixed_for(hashed, int32_value(key)), fixed);
    EXPECT_EQ(std::get<1>(read_name(scanned, fixed, 0)), std::to_string(key));
  }
  // The deleted row is found; reading its applied view fails.
  qv_value_t value{};
  for (sr_opaque_handle_t table : {scanned, hashed}) {
    expect_failure(
        sr_get_field_by_key_and_visibility_1(table, int32_value(9), "k", &value, 1, nullptr),
        SR_E_ROW_DELETED);
    apply_commit(table);
    expect_failure(find(table, int32_value(9)), SR_E_NO_ROW_FOR_KEY);
    expect_failure(find(table, int32_value(7)), SR_E_NO_ROW_FOR_KEY);
  }
  // Without a hash table a pending change of the key does not move the row.
  const qv_value_t fifty = int32_value(50);
  ASSERT_EQ(sr_set_field_by_key_1(scanned, int32_value(5), "k", &fifty), 0);
  EXPECT_EQ(fixed_for(scanned, int32_value(5)), fixed_for(hashed, int32_value(5)));
  EXPECT_EQ(find(scanned, int32_value(50)), SR_E_NO_ROW_FOR_KEY);
}

TEST_F(ReadRows, HandleStringAndFloatKeysAreComparedByValue) {
  auto table_of = [&](const char *p_path, qv_data_type_t type, std::vector<qv_value_t> keys) {
    sr_opaque_handle_t table = make_table(p_path, {column("k", type, SR_PRIMARY_KEY)}, Explicit);
    for (const qv_value_t &key : keys) {
      EXPECT_EQ(add_fields(table, {{"k", key}}), 0);
    }
    apply_commit(table);
    return table;
  };
  auto packed = [](sr_opaque_handle_t table, uint32_t at) {
    return object(table)->p_rows_packed_index[at];
  };
  // Handle keys get the built-in key hash table: the first two share a
  // bucket (they differ only in id1), the third is the null handle.
  qv_resource_handle_t first{0x00010002, {1, 2, 3, 4}}, second{0x00010002, {9, 2, 3, 4}};
  qv_value_t handle[3] = {};
  handle[0].ptr_rsrc_handle = &first;
  handle[1].ptr_rsrc_handle = &second;
  sr_opaque_handle_t handles = table_of("/handles", QV_RSRC_HANDLE_PTR, {handle[0], handle[1], {}});
  for (uint32_t at = 0; at < 3; ++at) {
    EXPECT_EQ(fixed_for(handles, handle[at]), packed(handles, at));
  }
  // A null string is stored, and found, as "".
  sr_opaque_handle_t strings =
      table_of("/strings", QV_CHAR_PTR, {string_value("alpha"), string_value(nullptr)});
  EXPECT_EQ(fixed_for(strings, string_value(nullptr)), packed(strings, 1));
  EXPECT_EQ(fixed_for(strings, string_value("")), packed(strings, 1));
  // A NaN key matches the first row scanned.
  qv_value_t key{};
  key.val_float64 = 1.5;
  sr_opaque_handle_t floats = table_of("/floats", QV_FLOAT64, {qv_value_t{}, key});
  EXPECT_EQ(fixed_for(floats, key), packed(floats, 1));
  key.val_float64 = std::nan("");
  EXPECT_EQ(fixed_for(floats, key), packed(floats, 0));
  key.val_float64 = 3.25;
  EXPECT_EQ(find(floats, key), SR_E_NO_ROW_FOR_KEY);
  // Binary keys come only from tables written elsewhere, and are never found
  // by scanning; the table is retyped in memory to get one.
  object(floats)->p_columns[0].type = QV_BINARY_PTR;
  qv_binary_t empty{};
  key.ptr_binary = &empty;
  EXPECT_EQ(find(floats, key), SR_E_NO_ROW_FOR_KEY);
  object(floats)->p_columns[0].type = QV_FLOAT64;
}

TEST_F(ReadRows, VariableLengthValuesAreTheCallersOwnBlocks) {
  std::vector<sr_column_t> columns = {column("k", QV_INT32, SR_PRIMARY_KEY),
                                      column("name", QV_CHAR_PTR), column("list", QV_INT32_ARRAY),
                                      column("blob", QV_BINARY_PTR), column("big", QV_UINT64)};
  columns[1].default_value.ptr_char = const_cast<char *>("none");
  sr_opaque_handle_t table = make_table("/values", columns, Explicit);
  value_arena arena;
  const int32_t types[] = {QV_UINT64, QV_BINARY_PTR, QV_INT32_ARRAY, QV_CHAR_PTR};
  // Row 1 as given; row 2 of defaults (null pointers stand for empty values).
  const qv_value_t given[] = {number64(UINT64_MAX - 1), arena.binary(std::string_view("\0\1\2", 3)),
                              arena.array({int32_value(-1), int32_value(65536)}),
                              string_value("full")};
  const qv_value_t defaults[] = {number64(0), {}, {}, string_value("none")};
  ASSERT_EQ(add_fields(table, {{"k", int32_value(1)},
                               {"big", given[0]},
                               {"blob", given[1]},
                               {"list", given[2]},
                               {"name", given[3]}}),
            0);
  ASSERT_EQ(add_fields(table, {{"k", int32_value(2)}}), 0);
  apply_commit(table);

  field_list read{{"big", {}}, {"blob", {}}, {"list", {}}, {"name", {}}};
  qv_value_t *const *values = read.pointers.data();
  for (const int32_t key : {1, 2}) {
    ASSERT_EQ(sr_get_fields_by_key_1(table, int32_value(key), read.names.data(), values, 4), 0);
    for (uint32_t at = 0; at < 4; ++at) {
      EXPECT_TRUE(values_equal(types[at], (key == 1 ? given : defaults)[at], *values[at])) << key;
    }
    // A second read hands out new blocks.
    qv_value_t again{};
    ASSERT_EQ(sr_get_field_by_key_1(table, int32_value(key), "name", &again), 0);
    EXPECT_NE(again.ptr_char, values[3]->ptr_char);
    std::free(again.ptr_char);
    for (uint32_t at = 1; at < 4; ++at) {
      std::free(values[at]->ptr_char);
    }
  }
}

}  // namespace
