// sr_row_test_support.h - what the row and transaction tests share: a tree
// with helpers to create tables and to add, read and count rows through the
// exported calls.

#ifndef SR_ROW_TEST_SUPPORT_H
#define SR_ROW_TEST_SUPPORT_H

#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "qv_sr.h"
#include "sr_i_table.h"

namespace sr_test {

inline sr_column_t column(const char *p_name, qv_data_type_t type, uint32_t qualifier) {
  sr_column_t definition{};
  definition.name = const_cast<char *>(p_name);
  definition.type = type;
  definition.qualifier = static_cast<sr_qualifier_t>(qualifier);
  return definition;
}

inline qv_value_t int32_value(int32_t number) {
  qv_value_t value{};
  value.val_int32 = number;
  return value;
}

inline qv_value_t string_value(const char *p_text) {
  qv_value_t value{};
  value.ptr_char = const_cast<char *>(p_text);
  return value;
}

inline sr_i_table_t *object(sr_opaque_handle_t handle) {
  return static_cast<sr_i_table_t *>(handle);
}

// Create modes: implicitly controlled (0) or explicitly controlled (4).
inline constexpr int32_t Implicit = 0;
inline constexpr int32_t Explicit = 4;

class RowTables : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(sr_open_tree_1(&tree_, 0, 0), 0); }
  void TearDown() override { EXPECT_EQ(sr_close_tree_1(tree_), 0); }

  // A table keyed by the string "name", with an int32 "count" (default 7)
  // and a string "note" (default "none").
  sr_opaque_handle_t create_named_counts(const char *p_path, int32_t mode,
                                         uint32_t key_qualifier = SR_PRIMARY_KEY) {
    std::vector<sr_column_t> columns = {column("name", QV_CHAR_PTR, key_qualifier),
                                        column("count", QV_INT32, SR_STANDARD),
                                        column("note", QV_CHAR_PTR, SR_STANDARD)};
    columns[1].default_value.val_int32 = 7;
    columns[2].default_value.ptr_char = const_cast<char *>("none");
    sr_opaque_handle_t table = nullptr;
    EXPECT_EQ(sr_create_table_1(tree_, p_path, columns.data(), 3, mode, &table), 0);
    return table;
  }

  // A table keyed by the int32 "id", with an int32 "count" (default 7).
  sr_opaque_handle_t create_numbered(const char *p_path, int32_t mode) {
    std::vector<sr_column_t> columns = {column("id", QV_INT32, SR_PRIMARY_KEY),
                                        column("count", QV_INT32, SR_STANDARD)};
    columns[1].default_value.val_int32 = 7;
    sr_opaque_handle_t table = nullptr;
    EXPECT_EQ(sr_create_table_1(tree_, p_path, columns.data(), 2, mode, &table), 0);
    return table;
  }

  static int32_t add_named(sr_opaque_handle_t table, const char *p_name, int32_t count) {
    qv_value_t name = string_value(p_name);
    qv_value_t number = int32_value(count);
    const char *names[] = {"name", "count"};
    qv_value_t *values[] = {&name, &number};
    return sr_add_row_1(table, names, values, 2);
  }

  static int32_t add_numbered(sr_opaque_handle_t table, int32_t id, int32_t count) {
    qv_value_t key = int32_value(id);
    qv_value_t number = int32_value(count);
    const char *names[] = {"id", "count"};
    qv_value_t *values[] = {&key, &number};
    return sr_add_row_1(table, names, values, 2);
  }

  // The "count" of the row with string key `p_name`, in the applied view
  // (`uncommitted` 1) or the committed one; -1 when the read fails.
  static int32_t count_of(sr_opaque_handle_t table, const char *p_name, uint32_t uncommitted) {
    qv_value_t result{};
    const int32_t rc = sr_get_field_by_key_and_visibility_1(table, string_value(p_name), "count",
                                                            &result, uncommitted, nullptr);
    return rc == 0 ? result.val_int32 : -1;
  }

  static std::string string_at_fixed(sr_opaque_handle_t table, uint32_t fixed, const char *p_column,
                                     uint32_t uncommitted) {
    qv_value_t result{};
    if (sr_get_field_by_fixed_index_and_visibility_1(table, static_cast<int32_t>(fixed), p_column,
                                                     &result, uncommitted, nullptr) != 0) {
      return "<error>";
    }
    std::string text = result.ptr_char;
    std::free(result.ptr_char);
    return text;
  }

  static sr_row_state_t state_of(sr_opaque_handle_t table, uint32_t fixed) {
    qv_value_t result{};
    sr_row_state_t state = SR_ROW_STATE_NO_ROW;
    const int32_t rc = sr_get_field_by_fixed_index_and_visibility_1(
        table, static_cast<int32_t>(fixed), "count", &result, 1, &state);
    if (rc == SR_E_ROW_DELETED) {
      // No applied record: the committed view tells a deleted row from none.
      return sr_get_field_by_fixed_index_and_visibility_1(table, static_cast<int32_t>(fixed),
                                                          "count", &result, 0, &state) == 0
                 ? state
                 : SR_ROW_STATE_NO_ROW;
    }
    return state;
  }

  static uint32_t fixed_index_of(sr_opaque_handle_t table, const char *p_name) {
    uint32_t fixed = 0xFFFFFFFFu;
    EXPECT_EQ(sr_get_fixed_row_index_for_key_1(table, string_value(p_name), &fixed), 0);
    return fixed;
  }

  sr_opaque_handle_t tree_ = nullptr;
};

}  // namespace sr_test

#endif  // SR_ROW_TEST_SUPPORT_H
