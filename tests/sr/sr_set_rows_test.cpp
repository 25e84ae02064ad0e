// Setting values of existing rows through the exported calls: the order of
// the checks and the row left as it was after each refusal; the row's state
// and both views before and after commit and abort; columns reset to their
// defaults when not named; long values; key changes and the key hash table;
// implicit control; the record pool keeping its size over many sets.

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "qv_sr.h"
#include "sr_i_rows.h"
#include "sr_i_table.h"

namespace {

constexpr int32_t Explicit_Mode = 4;
constexpr int32_t Implicit_Mode = 2;

sr_column_t column(const char *p_name, qv_data_type_t type, uint32_t qualifier) {
  sr_column_t definition{};
  definition.name = const_cast<char *>(p_name);
  definition.type = type;
  definition.qualifier = static_cast<sr_qualifier_t>(qualifier);
  return definition;
}

qv_value_t number(int32_t value) {
  qv_value_t result{};
  result.val_int32 = value;
  return result;
}

qv_value_t text(const char *p_text) {
  qv_value_t result{};
  result.ptr_char = const_cast<char *>(p_text);
  return result;
}

/* Reads one column of one row by fixed index, in the applied view (1) or
 * the committed one (0). */
struct read_result {
  int32_t rc;
  int32_t number;
  std::string text;
  sr_row_state_t state;
};

read_result read_column(sr_opaque_handle_t table, uint32_t fixed, const char *p_column,
                        bool is_text, uint32_t applied_view = 1) {
  qv_value_t value{};
  read_result result{};
  result.state = SR_ROW_STATE_NO_ROW;
  result.rc = sr_get_field_by_fixed_index_and_visibility_1(
      table, static_cast<int32_t>(fixed), p_column, &value, applied_view, &result.state);
  if (result.rc == 0 && is_text) {
    result.text = value.ptr_char;
    std::free(value.ptr_char);
  } else if (result.rc == 0) {
    result.number = value.val_int32;
  }
  return result;
}

/*
 * A table of eight columns: the key k; name (default "none"); count;
 * two protected columns around a structured-data column; and two columns
 * that go back to their defaults ("fresh", 5) whenever a set leaves them out.
 */
class SetRows : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(sr_open_tree_1(&tree_, 0, 0), 0);
    p_definition_ =
        static_cast<sr_sd_def_t *>(std::malloc(sizeof(sr_sd_def_t) + sizeof(sr_sd_field_def_t)));
    p_definition_->number_of_fields = 1;
    p_definition_->field_def[0] = {QV_INT32, const_cast<char *>("n")};
    table_ = create("/set/rows", Explicit_Mode);
  }
  void TearDown() override {
    std::free(p_definition_);
    EXPECT_EQ(sr_close_tree_1(tree_), 0);
  }

  sr_opaque_handle_t create(const char *p_path, int32_t mode) {
    std::vector<sr_column_t> columns = {
        column("k", QV_INT32, SR_PRIMARY_KEY),
        column("name", QV_CHAR_PTR, SR_STANDARD),
        column("count", QV_INT32, SR_STANDARD),
        column("locked", QV_INT32, SR_STANDARD | SR_PROTECTED),
        column("peer", QV_SD_PTR, SR_STANDARD),
        column("sealed", QV_INT32, SR_STANDARD | SR_PROTECTED),
        column("reset", QV_CHAR_PTR, SR_STANDARD | SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED),
        column("level", QV_INT32, SR_STANDARD | SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED)};
    columns[1].default_value.ptr_char = const_cast<char *>("none");
    columns[4].sd_defn = p_definition_;
    columns[6].default_value.ptr_char = const_cast<char *>("fresh");
    columns[7].default_value.val_int32 = 5;
    sr_opaque_handle_t table = nullptr;
    EXPECT_EQ(sr_create_table_1(tree_, p_path, columns.data(),
                                static_cast<uint32_t>(columns.size()), mode, &table),
              0);
    return table;
  }

  /* Adds a row and returns its fixed index. */
  uint32_t add(int32_t key, const char *p_name, int32_t count, sr_opaque_handle_t table = nullptr) {
    table = table ? table : table_;
    qv_value_t values[] = {number(key), text(p_name),   number(count),
                           number(7),   text("custom"), number(9)};
    qv_value_t *const p_values[] = {&values[0], &values[1], &values[2],
                                    &values[3], &values[4], &values[5]};
    const char *const names[] = {"k", "name", "count", "locked", "reset", "level"};
    EXPECT_EQ(sr_add_row_1(table, names, p_values, 6), 0);
    uint32_t fixed = 0;
    EXPECT_EQ(sr_get_fixed_row_index_for_key_1(table, number(key), &fixed), 0);
    return fixed;
  }

  void commit() {
    ASSERT_EQ(sr_apply_1(table_, 0), 0);
    ASSERT_EQ(sr_commit_1(table_), 0);
  }

  int32_t set_number(uint32_t fixed, const char *p_column, int32_t value) {
    const qv_value_t new_value = number(value);
    return sr_set_field_by_fixed_index_1(table_, static_cast<int32_t>(fixed), p_column, &new_value);
  }
  int32_t set_text(uint32_t fixed, const char *p_column, const char *p_text) {
    const qv_value_t new_value = text(p_text);
    return sr_set_field_by_fixed_index_1(table_, static_cast<int32_t>(fixed), p_column, &new_value);
  }
  int32_t set_several(uint32_t fixed, std::vector<const char *> names,
                      std::vector<qv_value_t> values) {
    std::vector<qv_value_t *> p_values;
    for (qv_value_t &value : values) {
      p_values.push_back(&value);
    }
    return sr_set_fields_by_fixed_index_1(table_, static_cast<int32_t>(fixed), names.data(),
                                          p_values.data(), static_cast<uint32_t>(names.size()));
  }

  std::string name_of(uint32_t fixed, uint32_t applied_view = 1) {
    const read_result read = read_column(table_, fixed, "name", true, applied_view);
    EXPECT_EQ(read.rc, 0);
    return read.text;
  }
  int32_t count_of(uint32_t fixed, uint32_t applied_view = 1) {
    const read_result read = read_column(table_, fixed, "count", false, applied_view);
    EXPECT_EQ(read.rc, 0);
    return read.number;
  }
  sr_row_state_t state_of(uint32_t fixed) {
    return read_column(table_, fixed, "count", false).state;
  }

  sr_i_table_t *object() { return static_cast<sr_i_table_t *>(table_); }
  uint32_t used_bytes() { return object()->record_buffer_pool.used_bytes; }

  sr_opaque_handle_t tree_ = nullptr;
  sr_opaque_handle_t table_ = nullptr;
  sr_sd_def_t *p_definition_ = nullptr;
};

