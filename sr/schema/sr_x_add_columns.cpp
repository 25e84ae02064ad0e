// sr_x_add_columns.cpp - sr_add_columns_1: new columns behind the old
// ones; every row takes their defaults.

#include "frame/sr_i_frame.h"
#include "schema/sr_i_schema_changes.h"

namespace {

constexpr sr_i_entry_point_t Add_Columns{3, true};

}  // namespace

extern "C" int32_t sr_add_columns_1(sr_opaque_handle_t table_handle, sr_column_t *columns,
                                    uint32_t array_count) {
  return sr_i_run_entry_point(Add_Columns, [&]() -> int32_t {
    return sr_i_rebuild_table(table_handle, [&](sr_i_table_t *p_table, sr_i_table_t **pp_new) {
      if (columns == nullptr) {
        return sr_i_raise(SR_E_NULL_POINTER);
      }
      if (array_count == 0) {
        return sr_i_raise(SR_E_NO_COLUMNS);
      }
      return sr_i_update_metadata(p_table, columns, array_count, nullptr, nullptr, nullptr, pp_new);
    });
  });
}
