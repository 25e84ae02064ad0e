// Reading rows through the exported calls: the order of the checks and the
// codes they raise, the committed and applied views with the row states,
// key lookups with and without a key hash table (deleted rows, NaN keys,
// keys that never compare equal), the key-not-found message, and
// variable-length values handed to the caller in blocks of its own.

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <utility>
#include <vector>

#include "qv_cu.h"
#include "qv_sr.h"
#include "sr_i_table.h"

namespace {

constexpr int32_t Explicit_Control = 4;
// Never a state a read reports: shows that a failed read stored none.
constexpr auto No_State_Stored = static_cast<sr_row_state_t>(7);

sr_column_t column(const char *p_name, qv_data_type_t type, uint32_t qualifier = SR_STANDARD) {
  sr_column_t definition{};
  definition.name = const_cast<char *>(p_name);
  definition.type = type;
  definition.qualifier = static_cast<sr_qualifier_t>(qualifier);
  return definition;
}

qv_value_t int_value(int32_t number) {
  qv_value_t value{};
  value.val_int32 = number;
  return value;
}
qv_value_t float_value(double number) {
  qv_value_t value{};
  value.val_float64 = number;
  return value;
}
qv_value_t text_value(const char *p_text) {
  qv_value_t value{};
  value.ptr_char = const_cast<char *>(p_text);
  return value;
}

// A client hash over the 4 bytes of an int32 key (records are not aligned).
int32_t int_key(const void *p_key) {
  int32_t key;
  std::memcpy(&key, p_key, sizeof key);
  return key;
}
uint32_t hash_int_key(const void *p_key) {
  return static_cast<uint32_t>(int_key(p_key)) % 4;
}
int32_t compare_int_keys(const void *p_stored_key, const void *p_key) {
  return int_key(p_stored_key) == int_key(p_key) ? 0 : 1;
}

// The calling thread's last error: its code and text.
std::pair<int32_t, std::string> last_error() {
  cu_error_t *p_error = nullptr;
  EXPECT_EQ(cu_get_error_1(&p_error), 0);
  std::pair<int32_t, std::string> error{p_error->code, p_error->p_text};
  cu_rel_error_1(p_error);
  return error;
}

// One read of the "name" column by fixed index.
struct name_read_t {
  int32_t rc;
  std::string name;
  sr_row_state_t state = No_State_Stored;
};

class ReadRows : public ::testing::Test {
 protected:
  void SetUp() override {
    unsetenv("SR_UNCOMMITTED_UPDATES_VISIBLE");
    ASSERT_EQ(sr_open_tree_1(&tree_, 0, 0), 0);
  }
  void TearDown() override { EXPECT_EQ(sr_close_tree_1(tree_), 0); }

  sr_opaque_handle_t create(const char *p_path, std::vector<sr_column_t> columns,
                            int32_t mode = Explicit_Control, bool hashed = false) {
    sr_opaque_handle_t table = nullptr;
    const int32_t rc =
        hashed ? sr_create_hashed_key_table_1(tree_, p_path, columns.data(),
                                              static_cast<uint32_t>(columns.size()), mode, 4,
                                              hash_int_key, compare_int_keys, &table)
               : sr_create_table_1(tree_, p_path, columns.data(),
                                   static_cast<uint32_t>(columns.size()), mode, &table);
    EXPECT_EQ(rc, 0);
    return table;
  }
  // The usual table: an int32 key and a string.
  sr_opaque_handle_t create_named(const char *p_path, int32_t mode = Explicit_Control,
                                  bool hashed = false) {
    return create(p_path,
                  {column("k", QV_INT32, SR_PRIMARY_KEY), column("name", QV_CHAR_PTR),
                   column("count", QV_INT64)},
                  mode, hashed);
  }

