// sr_x_set_fields.cpp - sr_set_fields_by_index_1,
// sr_set_fields_by_fixed_index_1 and sr_set_fields_by_key_1: set several
// values of one row in one pending change (committed at once on an
// implicitly controlled table). The work is in sr_i_set_values.cpp; the
// table's lock, mode check and implicit commit in sr_i_change_table.

#include "frame/sr_i_frame.h"
#include "rows/sr_i_row_operations.h"
#include "rows/sr_i_transaction.h"

namespace {
constexpr sr_i_entry_point_t Set_Fields_By_Index{101, true};
constexpr sr_i_entry_point_t Set_Fields_By_Fixed_Index{99, true};
constexpr sr_i_entry_point_t Set_Fields_By_Key{103, true};
}  // namespace

extern "C" int32_t sr_set_fields_by_index_1(sr_opaque_handle_t table_handle, int32_t row_index,
                                            const char *const *column_names,
                                            qv_value_t *const *new_fields, uint32_t array_count) {
  return sr_i_run_entry_point(Set_Fields_By_Index, [&]() -> int32_t {
    return sr_i_change_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_set_values_for_packed_index(p_table, static_cast<uint32_t>(row_index),
                                              column_names, new_fields, array_count);
    });
  });
}

extern "C" int32_t sr_set_fields_by_fixed_index_1(sr_opaque_handle_t table_handle,
                                                  int32_t fixed_row_index,
                                                  const char *const *column_names,
                                                  qv_value_t *const *new_fields,
                                                  uint32_t array_count) {
  return sr_i_run_entry_point(Set_Fields_By_Fixed_Index, [&]() -> int32_t {
    return sr_i_change_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_set_values_for_fixed_index(p_table, static_cast<uint32_t>(fixed_row_index),
                                             column_names, new_fields, array_count);
    });
  });
}

extern "C" int32_t sr_set_fields_by_key_1(sr_opaque_handle_t table_handle, qv_value_t row_key,
                                          const char *const *column_names,
                                          qv_value_t *const *new_values, uint32_t array_count) {
  return sr_i_run_entry_point(Set_Fields_By_Key, [&]() -> int32_t {
    return sr_i_change_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_set_values_for_key(p_table, row_key, column_names, new_values, array_count);
    });
  });
}
