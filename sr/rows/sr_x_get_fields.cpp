// sr_x_get_fields.cpp - the exported calls that read several values of one
// row at once, named by packed index, fixed index or key. Readers share the
// table's read lock with each other and change nothing; the plain forms read
// the view the table was opened with and report no row state.

#include "frame/sr_i_frame.h"
#include "rows/sr_i_row_operations.h"
#include "rows/sr_i_transaction.h"

namespace {
constexpr sr_i_entry_point_t Get_Fields_By_Index{55, false};
constexpr sr_i_entry_point_t Get_Fields_By_Index_And_Visibility{57, false};
constexpr sr_i_entry_point_t Get_Fields_By_Fixed_Index_And_Visibility{53, false};
constexpr sr_i_entry_point_t Get_Fields_By_Key{59, false};
constexpr sr_i_entry_point_t Get_Fields_By_Key_And_Visibility{61, false};
}  // namespace

// Indexes cross the interface signed; a negative one is out of range, as the
// unsigned value it becomes is past every row.
extern "C" int32_t sr_get_fields_by_index_1(sr_opaque_handle_t table_handle, int32_t row_index,
                                            const char *const *column_names,
                                            qv_value_t *const *result, uint32_t array_count) {
  return sr_i_run_entry_point(Get_Fields_By_Index, [&]() -> int32_t {
    return sr_i_read_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_get_values_for_packed_index(p_table, static_cast<uint32_t>(row_index),
                                              column_names, result, array_count, 0, nullptr);
    });
  });
}

extern "C" int32_t sr_get_fields_by_index_and_visibility_1(
    sr_opaque_handle_t table_handle, int32_t row_index, const char *const *column_names,
    qv_value_t *const *result, uint32_t array_count, uint32_t uncommitted_updates_visible,
    sr_row_state_t *p_row_state) {
  return sr_i_run_entry_point(Get_Fields_By_Index_And_Visibility, [&]() -> int32_t {
    return sr_i_read_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_get_values_for_packed_index(p_table, static_cast<uint32_t>(row_index),
                                              column_names, result, array_count,
                                              uncommitted_updates_visible, p_row_state);
    });
  });
}

extern "C" int32_t sr_get_fields_by_fixed_index_and_visibility_1(
    sr_opaque_handle_t table_handle, int32_t fixed_row_index, const char *const *column_names,
    qv_value_t *const *result, uint32_t array_count, uint32_t uncommitted_updates_visible,
    sr_row_state_t *p_row_state) {
  return sr_i_run_entry_point(Get_Fields_By_Fixed_Index_And_Visibility, [&]() -> int32_t {
    return sr_i_read_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_get_values_for_fixed_index(p_table, static_cast<uint32_t>(fixed_row_index),
                                             column_names, result, array_count,
                                             uncommitted_updates_visible, p_row_state);
    });
  });
}

extern "C" int32_t sr_get_fields_by_key_1(sr_opaque_handle_t table_handle, qv_value_t row_key,
                                          const char *const *column_names,
                                          qv_value_t *const *result, uint32_t array_count) {
  return sr_i_run_entry_point(Get_Fields_By_Key, [&]() -> int32_t {
    return sr_i_read_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_get_values_for_key(p_table, row_key, column_names, result, array_count, 0,
                                     nullptr);
    });
  });
}

extern "C" int32_t sr_get_fields_by_key_and_visibility_1(
    sr_opaque_handle_t table_handle, qv_value_t row_key, const char *const *column_names,
    qv_value_t *const *result, uint32_t array_count, uint32_t uncommitted_updates_visible,
    sr_row_state_t *p_row_state) {
  return sr_i_run_entry_point(Get_Fields_By_Key_And_Visibility, [&]() -> int32_t {
    return sr_i_read_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_get_values_for_key(p_table, row_key, column_names, result, array_count,
                                     uncommitted_updates_visible, p_row_state);
    });
  });
}