  static int32_t add(sr_opaque_handle_t table,
                     std::vector<std::pair<const char *, qv_value_t>> fields) {
    std::vector<const char *> names;
    std::vector<qv_value_t *> values;
    for (auto &[p_name, value] : fields) {
      names.push_back(p_name);
      values.push_back(&value);
    }
    return sr_add_row_1(table, names.data(), values.data(), static_cast<uint32_t>(names.size()));
  }
  static void add_named(sr_opaque_handle_t table, int32_t key, const char *p_name) {
    ASSERT_EQ(add(table, {{"k", int_value(key)}, {"name", text_value(p_name)}}), 0);
  }
  static void commit(sr_opaque_handle_t table) {
    ASSERT_EQ(sr_apply_1(table, 0), 0);
    ASSERT_EQ(sr_commit_1(table), 0);
  }
  static uint32_t fixed_index_of(sr_opaque_handle_t table, qv_value_t key) {
    uint32_t fixed = 0xFFFFFFFF;
    EXPECT_EQ(sr_get_fixed_row_index_for_key_1(table, key, &fixed), 0);
    return fixed;
  }
  // Deletes the row at a fixed index, through its packed place.
  static void delete_row_at(sr_opaque_handle_t table, uint32_t fixed) {
    ASSERT_LT(fixed, object(table)->maximum_rows);
    ASSERT_EQ(
        sr_delete_row_by_index_1(table, object(table)->p_rows_fixed_index[fixed].packed_index), 0);
  }
  static name_read_t read_name(sr_opaque_handle_t table, uint32_t fixed, uint32_t visible) {
    name_read_t read;
    qv_value_t value{};
    read.rc = sr_get_field_by_fixed_index_and_visibility_1(table, static_cast<int32_t>(fixed),
                                                           "name", &value, visible, &read.state);
    if (read.rc == 0) {
      read.name = value.ptr_char;
      std::free(value.ptr_char);
    }
    return read;
  }
  static sr_i_table_t *object(sr_opaque_handle_t handle) {
    return static_cast<sr_i_table_t *>(handle);
  }

