// sr_x_delete_columns.cpp - sr_delete_columns_1: the table without the
// named columns; the key column stays.

#include "frame/sr_i_frame.h"
#include "schema/sr_i_schema_changes.h"

namespace {

constexpr sr_i_entry_point_t Delete_Columns{27, true};

}  // namespace

extern "C" int32_t sr_delete_columns_1(sr_opaque_handle_t table_handle,
                                       const char *const *column_names, uint32_t array_count) {
  return sr_i_run_entry_point(Delete_Columns, [&]() -> int32_t {
    return sr_i_rebuild_table(table_handle, [&](sr_i_table_t *p_table, sr_i_table_t **pp_new) {
      return sr_i_delete_columns(p_table, column_names, array_count, pp_new);
    });
  });
}