/* A structured-data value with an element of no known type: the codec
 * refuses it. */
struct bad_structured_data {
  bad_structured_data() {
    p_data = static_cast<qv_structured_data_t *>(
        std::calloc(1, sizeof(qv_structured_data_t) + sizeof(qv_structured_data_element_t)));
    p_data->element_count = 1;
    p_data->elements[0].data_type = static_cast<qv_data_type_t>(99);
    value.ptr_sd = p_data;
  }
  ~bad_structured_data() { std::free(p_data); }
  qv_structured_data_t *p_data;
  qv_value_t value{};
};

TEST_F(SetRows, RefusalsComeInOrderAndLeaveTheRowAsItWas) {
  const uint32_t row = add(1, "one", 10);
  const uint32_t doomed = add(2, "two", 20);
  commit();
  ASSERT_EQ(sr_delete_row_by_index_1(table_, object()->p_rows_fixed_index[doomed].packed_index), 0);
  const uint32_t used = used_bytes();
  const bad_structured_data bad;

  // Index range, then the row's record, then the columns.
  EXPECT_EQ(set_number(object()->maximum_rows, "count", 1), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(set_number(static_cast<uint32_t>(-1), "count", 1), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(set_number(doomed, "nosuch", 1), SR_E_ROW_DELETED);
  EXPECT_EQ(set_number(object()->maximum_rows - 1, "nosuch", 1), SR_E_ROW_DELETED);

  // A protected column is refused even with the value it holds.
  EXPECT_EQ(set_number(row, "locked", 7), SR_E_INVALID_COLUMN);
  EXPECT_EQ(set_number(row, "nosuch", 1), SR_E_INVALID_COLUMN);
  EXPECT_EQ(set_several(row, {"count", "count"}, {number(1), number(2)}), SR_E_INVALID_COLUMN);
  EXPECT_EQ(set_several(row, {"count", "nosuch"}, {number(1), number(2)}), SR_E_INVALID_COLUMN);

  // Columns are taken in table order: "locked" before "peer" before
  // "sealed", whatever the caller's order; the count check comes last.
  EXPECT_EQ(set_several(row, {"peer"}, {bad.value}), SR_E_LIBRARY_CALL);
  EXPECT_EQ(set_several(row, {"peer", "locked"}, {bad.value, number(7)}), SR_E_INVALID_COLUMN);
  EXPECT_EQ(set_several(row, {"sealed", "peer"}, {number(0), bad.value}), SR_E_LIBRARY_CALL);
  EXPECT_EQ(set_several(row, {"nosuch", "peer"}, {number(0), bad.value}), SR_E_LIBRARY_CALL);

  EXPECT_EQ(used_bytes(), used);
  EXPECT_EQ(object()->p_rows_change_list, nullptr);
  EXPECT_EQ(state_of(row), SR_ROW_STATE_COMMITTED);
  EXPECT_EQ(count_of(row), 10);
  EXPECT_EQ(name_of(row), "one");
  EXPECT_EQ(read_column(table_, row, "locked", false).number, 7);

  // With changes applied and not committed every set is refused; the
  // fixed index is not even looked at, while the packed index and the key
  // are resolved first.
  ASSERT_EQ(sr_apply_1(table_, 0), 0);
  EXPECT_EQ(set_number(object()->maximum_rows, "count", 1), SR_E_APPLIED_UNCOMMITTED);
  EXPECT_EQ(set_number(row, "count", 1), SR_E_APPLIED_UNCOMMITTED);
  const qv_value_t one = number(1);
  EXPECT_EQ(sr_set_field_by_index_1(table_, 5, "count", &one), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(sr_set_field_by_index_1(table_, 0, "count", &one), SR_E_APPLIED_UNCOMMITTED);
  EXPECT_EQ(sr_set_field_by_key_1(table_, number(99), "count", &one), SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(sr_set_field_by_key_1(table_, number(1), "count", &one), SR_E_APPLIED_UNCOMMITTED);
  ASSERT_EQ(sr_commit_1(table_), 0);
  EXPECT_EQ(count_of(row, 0), 10);
  EXPECT_EQ(set_number(row, "count", 11), 0);
  EXPECT_EQ(count_of(row), 11);
}

TEST_F(SetRows, RowAddedInTheSamePendingSetStaysAdded) {
  const uint32_t row = add(1, "one", 10);
  EXPECT_EQ(set_several(row, {"name", "count"}, {text("uno"), number(11)}), 0);
  EXPECT_EQ(set_number(row, "count", 12), 0);
  EXPECT_EQ(state_of(row), SR_ROW_STATE_ADDED);
  EXPECT_EQ(read_column(table_, row, "count", false, 0).rc, SR_E_ROW_DELETED);
  EXPECT_EQ(name_of(row), "uno");
  EXPECT_EQ(count_of(row), 12);
  commit();
  EXPECT_EQ(state_of(row), SR_ROW_STATE_COMMITTED);
  EXPECT_EQ(name_of(row, 0), "uno");
  EXPECT_EQ(count_of(row, 0), 12);
}

TEST_F(SetRows, CommittedRowIsUpdatedAndItsCommittedViewWaitsForCommit) {
  const uint32_t row = add(1, "one", 10);
  commit();
  EXPECT_EQ(set_text(row, "name", "first"), 0);
  EXPECT_EQ(state_of(row), SR_ROW_STATE_UPDATED);
  EXPECT_EQ(set_several(row, {"name", "count"}, {text("second"), number(20)}), 0);
  EXPECT_EQ(state_of(row), SR_ROW_STATE_UPDATED);
  EXPECT_EQ(name_of(row), "second");
  EXPECT_EQ(name_of(row, 0), "one");
  EXPECT_EQ(count_of(row, 0), 10);
  ASSERT_EQ(sr_apply_1(table_, 0), 0);
  EXPECT_EQ(name_of(row, 0), "one");
  ASSERT_EQ(sr_commit_1(table_), 0);
  EXPECT_EQ(state_of(row), SR_ROW_STATE_COMMITTED);
  EXPECT_EQ(name_of(row, 0), "second");
  EXPECT_EQ(count_of(row, 0), 20);
}

TEST_F(SetRows, NewRecordCarriesTheRowsFileOffset) {
  const uint32_t row = add(1, "one", 10);
  commit();
  sr_i_index_entry_t &entry = object()->p_rows_fixed_index[row];
  entry.file_offset = 4096;  // as if the committed record lay at 4096 in a file
  EXPECT_EQ(set_number(row, "count", 11), 0);
  EXPECT_EQ(sr_i_row_header_word(entry.p_applied), 4096u);
  EXPECT_EQ(sr_abort_1(table_), 0);
}

TEST_F(SetRows, AbortBringsBackTheCommittedValues) {
  const uint32_t row = add(1, "one", 10);
  commit();
  const uint32_t used = used_bytes();
  EXPECT_EQ(set_text(row, "name", "changed"), 0);
  EXPECT_EQ(set_number(row, "count", 99), 0);
  EXPECT_EQ(sr_abort_1(table_), 0);
  EXPECT_EQ(state_of(row), SR_ROW_STATE_COMMITTED);
  EXPECT_EQ(name_of(row), "one");
  EXPECT_EQ(count_of(row), 10);
  EXPECT_EQ(used_bytes(), used);
}

TEST_F(SetRows, ColumnsQualifiedToResetTakeTheirDefaultsWhenNotNamed) {
  const uint32_t row = add(1, "one", 10);
  auto reset_of = [&] { return read_column(table_, row, "reset", true).text; };
  auto level_of = [&] { return read_column(table_, row, "level", false).number; };
  ASSERT_EQ(reset_of(), "custom");
  ASSERT_EQ(level_of(), 9);

  EXPECT_EQ(set_number(row, "count", 11), 0);
  EXPECT_EQ(reset_of(), "fresh");
  EXPECT_EQ(level_of(), 5);
  EXPECT_EQ(name_of(row), "one");  // an ordinary column keeps its value

  EXPECT_EQ(set_text(row, "reset", "again"), 0);
  EXPECT_EQ(reset_of(), "again");
  EXPECT_EQ(level_of(), 5);

  EXPECT_EQ(set_number(row, "level", 8), 0);
  EXPECT_EQ(reset_of(), "fresh");
  EXPECT_EQ(level_of(), 8);
  EXPECT_EQ(count_of(row), 11);
}

TEST_F(SetRows, LongValuesAreStoredWhole) {
  const uint32_t row = add(1, "s", 10);
  std::string long_name;
  for (int at = 0; long_name.size() < 20000; ++at) {
    long_name += std::to_string(at) + ",";
  }
  const std::string other(5000, 'z');

  EXPECT_EQ(set_text(row, "name", long_name.c_str()), 0);
  EXPECT_EQ(name_of(row), long_name);
  // Unnamed, the long value is carried into the next record.
  EXPECT_EQ(set_number(row, "count", 11), 0);
  EXPECT_EQ(name_of(row), long_name);
  EXPECT_EQ(set_several(row, {"reset", "name"}, {text(other.c_str()), text(long_name.c_str() + 1)}),
            0);
  EXPECT_EQ(name_of(row), long_name.substr(1));
  EXPECT_EQ(read_column(table_, row, "reset", true).text, other);
  EXPECT_EQ(count_of(row), 11);
  commit();
  EXPECT_EQ(name_of(row, 0), long_name.substr(1));
  EXPECT_EQ(set_text(row, "name", "short"), 0);
  EXPECT_EQ(name_of(row), "short");
  EXPECT_EQ(read_column(table_, row, "reset", true).text, "fresh");
}

TEST_F(SetRows, ImplicitlyControlledTableCommitsEachSet) {
  sr_opaque_handle_t table = create("/set/implicit", Implicit_Mode);
  const uint32_t row = add(1, "one", 10, table);
  const qv_value_t value = number(42);
  EXPECT_EQ(sr_set_field_by_fixed_index_1(table, static_cast<int32_t>(row), "count", &value), 0);
  const read_result committed = read_column(table, row, "count", false, 0);
  EXPECT_EQ(committed.rc, 0);
  EXPECT_EQ(committed.number, 42);
  EXPECT_EQ(committed.state, SR_ROW_STATE_COMMITTED);
  EXPECT_EQ(static_cast<sr_i_table_t *>(table)->ready_for_commit, 0u);
  EXPECT_EQ(static_cast<sr_i_table_t *>(table)->p_rows_change_list, nullptr);
  EXPECT_EQ(sr_close_table_1(table), 0);
}

/* Equal-size sets may leave the pool's free space split one way or another
 * (one record header more or less), but a record not given back would grow
 * it by a whole record each time. */
TEST_F(SetRows, RepeatedSetsGiveTheirRecordsBack) {
  const uint32_t row = add(1, "name-00", 10);
  commit();
  const uint32_t committed = used_bytes();
  uint32_t most = 0;
  char name[16];
  for (int at = 1; at < 60; ++at) {
    std::snprintf(name, sizeof name, "name-%02d", at);
    ASSERT_EQ(set_text(row, "name", name), 0);
    commit();
    most = std::max(most, used_bytes());
  }
  EXPECT_LE(most, committed + Sr_Record_Header_Length);
  EXPECT_EQ(name_of(row, 0), name);

  // Sets on a row changed already replace its pending record.
  const uint32_t before_sets = used_bytes();
  ASSERT_EQ(set_text(row, "name", "pending-00"), 0);
  const uint32_t pending = used_bytes();
  most = 0;
  for (int at = 1; at < 60; ++at) {
    std::snprintf(name, sizeof name, "pending-%02d", at);
    ASSERT_EQ(set_text(row, "name", name), 0);
    most = std::max(most, used_bytes());
  }
  EXPECT_LE(most, pending + Sr_Record_Header_Length);
  EXPECT_EQ(name_of(row), name);
  EXPECT_EQ(sr_abort_1(table_), 0);
  EXPECT_LE(used_bytes(), before_sets + Sr_Record_Header_Length);
}

TEST_F(SetRows, EveryWayOfNamingTheRowReachesIt) {
  for (int32_t key = 1; key <= 3; ++key) {
    add(key, "row", key * 10);
  }
  commit();
  // Deleting packed row 0 moves the last row (key 3) into its place.
  ASSERT_EQ(sr_delete_row_by_index_1(table_, 0), 0);
  commit();
  auto count_for_key = [&](int32_t key) {
    qv_value_t value{};
    EXPECT_EQ(
        sr_get_field_by_key_and_visibility_1(table_, number(key), "count", &value, 1, nullptr), 0);
    return value.val_int32;
  };
  qv_value_t values[] = {number(31), number(21), number(22), number(32), number(23)};
  qv_value_t *const p_values[] = {&values[0], &values[1], &values[2], &values[3], &values[4]};
  const char *const count[] = {"count"};
  uint32_t fixed_of_2 = 0;
  ASSERT_EQ(sr_get_fixed_row_index_for_key_1(table_, number(2), &fixed_of_2), 0);

  EXPECT_EQ(sr_set_field_by_index_1(table_, 0, "count", &values[0]), 0);
  EXPECT_EQ(count_for_key(3), 31);
  EXPECT_EQ(sr_set_fields_by_index_1(table_, 1, count, &p_values[1], 1), 0);
  EXPECT_EQ(count_for_key(2), 21);
  EXPECT_EQ(sr_set_field_by_key_1(table_, number(2), "count", &values[2]), 0);
  EXPECT_EQ(count_for_key(2), 22);
  EXPECT_EQ(sr_set_fields_by_key_1(table_, number(3), count, &p_values[3], 1), 0);
  EXPECT_EQ(count_for_key(3), 32);
  EXPECT_EQ(sr_set_fields_by_fixed_index_1(table_, static_cast<int32_t>(fixed_of_2), count,
                                           &p_values[4], 1),
            0);
  EXPECT_EQ(count_for_key(2), 23);

  EXPECT_EQ(sr_set_field_by_index_1(table_, 2, "count", &values[0]), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(sr_set_fields_by_index_1(table_, -1, count, p_values, 1), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(sr_set_fields_by_key_1(table_, number(1), count, p_values, 1), SR_E_NO_ROW_FOR_KEY);

  EXPECT_EQ(sr_set_field_by_index_1(nullptr, 0, "count", &values[0]), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_set_field_by_fixed_index_1(nullptr, 0, "count", &values[0]), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_set_field_by_key_1(nullptr, number(2), "count", &values[0]), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_set_fields_by_index_1(nullptr, 0, count, p_values, 1), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_set_fields_by_fixed_index_1(nullptr, 0, count, p_values, 1), SR_E_INVALID_HANDLE);
  EXPECT_EQ(sr_set_fields_by_key_1(nullptr, number(2), count, p_values, 1), SR_E_INVALID_HANDLE);
}

/* Keys are int32 values; the key pointer the hash table keeps may be
 * unaligned. */
uint32_t one_bucket(const void *) {
  return 0;
}
uint32_t sixteen_buckets(const void *p_key) {
  int32_t key;
  std::memcpy(&key, p_key, sizeof key);
  return static_cast<uint32_t>(key) & 15u;
}
int32_t compare_keys(const void *p_stored_key, const void *p_key) {
  int32_t stored;
  int32_t wanted;
  std::memcpy(&stored, p_stored_key, sizeof stored);
  std::memcpy(&wanted, p_key, sizeof wanted);
  return stored == wanted ? 0 : (stored < wanted ? -1 : 1);
}

class SetHashedKeys : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(sr_open_tree_1(&tree_, 0, 0), 0); }
  void TearDown() override { EXPECT_EQ(sr_close_tree_1(tree_), 0); }

  void create(uint32_t total_buckets, sr_hash_function_t p_hash) {
    std::vector<sr_column_t> columns = {column("k", QV_INT32, SR_PRIMARY_KEY),
                                        column("v", QV_CHAR_PTR, SR_STANDARD)};
    ASSERT_EQ(sr_create_hashed_key_table_1(tree_, "/set/hashed", columns.data(), 2, Explicit_Mode,
                                           total_buckets, p_hash, compare_keys, &table_),
              0);
  }
  uint32_t add(int32_t key) {
    qv_value_t values[] = {number(key), text("value")};
    qv_value_t *const p_values[] = {&values[0], &values[1]};
    const char *const names[] = {"k", "v"};
    EXPECT_EQ(sr_add_row_1(table_, names, p_values, 2), 0);
    uint32_t fixed = 0;
    EXPECT_EQ(sr_get_fixed_row_index_for_key_1(table_, number(key), &fixed), 0);
    return fixed;
  }
  void commit() {
    ASSERT_EQ(sr_apply_1(table_, 0), 0);
    ASSERT_EQ(sr_commit_1(table_), 0);
  }
  /* Sets the key, and v to a string as long as the key, so that each new
   * record is longer than the last and never fits where that one was. */
  int32_t set_key(uint32_t fixed, int32_t key) {
    const std::string filler(static_cast<size_t>(key), 'v');
    qv_value_t values[] = {number(key), text(filler.c_str())};
    qv_value_t *const p_values[] = {&values[0], &values[1]};
    const char *const names[] = {"k", "v"};
    return sr_set_fields_by_fixed_index_1(table_, static_cast<int32_t>(fixed), names, p_values, 2);
  }
  /* The fixed index the key leads to, or -(the code). */
  int64_t lookup(int32_t key) {
    uint32_t fixed = 0;
    const int32_t rc = sr_get_fixed_row_index_for_key_1(table_, number(key), &fixed);
    return rc == 0 ? static_cast<int64_t>(fixed) : -static_cast<int64_t>(rc);
  }
  int32_t stored_key(uint32_t fixed) { return read_column(table_, fixed, "k", false).number; }

  sr_opaque_handle_t tree_ = nullptr;
  sr_opaque_handle_t table_ = nullptr;
};

TEST_F(SetHashedKeys, KeyChangeDoesNotMoveTheRow) {
  create(16, sixteen_buckets);
  const uint32_t row = add(1);
  commit();
  ASSERT_EQ(set_key(row, 100), 0);  // 100 hashes to another bucket
  EXPECT_EQ(stored_key(row), 100);
  EXPECT_EQ(lookup(1), row);
  EXPECT_EQ(lookup(100), -SR_E_NO_ROW_FOR_KEY);
  // The old key still names the row for setting.
  const qv_value_t value = text("by old key");
  EXPECT_EQ(sr_set_field_by_key_1(table_, number(1), "v", &value), 0);
  EXPECT_EQ(read_column(table_, row, "v", true).text, "by old key");
  EXPECT_EQ(stored_key(row), 100);
}

TEST_F(SetHashedKeys, ElementFollowsTheKeyOfARowNeverCommitted) {
  // One bucket: every element is compared, so the element's key pointer
  // alone decides what a lookup finds.
  create(1, one_bucket);
  const uint32_t committed = add(1);
  commit();
  const uint32_t added = add(2);

  ASSERT_EQ(set_key(committed, 100), 0);
  ASSERT_EQ(set_key(committed, 101), 0);
  ASSERT_EQ(set_key(added, 200), 0);
  ASSERT_EQ(set_key(added, 201), 0);
  // The committed row's element keeps pointing into its committed record;
  // the added row's element follows its key into each new record, never
  // left in one given back to the pool.
  EXPECT_EQ(lookup(1), committed);
  EXPECT_EQ(lookup(101), -SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(lookup(201), added);
  EXPECT_EQ(lookup(2), -SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(lookup(200), -SR_E_NO_ROW_FOR_KEY);

  commit();
  EXPECT_EQ(lookup(101), committed);
  EXPECT_EQ(lookup(201), added);
  EXPECT_EQ(lookup(1), -SR_E_NO_ROW_FOR_KEY);
}

}  // namespace