  sr_opaque_handle_t tree_ = nullptr;
};

// Each failure is raised once with its own code; success clears the error.
void expect_failure(int32_t rc, int32_t code) {
  EXPECT_EQ(rc, code);
  EXPECT_EQ(last_error().first, code);
}

TEST_F(ReadRows, SingleReadsCheckRangeThenNameThenRow) {
  sr_opaque_handle_t table = create_named("/t");
  add_named(table, 1, "one");
  commit(table);
  const auto past_end = static_cast<int32_t>(object(table)->maximum_rows);
  qv_value_t value{};
  expect_failure(
      sr_get_field_by_fixed_index_and_visibility_1(table, past_end, "nope", &value, 0, nullptr),
      SR_E_NO_ROW_FOR_INDEX);
  expect_failure(sr_get_field_by_fixed_index_and_visibility_1(table, -1, "k", &value, 1, nullptr),
                 SR_E_NO_ROW_FOR_INDEX);
  expect_failure(
      sr_get_field_by_fixed_index_and_visibility_1(table, past_end - 1, "nope", &value, 0, nullptr),
      SR_E_INVALID_COLUMN);
  expect_failure(
      sr_get_field_by_fixed_index_and_visibility_1(table, past_end - 1, "k", &value, 0, nullptr),
      SR_E_ROW_DELETED);
  expect_failure(sr_get_field_by_index_1(table, 1, "k", &value), SR_E_NO_ROW_FOR_INDEX);
  expect_failure(sr_get_field_by_index_and_visibility_1(table, INT32_MIN, "k", &value, 1, nullptr),
                 SR_E_NO_ROW_FOR_INDEX);
  // The key is looked up before the name.
  expect_failure(sr_get_field_by_key_1(table, int_value(9), "nope", &value), SR_E_NO_ROW_FOR_KEY);
  expect_failure(sr_get_field_by_key_1(table, int_value(1), "nope", &value), SR_E_INVALID_COLUMN);
  ASSERT_EQ(sr_get_field_by_index_1(table, 0, "k", &value), 0);
  EXPECT_EQ(value.val_int32, 1);
  EXPECT_EQ(last_error().first, 0);

  const char *names[] = {"k"};
  qv_value_t *results[] = {&value};
  uint32_t fixed = 0;
  const int32_t null_handle_codes[] = {
      sr_get_field_by_index_1(nullptr, 0, "k", &value),
      sr_get_field_by_index_and_visibility_1(nullptr, 0, "k", &value, 0, nullptr),
      sr_get_field_by_fixed_index_and_visibility_1(nullptr, 0, "k", &value, 0, nullptr),
      sr_get_field_by_key_1(nullptr, int_value(1), "k", &value),
      sr_get_field_by_key_and_visibility_1(nullptr, int_value(1), "k", &value, 0, nullptr),
      sr_get_fields_by_index_1(nullptr, 0, names, results, 1),
      sr_get_fields_by_index_and_visibility_1(nullptr, 0, names, results, 1, 0, nullptr),
      sr_get_fields_by_fixed_index_and_visibility_1(nullptr, 0, names, results, 1, 0, nullptr),
      sr_get_fields_by_key_1(nullptr, int_value(1), names, results, 1),
      sr_get_fields_by_key_and_visibility_1(nullptr, int_value(1), names, results, 1, 0, nullptr),
      sr_get_fixed_row_index_for_key_1(nullptr, int_value(1), &fixed),
      sr_get_fixed_row_index_for_key_1(nullptr, int_value(1), nullptr)};
  for (const int32_t rc : null_handle_codes) {
    EXPECT_EQ(rc, SR_E_INVALID_HANDLE);
  }
  expect_failure(sr_get_fixed_row_index_for_key_1(table, int_value(1), nullptr), SR_E_NULL_POINTER);
}

TEST_F(ReadRows, SeveralValuesCheckTheRowBeforeTheNamesAndKeepWhatWasRead) {
  sr_opaque_handle_t table = create_named("/t");
  ASSERT_EQ(add(table, {{"k", int_value(1)}, {"name", text_value("one")}, {"count", {}}}), 0);
  commit(table);
  const auto past_end = static_cast<int32_t>(object(table)->maximum_rows);
  const char *names[] = {"name", "k", "nope", "count"};
  qv_value_t name{}, key{}, unknown{}, count{};
  count.val_int64 = 77;
  qv_value_t *results[] = {&name, &key, &unknown, &count};
  sr_row_state_t state = No_State_Stored;
  expect_failure(
      sr_get_fields_by_fixed_index_and_visibility_1(table, past_end, names, results, 4, 0, &state),
      SR_E_NO_ROW_FOR_INDEX);
  expect_failure(sr_get_fields_by_fixed_index_and_visibility_1(table, past_end - 1, names, results,
                                                               4, 0, &state),
                 SR_E_ROW_DELETED);
  expect_failure(
      sr_get_fields_by_key_and_visibility_1(table, int_value(1), names, results, 4, 0, &state),
      SR_E_INVALID_COLUMN);
  ASSERT_NE(name.ptr_char, nullptr);
  EXPECT_STREQ(name.ptr_char, "one");
  std::free(name.ptr_char);
  EXPECT_EQ(key.val_int32, 1);
  EXPECT_EQ(count.val_int64, 77);  // after the unknown name: not read
  EXPECT_EQ(state, No_State_Stored);

  ASSERT_EQ(sr_get_fields_by_key_and_visibility_1(table, int_value(1), names + 1, results + 1, 1, 0,
                                                  &state),
            0);
  EXPECT_EQ(state, SR_ROW_STATE_COMMITTED);
  expect_failure(sr_get_fields_by_index_1(table, 1, names, results, 4), SR_E_NO_ROW_FOR_INDEX);
  expect_failure(sr_get_fields_by_key_1(table, int_value(2), names, results, 4),
                 SR_E_NO_ROW_FOR_KEY);
}

TEST_F(ReadRows, EachViewReadsItsOwnRecordAndEveryReadReportsTheRowState) {
  sr_opaque_handle_t table = create_named("/t");
  add_named(table, 1, "one");
  add_named(table, 2, "two");
  commit(table);
  const uint32_t updated = fixed_index_of(table, int_value(1));
  const uint32_t deleted = fixed_index_of(table, int_value(2));
  const qv_value_t uno = text_value("uno");
  ASSERT_EQ(sr_set_field_by_key_1(table, int_value(1), "name", &uno), 0);
  delete_row_at(table, deleted);
  add_named(table, 3, "three");
  const uint32_t added = fixed_index_of(table, int_value(3));
  add_named(table, 4, "four");
  const uint32_t gone = fixed_index_of(table, int_value(4));
  delete_row_at(table, gone);

  name_read_t read = read_name(table, updated, 0);
  EXPECT_EQ(read.rc, 0);
  EXPECT_EQ(read.name, "one");
  EXPECT_EQ(read.state, SR_ROW_STATE_UPDATED);
  read = read_name(table, updated, 1);
  EXPECT_EQ(read.name, "uno");
  EXPECT_EQ(read.state, SR_ROW_STATE_UPDATED);

  read = read_name(table, deleted, 0);
  EXPECT_EQ(read.name, "two");
  EXPECT_EQ(read.state, SR_ROW_STATE_DELETED);
  read = read_name(table, deleted, 1);
  EXPECT_EQ(read.rc, SR_E_ROW_DELETED);
  EXPECT_EQ(read.state, No_State_Stored);

  EXPECT_EQ(read_name(table, added, 0).rc, SR_E_ROW_DELETED);
  read = read_name(table, added, 1);
  EXPECT_EQ(read.name, "three");
  EXPECT_EQ(read.state, SR_ROW_STATE_ADDED);
  // The packed index counts the applied rows, so a plain read reaches the
  // added row and finds nothing committed there.
  qv_value_t value{};
  expect_failure(sr_get_field_by_index_1(table, 2, "k", &value), SR_E_ROW_DELETED);

  // A row added and deleted again before apply has no record in either view
  // (its state would be "no row", which therefore no read can report).
  EXPECT_EQ(read_name(table, gone, 0).rc, SR_E_ROW_DELETED);
  read = read_name(table, gone, 1);
  EXPECT_EQ(read.rc, SR_E_ROW_DELETED);
  EXPECT_EQ(read.state, No_State_Stored);
  uint32_t fixed = 0;
  expect_failure(sr_get_fixed_row_index_for_key_1(table, int_value(4), &fixed),
                 SR_E_NO_ROW_FOR_KEY);

  commit(table);
  read = read_name(table, updated, 0);
  EXPECT_EQ(read.name, "uno");
  EXPECT_EQ(read.state, SR_ROW_STATE_COMMITTED);
  EXPECT_EQ(read_name(table, added, 0).state, SR_ROW_STATE_COMMITTED);
  EXPECT_EQ(read_name(table, deleted, 1).rc, SR_E_ROW_DELETED);
}

TEST_F(ReadRows, TheTableSettingOrTheCallerShowsUncommittedUpdates) {
  setenv("SR_UNCOMMITTED_UPDATES_VISIBLE", "1", 1);
  sr_opaque_handle_t shown = create_named("/shown");
  unsetenv("SR_UNCOMMITTED_UPDATES_VISIBLE");
  sr_opaque_handle_t hidden = create_named("/hidden");
  sr_opaque_handle_t implicit = create_named("/implicit", 0);
  for (sr_opaque_handle_t table : {shown, hidden, implicit}) {
    add_named(table, 1, "one");
  }
  qv_value_t value{};
  ASSERT_EQ(sr_get_field_by_key_1(shown, int_value(1), "name", &value), 0);
  EXPECT_STREQ(value.ptr_char, "one");
  std::free(value.ptr_char);
  EXPECT_EQ(read_name(shown, fixed_index_of(shown, int_value(1)), 0).state, SR_ROW_STATE_ADDED);
  expect_failure(sr_get_field_by_key_1(hidden, int_value(1), "name", &value), SR_E_ROW_DELETED);
  ASSERT_EQ(sr_get_field_by_key_and_visibility_1(hidden, int_value(1), "k", &value, 1, nullptr), 0);
  EXPECT_EQ(value.val_int32, 1);
  // An implicitly controlled table has committed the row already.
  EXPECT_EQ(read_name(implicit, fixed_index_of(implicit, int_value(1)), 0).state,
            SR_ROW_STATE_COMMITTED);
}

TEST_F(ReadRows, HashedAndScannedTablesFindTheSameRows) {
  sr_opaque_handle_t scanned = create_named("/scanned");
  sr_opaque_handle_t hashed = create_named("/hashed", Explicit_Control, true);
  const int32_t keys[] = {5, -3, 12, 0, 9};
  for (sr_opaque_handle_t table : {scanned, hashed}) {
    for (const int32_t key : keys) {
      add_named(table, key, std::to_string(key).c_str());
    }
    commit(table);
    ASSERT_EQ(sr_delete_row_by_index_1(table, 4), 0);  // key 9, pending
  }
  for (const int32_t key : keys) {
    const uint32_t fixed = fixed_index_of(scanned, int_value(key));
    EXPECT_EQ(fixed_index_of(hashed, int_value(key)), fixed);
    EXPECT_EQ(read_name(scanned, fixed, 0).name, std::to_string(key));
  }
  // The deleted row is found; reading its applied view fails.
  qv_value_t value{};
  for (sr_opaque_handle_t table : {scanned, hashed}) {
    expect_failure(
        sr_get_field_by_key_and_visibility_1(table, int_value(9), "k", &value, 1, nullptr),
        SR_E_ROW_DELETED);
    commit(table);
    uint32_t fixed = 0;
    expect_failure(sr_get_fixed_row_index_for_key_1(table, int_value(9), &fixed),
                   SR_E_NO_ROW_FOR_KEY);
    expect_failure(sr_get_fixed_row_index_for_key_1(table, int_value(7), &fixed),
                   SR_E_NO_ROW_FOR_KEY);
  }

  // Without a hash table a pending change of the key does not move the row.
  const qv_value_t fifty = int_value(50);
  ASSERT_EQ(sr_set_field_by_key_1(scanned, int_value(5), "k", &fifty), 0);
  EXPECT_EQ(fixed_index_of(scanned, int_value(5)), fixed_index_of(hashed, int_value(5)));
  uint32_t fixed = 0;
  EXPECT_EQ(sr_get_fixed_row_index_for_key_1(scanned, int_value(50), &fixed), SR_E_NO_ROW_FOR_KEY);
}

TEST_F(ReadRows, ResourceHandleAndStringKeysIncludingNullPointers) {
  sr_opaque_handle_t handles =
      create("/handles", {column("k", QV_RSRC_HANDLE_PTR, SR_PRIMARY_KEY)});
  sr_opaque_handle_t strings = create("/strings", {column("k", QV_CHAR_PTR, SR_PRIMARY_KEY)});
  // Same bucket of the built-in hash: they differ only in id1.
  qv_resource_handle_t first{0x00010002, {1, 2, 3, 4}}, second{0x00010002, {9, 2, 3, 4}};
  qv_value_t key{};
  for (qv_resource_handle_t *p_handle :
       {&first, &second, static_cast<qv_resource_handle_t *>(nullptr)}) {
    key.ptr_rsrc_handle = p_handle;
    ASSERT_EQ(add(handles, {{"k", key}}), 0);
  }
  for (const char *p_text : {"alpha", static_cast<const char *>(nullptr)}) {
    ASSERT_EQ(add(strings, {{"k", text_value(p_text)}}), 0);
  }
  commit(handles);
  commit(strings);
  const qv_resource_handle_t *expected[] = {&first, &second, cu_ptr_invld_rsrc_hndl_1};
  for (uint32_t row = 0; row < 3; ++row) {
    key.ptr_rsrc_handle = row < 2 ? const_cast<qv_resource_handle_t *>(expected[row]) : nullptr;
    qv_value_t stored{};
    ASSERT_EQ(sr_get_field_by_key_1(handles, key, "k", &stored), 0);
    EXPECT_EQ(cu_rsrc_hndl_cmp_1(stored.ptr_rsrc_handle, expected[row]), 0);
    std::free(stored.ptr_rsrc_handle);
  }
  // A null string is stored, and found, as "".
  qv_value_t stored{};
  ASSERT_EQ(sr_get_field_by_key_1(strings, text_value(""), "k", &stored), 0);
  EXPECT_STREQ(stored.ptr_char, "");
  std::free(stored.ptr_char);
  EXPECT_EQ(fixed_index_of(strings, text_value(nullptr)), fixed_index_of(strings, text_value("")));
}

TEST_F(ReadRows, AMissingKeyIsNamedWithItsTableInTheMessage) {
  sr_opaque_handle_t table = create_named("/cfg/t");
  sr_opaque_handle_t strings = create("/cfg/s", {column("k", QV_CHAR_PTR, SR_PRIMARY_KEY)});
  const char *names[] = {"k"};
  qv_value_t value{};
  qv_value_t *results[] = {&value};
  EXPECT_EQ(sr_get_fields_by_key_1(table, int_value(-42), names, results, 1), SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(last_error(),
            std::make_pair(SR_E_NO_ROW_FOR_KEY,
                           std::string("2605-213 There is no row corresponding to the specified "
                                       "key value (-42) in table (/cfg/t).\n")));
  EXPECT_EQ(sr_get_field_by_key_1(strings, text_value("absent"), "k", &value), SR_E_NO_ROW_FOR_KEY);
  EXPECT_NE(last_error().second.find("(absent) in table (/cfg/s)"), std::string::npos);

  // A table without a name (a selection result) is named as unknown.
  char *p_name = object(table)->p_name;
  object(table)->p_name = nullptr;
  EXPECT_EQ(sr_get_field_by_key_1(table, int_value(3), "k", &value), SR_E_NO_ROW_FOR_KEY);
  object(table)->p_name = p_name;
  EXPECT_NE(last_error().second.find("(3) in table ((UNKNOWN_TABLE_NAME))"), std::string::npos);
}

TEST_F(ReadRows, ANaNKeyMatchesTheFirstRowScanned) {
  sr_opaque_handle_t table = create("/floats", {column("k", QV_FLOAT64, SR_PRIMARY_KEY)});
  ASSERT_EQ(add(table, {{"k", float_value(2.5)}}), 0);
  ASSERT_EQ(add(table, {{"k", float_value(1.5)}}), 0);
  commit(table);
  const uint32_t first = object(table)->p_rows_packed_index[0];
  EXPECT_EQ(fixed_index_of(table, float_value(std::nan(""))), first);
  EXPECT_NE(fixed_index_of(table, float_value(1.5)), first);
  uint32_t fixed = 0;
  EXPECT_EQ(sr_get_fixed_row_index_for_key_1(table, float_value(3.25), &fixed),
            SR_E_NO_ROW_FOR_KEY);
  EXPECT_NE(last_error().second.find("(3.25)"), std::string::npos);
}

TEST_F(ReadRows, BinaryKeysAreNeverFoundByScanning) {
  // Binary keys come only from tables written elsewhere; this table is
  // retyped in memory after its row was added to get one.
  sr_opaque_handle_t table = create("/binary", {column("k", QV_INT32, SR_PRIMARY_KEY)});
  ASSERT_EQ(add(table, {{"k", int_value(0)}}), 0);
  commit(table);
  object(table)->p_columns[0].type = QV_BINARY_PTR;
  qv_binary_t empty{};
  qv_value_t key{};
  key.ptr_binary = &empty;
  uint32_t fixed = 0;
  EXPECT_EQ(sr_get_fixed_row_index_for_key_1(table, key, &fixed), SR_E_NO_ROW_FOR_KEY);
  EXPECT_NE(last_error().second.find("(***UNKNOWN KEY TYPE****)"), std::string::npos);
  object(table)->p_columns[0].type = QV_INT32;
}

TEST_F(ReadRows, VariableLengthValuesAreTheCallersOwnBlocks) {
  std::vector<sr_column_t> columns = {column("k", QV_INT32, SR_PRIMARY_KEY),
                                      column("name", QV_CHAR_PTR),
                                      column("list", QV_INT32_ARRAY),
                                      column("words", QV_CHAR_PTR_ARRAY),
                                      column("blob", QV_BINARY_PTR),
                                      column("big", QV_UINT64),
                                      column("ratio", QV_FLOAT32)};
  columns[1].default_value.ptr_char = const_cast<char *>("none");
  sr_opaque_handle_t table = create("/values", columns);

  auto *p_list =
      static_cast<qv_array_t *>(std::malloc(sizeof(qv_array_t) + 3 * sizeof(qv_value_t)));
  p_list->element_count = 3;
  p_list->elements[0].val_int32 = -1;
  p_list->elements[1].val_int32 = 0;
  p_list->elements[2].val_int32 = 65536;
  auto *p_words =
      static_cast<qv_array_t *>(std::malloc(sizeof(qv_array_t) + 2 * sizeof(qv_value_t)));
  p_words->element_count = 2;
  p_words->elements[0].ptr_char = const_cast<char *>("red");
  p_words->elements[1].ptr_char = const_cast<char *>("green");
  auto *p_blob = static_cast<qv_binary_t *>(std::malloc(sizeof(qv_binary_t) + 3));
  p_blob->length = 3;
  std::memcpy(p_blob->data, "\0\1\2", 3);
  qv_value_t list{}, words{}, blob{}, big{}, ratio{};
  list.ptr_array = p_list;
  words.ptr_array = p_words;
  blob.ptr_binary = p_blob;
  big.val_uint64 = UINT64_MAX - 1;
  ratio.val_float32 = -0.25f;
  ASSERT_EQ(add(table, {{"k", int_value(1)},
                        {"name", text_value("full")},
                        {"list", list},
                        {"words", words},
                        {"blob", blob},
                        {"big", big},
                        {"ratio", ratio}}),
            0);
  std::free(p_list);
  std::free(p_words);
  std::free(p_blob);
  ASSERT_EQ(add(table, {{"k", int_value(2)}}), 0);
  commit(table);

  const char *names[] = {"ratio", "big", "blob", "words", "list", "name"};
  qv_value_t values[6];
  qv_value_t *results[] = {&values[0], &values[1], &values[2], &values[3], &values[4], &values[5]};
  ASSERT_EQ(sr_get_fields_by_key_1(table, int_value(1), names, results, 6), 0);
  EXPECT_EQ(values[0].val_float32, -0.25f);
  EXPECT_EQ(values[1].val_uint64, UINT64_MAX - 1);
  ASSERT_EQ(values[2].ptr_binary->length, 3u);
  EXPECT_EQ(std::memcmp(values[2].ptr_binary->data, "\0\1\2", 3), 0);
  ASSERT_EQ(values[3].ptr_array->element_count, 2u);
  EXPECT_STREQ(values[3].ptr_array->elements[1].ptr_char, "green");
  ASSERT_EQ(values[4].ptr_array->element_count, 3u);
  EXPECT_EQ(values[4].ptr_array->elements[2].val_int32, 65536);
  EXPECT_STREQ(values[5].ptr_char, "full");
  // A second read hands out new blocks.
  qv_value_t again{};
  ASSERT_EQ(sr_get_field_by_index_1(table, 0, "name", &again), 0);
  EXPECT_NE(again.ptr_char, values[5].ptr_char);
  std::free(again.ptr_char);
  for (uint32_t at = 2; at < 6; ++at) {
    std::free(values[at].ptr_char);
  }

  // The row added with its key only reads its defaults.
  ASSERT_EQ(sr_get_fields_by_key_1(table, int_value(2), names + 2, results + 2, 4), 0);
  EXPECT_EQ(values[2].ptr_binary->length, 0u);
  EXPECT_EQ(values[3].ptr_array->element_count, 0u);
  EXPECT_EQ(values[4].ptr_array->element_count, 0u);
  EXPECT_STREQ(values[5].ptr_char, "none");
  for (uint32_t at = 2; at < 6; ++at) {
    std::free(values[at].ptr_char);
  }
}

}  // namespace
