// sr_x_set_field.cpp - sr_set_field_by_index_1, sr_set_field_by_fixed_index_1
// and sr_set_field_by_key_1: set one value of one row as a pending change
// (committed at once on an implicitly controlled table). The work is in
// sr_i_set_values.cpp; the table's lock, mode check and implicit commit in
// sr_i_change_table.

#include "frame/sr_i_frame.h"
#include "rows/sr_i_row_operations.h"
#include "rows/sr_i_transaction.h"

namespace {
constexpr sr_i_entry_point_t Set_Field_By_Index{95, true};
constexpr sr_i_entry_point_t Set_Field_By_Fixed_Index{93, true};
constexpr sr_i_entry_point_t Set_Field_By_Key{97, true};
}  // namespace

extern "C" int32_t sr_set_field_by_index_1(sr_opaque_handle_t table_handle, int32_t row_index,
                                           const char *column_name, const qv_value_t *new_field) {
  return sr_i_run_entry_point(Set_Field_By_Index, [&]() -> int32_t {
    return sr_i_change_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_set_value_for_packed_index(p_table, static_cast<uint32_t>(row_index), column_name,
                                             new_field);
    });
  });
}

extern "C" int32_t sr_set_field_by_fixed_index_1(sr_opaque_handle_t table_handle,
                                                 int32_t fixed_row_index, const char *column_name,
                                                 const qv_value_t *new_field) {
  return sr_i_run_entry_point(Set_Field_By_Fixed_Index, [&]() -> int32_t {
    return sr_i_change_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_set_value_for_fixed_index(p_table, static_cast<uint32_t>(fixed_row_index),
                                            column_name, new_field);
    });
  });
}

extern "C" int32_t sr_set_field_by_key_1(sr_opaque_handle_t table_handle, qv_value_t row_key,
                                         const char *column_name, const qv_value_t *new_field) {
  return sr_i_run_entry_point(Set_Field_By_Key, [&]() -> int32_t {
    return sr_i_change_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_set_value_for_key(p_table, row_key, column_name, new_field);
    });
  });
}
